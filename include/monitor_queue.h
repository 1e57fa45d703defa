// libzorvnotifyd: the catalogue of monitor queues of the zorvnotifyd daemon.
//
// A monitor queue is a named, ordered list of watch configurations.  A watch
// configuration names a directory tree, a 32-bit mask of wanted event kinds
// and a list of ignore patterns (POSIX extended regular expressions).
// Queues are stored as JSON arrays in queue files inside three fixed
// configuration directories, one per queue type:
//
//   MONITOR_QUEUE_TYPE_SHARE_DIR      /usr/zorv/share/zorvnotifyd
//   MONITOR_QUEUE_TYPE_ETC_DIR        /usr/zorv/etc/zorvnotifyd
//   MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR  /usr/local/etc/zorvnotifyd
//
// Every store operation raises the process's effective user and group ids to
// root for the time of the disk access and restores them afterwards, so the
// calling process must be root or able to become root (saved ids 0).  The
// effective ids belong to the whole process: do not run store operations in
// two threads of one process at the same time.
//
// Nothing here throws an exception of its own.  The constructors from JSON
// let the JSON library's conversion exceptions and std::bad_alloc pass.
// Failures are reported through bool results and syslog.
#ifndef ZORVNOTIFYD_MONITOR_QUEUE_H_
#define ZORVNOTIFYD_MONITOR_QUEUE_H_

#include <regex.h>

#include <set>
#include <string>
#include <vector>

#include <json/json.h>

#include "zorvnotifyd_export.h"

namespace ZORV {
namespace ZORVNOTIFYD {

// Verbosity of the library's syslog output.  The library only reads it.  When
// it is exactly 7, three extra lines are logged: a queue file that failed to
// load during a catalogue scan, and the start and stop of a worker thread.
// Initial value 3.
ZORVNOTIFYD_EXPORT extern int LOG_LEVEL;

// Queue type: selects the configuration directory of a queue file.  The
// fixed int base makes every int a valid value; any value other than 0, 1
// and 2 selects the directory of MONITOR_QUEUE_TYPE_ETC_DIR.
enum _tag_monitor_queue_type_ : int {
  MONITOR_QUEUE_TYPE_SHARE_DIR = 0,      // /usr/zorv/share/zorvnotifyd
  MONITOR_QUEUE_TYPE_ETC_DIR = 1,        // /usr/zorv/etc/zorvnotifyd
  MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR = 2,  // /usr/local/etc/zorvnotifyd
};

// One monitor queue: a name and an ordered list of watch configurations.
// Queues are plain values, identified by byte-for-byte equality of _name.
// The class declares its destructor and no move operations: wherever a
// queue would be moved it is copied, and copies carry no compiled patterns.
class ZORVNOTIFYD_EXPORT MonitorQueue {
 public:
  // One watch configuration: a directory, an event mask and ignore patterns,
  // plus a cache of the compiled patterns.  The cache is owned by exactly
  // one record: copies start without it and compile again on first use,
  // moves transfer it, and every compiled pattern is released exactly once.
  class ZORVNOTIFYD_EXPORT MonitorQueueConfig {
   public:
    // Builds a record from a JSON object with the keys "path" (string,
    // default ""), "mask" (unsigned integer, default 0) and "ignore" (array
    // of strings, default empty).  A value that is not an object yields the
    // empty record; an "ignore" that is not an array yields no patterns;
    // other keys are ignored.  A member the JSON library cannot convert
    // raises its exception, and nothing acquired so far leaks.
    MonitorQueueConfig(const Json::Value& value);  // NOLINT: implicit by design

    // Copies the path, mask and patterns; the copy is unprepared.
    MonitorQueueConfig(const MonitorQueueConfig& other);
    // Takes everything, compiled patterns included; leaves |other| with an
    // empty path, no patterns and unprepared (its mask is kept).
    MonitorQueueConfig(MonitorQueueConfig&& other) noexcept;
    // Releases this record's compiled patterns, then copies the path, mask
    // and patterns.  Self-assignment discards the compiled patterns only.
    MonitorQueueConfig& operator=(const MonitorQueueConfig& other);
    // Releases this record's compiled patterns, then takes |other|'s
    // contents as the move constructor does.
    MonitorQueueConfig& operator=(MonitorQueueConfig&& other) noexcept;
    // Releases the compiled patterns.
    ~MonitorQueueConfig();

    // Returns an object with "path", "mask" and "ignore" (always present,
    // possibly an empty array).  The compiled patterns are never written.
    Json::Value ToJson() const;

    // Compiles every pattern of _ignore with REG_EXTENDED alone and appends
    // those that compile to _regexes; the others are dropped silently.
    // Marks the record prepared.
    void PrepareRegex();

    // True when |mask| shares a bit with _mask, |path| is _path or lies
    // below it ("/" after the prefix), and no compiled ignore pattern
    // matches the whole of |path|.  Compiles the patterns on the first call
    // that gets past the mask and path tests.  Allocates nothing once the
    // record is prepared.  The patterns are those of _ignore when the record
    // was prepared: change _ignore only while it is not (a copy of it is
    // prepared afresh), since a pattern with the shape of a literal is
    // answered from its text.
    bool IsMonitoring(const std::string& path, const unsigned int& mask);

    // True when _path is |dir| itself or lies below it.  Mask and patterns
    // play no part.  Allocates nothing.
    bool IsDirMonitoring(const std::string& dir) const;

    std::string _path;               // watched directory, as supplied
    unsigned int _mask;              // wanted event kinds
    std::vector<std::string> _ignore;  // ignore patterns, as supplied
    std::vector<regex_t> _regexes;   // compiled patterns; never serialised
    bool _prepared;                  // true once PrepareRegex has run
  };

  // Builds a queue from a JSON object with the keys "queue" (string, default
  // "") and "config" (array of watch configuration objects, default empty).
  // A value that is not an object yields the empty queue; a "config" that is
  // not an array yields no configurations; every element of the array gives
  // one configuration, a non-object element an empty one.  Conversion
  // exceptions of the JSON library pass, and nothing leaks.
  MonitorQueue(const Json::Value& value);  // NOLINT: implicit by design
  // Copies the name and the configurations (without compiled patterns).
  MonitorQueue(const MonitorQueue& other);
  // Copies memberwise; no compiled pattern travels.
  MonitorQueue& operator=(const MonitorQueue& other);
  // Destroys the configurations in order, releasing their compiled patterns.
  ~MonitorQueue();

  // Returns an object with "queue" and "config" (always present).
  Json::Value ToJson() const;

  // True when some configuration, asked in order, wants an event of kinds
  // |mask| on |path|.  Stops at the first that does, so later
  // configurations stay unprepared.
  bool IsMonitoring(const std::string& path, const unsigned int& mask);
  // True when some configuration watches |dir| itself or a path below it.
  bool IsDirMonitoring(const std::string& dir) const;
  // True when some queue of |queues| watches |dir| or a path below it.
  static bool IsDirMonitoring(const std::vector<MonitorQueue>& queues, const std::string& dir);
  // The OR of the masks of the configurations whose path, followed by "/",
  // begins with |dir| followed by "/".
  unsigned int GetUnionMask(const std::string& dir) const;

  // Adds to |shares| the share prefix (the first two components of an
  // absolute path) of every configuration path that has one.
  void CollectShareSet(std::set<std::string>& shares) const;
  // The share prefixes of every configuration of every queue, sorted.
  static std::set<std::string> GetShareSet(const std::vector<MonitorQueue>& queues);

  // Returns the configuration directory of |type| (no trailing "/"),
  // creating it with mode 0700 and missing parents when it does not exist.
  // Returns the path even when creation failed (the failure is logged).
  static std::string GetConfDir(_tag_monitor_queue_type_ type);

  // Writes |queues| as one JSON array to the file at |path|, atomically,
  // and sets its mode to 0600.  True when the file was written and its mode
  // set.  When the mode cannot be set the file is removed.
  static bool SaveToFile(const std::vector<MonitorQueue>& queues, const std::string& path);
  // Appends the queues of the file at |path| to |queues|.  A missing file
  // appends nothing and succeeds.  An unreadable file, invalid JSON or a
  // top-level value that is not an array fails with |queues| unchanged; an
  // element that cannot be converted fails after the elements before it
  // were appended.
  static bool LoadFromFile(std::vector<MonitorQueue>& queues, const std::string& path);

  // Appends the queues of every regular, non-hidden file of the
  // configuration directory of |type|, in directory order.  True when the
  // directory could be listed, even if single files failed to load.
  static bool LoadAllByType(std::vector<MonitorQueue>& queues, _tag_monitor_queue_type_ type);
  // Empties |queues|, then loads the queues of types 0, 1 and 2 in that
  // order.  True only when all three types loaded.
  static bool LoadAll(std::vector<MonitorQueue>& queues);
  // Appends the queues of queue file |file| of |type| to |queues|.
  static bool List(std::vector<MonitorQueue>& queues, const std::string& file,
                   _tag_monitor_queue_type_ type);
  // Copies the first queue named |name| of queue file |file| of |type| into
  // |queue|.  False, with |queue| unchanged, when the file cannot be loaded
  // or holds no such queue.
  static bool Get(MonitorQueue& queue, const std::string& name, const std::string& file,
                  _tag_monitor_queue_type_ type);

  // Stores |queue| in queue file |file| of |type| under the store lock:
  // overwrites the first queue of the same name in place, or appends it.
  // After a successful save asks the platform to start the service
  // "zorvnotifyd" (a failed start is logged and does not change the
  // result).  True when the file was saved with the queue in it.
  static bool Upsert(const MonitorQueue& queue, const std::string& file,
                     _tag_monitor_queue_type_ type);
  // Removes the first queue named |name| from queue file |file| of |type|
  // under the store lock.  A name the file does not hold is a success
  // without any write.  After a removal, stops the service "zorvnotifyd"
  // when the whole catalogue holds no queue any more.
  static bool Delete(const std::string& name, const std::string& file,
                     _tag_monitor_queue_type_ type);

  std::string _name;                         // the queue's name
  std::vector<MonitorQueueConfig> _configs;  // its watch configurations
};

// Takes the store lock: opens (creating with mode 0644) the lock file at
// |path| close-on-exec and without following a symbolic link, and tries an
// exclusive non-blocking flock up to five times, sleeping
// (rand() % 10) * 100000 microseconds after each failure.  On return |fd|
// holds the descriptor of the last attempt (locked when the result is true)
// or a negative value when the last open failed.  Pass |fd| to Unlock
// whatever the result.
ZORVNOTIFYD_EXPORT bool Lock(int& fd, const std::string& path);
// Releases and closes a descriptor filled by Lock.  A negative |fd| is
// ignored.
ZORVNOTIFYD_EXPORT void Unlock(int fd);

}  // namespace ZORVNOTIFYD
}  // namespace ZORV

#endif  // ZORVNOTIFYD_MONITOR_QUEUE_H_
