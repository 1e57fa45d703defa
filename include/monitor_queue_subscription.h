// MonitorQueueSubscription: follows queues through the zorvnotifyd daemon's
// socket, so that a program hears what its queues want without socket code
// of its own.
//
// It keeps this contract:
//  - It trusts a socket only when its peer runs as root (SO_PEERCRED uid 0);
//    any other peer is refused before a byte of it is read.
//  - When the daemon goes away it connects again, waiting 100 ms after the
//    first failure and doubling up to 5 s, and subscribes again with the
//    sequence number of the last record it delivered for each queue (a
//    queue is its type, file and name).  It delivers no record twice: one
//    whose sequence number is not above the last delivered for its queue is
//    dropped.
//  - When the daemon's journal id differs from the one it had (the journal
//    was reset, so the numbers no longer resume), it delivers a RESCAN event
//    with an empty _path (the queue's whole trees) for each queue it
//    follows, and follows the daemon's new numbering from now on.
//  - It reads every line within a bound: a line longer than 1 MiB ends the
//    connection, which is then made again.
//  - It logs and prints nothing: failures are in results and LastError().
//    No exception leaves its members but std::bad_alloc.
//  - Once the event's strings and its own buffers have grown, Next
//    allocates nothing per event.
//  - One object is used by one thread at a time; distinct objects are
//    independent.
#ifndef ZORVNOTIFYD_MONITOR_QUEUE_SUBSCRIPTION_H_
#define ZORVNOTIFYD_MONITOR_QUEUE_SUBSCRIPTION_H_

#include <stdint.h>

#include <memory>
#include <string>

#include "monitor_queue.h"
#include "zorvnotifyd_export.h"

namespace ZORV {
namespace ZORVNOTIFYD {

// One record of a followed queue, as Next delivers it.
struct ZORVNOTIFYD_EXPORT MonitorQueueEvent {
  // EVENT: a change under the queue's trees.  LOST: the kernel's event
  // queue overflowed, events may be gone.  REMOVED / REGISTERED: the queue
  // left / came back to the catalogue.  MISSED: _missed records are no
  // longer kept.  RESCAN: look at _path again (empty: the whole trees).
  enum Kind { EVENT, LOST, REMOVED, REGISTERED, MISSED, RESCAN };
  Kind _kind;
  std::string _queue;  // the queue's name
  _tag_monitor_queue_type_ _type;
  std::string _file;  // its queue file
  uint64_t _seq;      // 0 where the daemon gives none (MISSED)
  std::string _path;  // EVENT: the path; RESCAN: what to rescan
  uint32_t _mask;     // EVENT
  bool _offline;      // EVENT: a change made while the daemon was stopped
  uint64_t _missed;   // MISSED: how many records are gone
};

// The state of a subscription; defined by the library.
struct MonitorQueueSubscriptionData;

// A connection to the daemon that follows the queues subscribed to.  Not
// copyable.  Names and paths are bytes: those that are not UTF-8 come back
// exactly as they are on disk.
class ZORVNOTIFYD_EXPORT MonitorQueueSubscription {
 public:
  // Connects at the first Subscribe, to |socket_path|.
  explicit MonitorQueueSubscription(std::string socket_path = "/run/zorvnotifyd/zorvnotifyd.sock");
  // Closes the connection and every descriptor.
  ~MonitorQueueSubscription();
  MonitorQueueSubscription(const MonitorQueueSubscription&) = delete;
  MonitorQueueSubscription& operator=(const MonitorQueueSubscription&) = delete;

  // Follows every queue named |name| (of any type and file, now and
  // registered later), from now on.  Connects first when not connected,
  // and waits up to 10 s for the daemon's reply.  False (LastError says
  // why) when it cannot connect, the peer is not root, the daemon refuses
  // the request, or after Close: the subscription is then not kept.
  bool Subscribe(const std::string& name);
  // As above, from the first record after sequence number |since| of each
  // matching queue (numbers of the journal Journal() names).
  bool Subscribe(const std::string& name, uint64_t since);
  // As above, for the one queue of |type|, |file| and |name|.
  bool Subscribe(const std::string& name, _tag_monitor_queue_type_ type, const std::string& file,
                 uint64_t since);
  // As above, for the one queue of |type|, |file| and |name|, from now on.
  bool Subscribe(const std::string& name, _tag_monitor_queue_type_ type, const std::string& file);

  // A descriptor that is readable (poll, epoll, select) whenever Next has
  // something to do without waiting: a line received or already read, an
  // event to deliver, or a reconnection due.  It may also be readable when
  // Next then finds only a line it drops.  Owned by the object; -1 when the
  // descriptor could not be made or after Close.
  int Fd() const;

  // Fills |event| with the next record of a followed queue, waiting up to
  // |timeout_ms| milliseconds (-1: without end; 0: only what is at hand),
  // connecting again as often as needed meanwhile (a reconnection waits
  // up to 10 s for the daemon's first reply, whatever |timeout_ms|).  False on a time-out
  // (LastError holds the last failure, or "timed out") or after Close
  // ("closed").  A line that is not a well-formed record is skipped, and
  // LastError names it; an {"error":..} line from the daemon sets LastError
  // too.
  bool Next(MonitorQueueEvent& event, int timeout_ms = -1);

  // The daemon's journal id (32 hexadecimal digits) as last seen; empty
  // until the daemon told one.  Store it with the last _seq delivered:
  // they resume a later subscription only while the id stays the same (a
  // program that resumes compares it after Subscribe, and rescans the
  // queue's trees when it differs).
  std::string Journal() const;

  // Ends the connection and the subscriptions for good; later calls fail
  // with "closed".
  void Close();
  // True while connected to the daemon.
  bool Connected() const;
  // What the last failure was; empty when there was none.
  const std::string& LastError() const;
  // The daemon's line that answered the last Subscribe (its reply, with the
  // queues it matched and their last numbers, or an {"error":..} line),
  // without the newline; empty when none came.
  const std::string& Reply() const;
  // The daemon's line of the record the last successful Next delivered,
  // without the newline, for a program that keeps or passes on the
  // daemon's own form; empty for a RESCAN the object made itself after a
  // journal change.
  const std::string& Line() const;

 private:
  std::unique_ptr<MonitorQueueSubscriptionData> data_;
};

}  // namespace ZORVNOTIFYD
}  // namespace ZORV

#endif  // ZORVNOTIFYD_MONITOR_QUEUE_SUBSCRIPTION_H_
