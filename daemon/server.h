// The daemon's clients: programs that connect to its Unix socket, subscribe
// to queues and read each queue's events as JSON lines.  Every socket is
// non-blocking and every client has a bounded output buffer, so no client
// can delay the event loop, another client or a stop signal.
#ifndef ZORVNOTIFYD_DAEMON_SERVER_H_
#define ZORVNOTIFYD_DAEMON_SERVER_H_

#include <sys/stat.h>
#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <list>
#include <map>
#include <string>
#include <vector>

#include "queue_log.h"
#include "unique_fd.h"

namespace zorvnotifyd {

using zorvcommon::UniqueFd;

// The socket when none is named; its directory is made when missing.
constexpr char kDefaultSocketPath[] = "/run/zorvnotifyd/zorvnotifyd.sock";

struct ServerOptions {
  std::string socket_path = kDefaultSocketPath;
  bool group_allowed = false;  // members of |group| may connect too
  gid_t group = 0;
  size_t client_buffer = 256 * 1024;  // bytes of output a client may have waiting
  size_t max_clients = 1000;          // clients served at once; others get a refusal line
};

class Server {
 public:
  // |logs| holds the records and the journal id; |run_id| changes at each
  // start, the journal id only when the journals were lost or reset (both
  // go in every reply); |status| makes the rest of the reply to a status
  // request (a JSON object's members, without braces).
  Server(ServerOptions options, QueueLogs& logs, std::string run_id,
         std::function<std::string()> status);
  ~Server();
  Server(const Server&) = delete;
  Server& operator=(const Server&) = delete;

  // Listens on the socket path, replacing a socket left there (never
  // another kind of file, nor a socket that another daemon listens on);
  // mode 0600, or 0660 with the group.  The path's directory must be root's
  // and writable by root alone, or anyone could plant a file or a socket of
  // their own there; the default directory is made when missing.  False
  // when that failed (logged).
  bool Listen();

  // The descriptor to poll (for input) in the event loop.
  int fd() const { return epoll_.get(); }
  // Handles what is ready: new connections, requests, sockets that take
  // output again, hang-ups.
  void Handle();

  // After a catalogue load: clients whose subscriptions name a queue that
  // is new (|created|) follow it from its first record.
  void FollowNew(const std::vector<QueueLog*>& created);
  // |log| has a new record: clients that follow it and have taken every
  // earlier record get it at once (written out as their buffers fill), so
  // that a client that keeps reading keeps up with a burst of events.
  void Recorded(QueueLog* log);
  // Moves new records into the clients' buffers (as far as each has room)
  // and writes what the sockets take now.
  void Deliver();
  // The periodic check, every |retry_seconds|: waits for new clients again
  // after accepting one failed (descriptors or memory ran out), should no
  // client leave to free what it holds; and listens again when the socket
  // file is no longer the one bound.
  void Tick(double retry_seconds);

  size_t clients() const { return clients_.size(); }

 private:
  struct Client;
  // The subscription request of one client line.
  struct Subscription {
    std::string name;
    bool has_type = false;
    QueueType type = ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_ETC_DIR;
    bool has_file = false;
    std::string file;
  };

  // Checks the socket's directory and binds a listening socket at the
  // path; its file's identity goes to |bound|.  An empty descriptor when
  // that failed, with |reason|.
  UniqueFd Bind(struct stat* bound, std::string* reason);
  // Serves |listener| in place of the current listener, whose waiting
  // connections are accepted first; false with |reason| when it cannot be
  // polled.
  bool Use(UniqueFd listener, std::string* reason);
  void Accept();
  // When the socket file at the path is no longer the one bound (removed or
  // replaced), listens on a new one as Listen does, keeping the clients;
  // when that fails, says so once per reason and tries again at the next
  // call (every |retry_seconds|).
  void Relisten(double retry_seconds);
  // Takes the listener out of epoll after accept() failed with |error|, so
  // that a condition that lasts cannot keep the event loop busy; logged
  // once until a client is accepted again.
  void StopAccepting(int error);
  // Puts the listener back into epoll.
  void ResumeAccepting();
  // True when the peer of |fd| may connect; |who| describes it.
  bool Allowed(int fd, std::string* who) const;
  void Read(Client& client);
  // Answers the complete request lines read so far, as far as there is room.
  void Answer(Client& client);
  // True while |client| has room in its output buffer.
  bool Room(const Client& client) const;
  void Request(Client& client, const std::string& line);
  void Subscribe(Client& client, const Subscription& subscription, bool has_since, uint64_t since,
                 std::string* reply);
  // Copies records into |client|'s buffer while it has room.
  void Fill(Client& client);
  // Writes what the socket takes; false when the client is gone.
  bool Write(Client& client);
  // Fills and writes until the socket takes no more or the client has
  // every record; false when the client is gone.
  bool Flush(Client& client);
  // |client| follows |log| from record |next| on.
  void Follow(Client& client, QueueLog* log, uint64_t next);
  void Drop(Client& client);
  // Waits for what |client| needs now: input, output or both.
  void Watch(Client& client);
  // Makes Deliver look at |client|.
  void Touch(Client& client);

  ServerOptions options_;
  QueueLogs& logs_;
  std::string run_id_;
  std::function<std::string()> status_;
  UniqueFd listener_;
  struct stat bound_ = {};        // the socket file of listener_
  std::string relisten_failure_;  // the last reason Relisten logged
  UniqueFd epoll_;
  std::list<Client> clients_;
  std::vector<Client*> dirty_;  // clients with output or records to move
  std::multimap<QueueLog*, Client*> followers_;
  bool accepting_ = true;  // the listener is in epoll
  bool starved_ = false;   // accept() failed, logged; cleared by the next client accepted
  bool full_ = false;      // at max_clients, logged; cleared when a client leaves
  size_t refused_ = 0;     // clients refused at max_clients since full_ was set
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_SERVER_H_
