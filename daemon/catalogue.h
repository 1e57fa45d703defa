// The catalogue as the daemon needs it: every queue with the type and the
// file it came from, the trees its configurations name, and a watch on the
// configuration directories that tells when it must be read again.
#ifndef ZORVNOTIFYD_DAEMON_CATALOGUE_H_
#define ZORVNOTIFYD_DAEMON_CATALOGUE_H_

#include <map>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "monitor_queue.h"
#include "queue_types.h"
#include "unique_fd.h"

namespace zorvnotifyd {

using zorvcommon::UniqueFd;

using zorvcommon::QueueType;

// One queue and where it is stored.
struct CatalogueQueue {
  // Made in place: MonitorQueue has no move, so a temporary costs a copy.
  CatalogueQueue(QueueType type, std::string file, const ZORV::ZORVNOTIFYD::MonitorQueue& queue)
      : type(type), file(std::move(file)), queue(queue) {}

  QueueType type;
  std::string file;  // the queue file's name in the configuration directory of |type|
  ZORV::ZORVNOTIFYD::MonitorQueue queue;
};

using Catalogue = std::vector<CatalogueQueue>;

// Reads the catalogue file by file and remembers, per file, its last good
// content, so that a queue file that turns malformed while the daemon runs
// does not make its queues vanish.
class CatalogueLoader {
 public:
  // Every queue of every type: types in the order share, etc, local-etc;
  // within a type the regular files whose name does not begin with "." in
  // name order; within a file the queues in file order.  A file that fails
  // to load contributes the queues of its last good load (none if it never
  // loaded); its name and why it failed are logged once, and again when it
  // loads once more.  A file that root alone does not control
  // (zorvcommon::UntrustedQueueFile) contributes no queue at all, not even
  // its last good content; its path and why are logged once, and again
  // when the reason changes.
  Catalogue Load();

  // Keeps in |catalogue| only the configurations the watcher can honour
  // (an absolute, normalised path and a mask with an event kind it
  // delivers) and returns their paths, the trees to watch.  A configuration taken out gets no
  // event; each is logged once, by queue and file, with the reason, while
  // it stays in the catalogue.
  std::vector<std::string> Honour(Catalogue* catalogue);

 private:
  using FileKey = std::pair<QueueType, std::string>;
  std::map<FileKey, std::vector<ZORV::ZORVNOTIFYD::MonitorQueue>> last_good_;
  std::map<FileKey, std::string> failing_;  // files that fail to load, and why
  std::set<std::string> skipped_;           // skipped configurations, as logged
  std::set<FileKey> backups_;               // files named like backup copies, as logged
};

// A watch on the three configuration directories.
class CatalogueWatch {
 public:
  // Opens an inotify instance of its own and watches the directories
  // (created first when missing) for files written, renamed in or out, or
  // removed.  A directory that is missing and cannot be created (a
  // read-only /usr) is logged once and left unwatched until WatchMissing
  // finds it.  False when the instance or a watch on an existing directory
  // failed (logged).
  bool Open();
  // The descriptor to poll.
  int fd() const { return inotify_.get(); }
  // Reads the pending events.  True when a queue file changed, events were
  // lost or a configuration directory went away (it is then made and
  // watched again); names beginning with "." (the library's temporary
  // files) do not count.
  bool ReadChanges();
  // Watches the directories that were missing and exist now (made by the
  // library once /usr became writable).  True when one of them is watched
  // now: the catalogue must be read again.
  bool WatchMissing();

 private:
  // Watches the three configuration directories, creating missing ones
  // and skipping those that stay missing.  False when a watch on an
  // existing directory could not be added (logged).
  bool WatchDirs();

  UniqueFd inotify_;
  std::set<std::string> missing_;  // directories missing at the last WatchDirs, as logged
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_CATALOGUE_H_
