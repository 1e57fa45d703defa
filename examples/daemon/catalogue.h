// The catalogue as the daemon needs it: every queue with the type and the
// file it came from, and a watch on the configuration directories that
// tells when it must be read again.
#ifndef ZORVNOTIFYD_EXAMPLES_DAEMON_CATALOGUE_H_
#define ZORVNOTIFYD_EXAMPLES_DAEMON_CATALOGUE_H_

#include <string>
#include <vector>

#include "monitor_queue.h"
#include "queue_types.h"
#include "unique_fd.h"
#include "watch_tree.h"

namespace zorvnotifyd {

using zorvnotifyctl::QueueType;

// One queue and where it is stored.
struct CatalogueQueue {
  QueueType type;
  std::string file;  // the queue file's name in the configuration directory of |type|
  ZORV::ZORVNOTIFYD::MonitorQueue queue;
};

using Catalogue = std::vector<CatalogueQueue>;

// Reads every queue of every type: types in the order share, etc,
// local-etc; within a type the regular files whose name does not begin
// with "." in name order; within a file the queues in file order.  A file
// that fails to load is skipped (the library logs why).
Catalogue LoadCatalogue();

// One tree per configuration of |catalogue|: its path and mask.
std::vector<WatchRoot> WatchRoots(const Catalogue& catalogue);

// A watch on the three configuration directories.
class CatalogueWatch {
 public:
  // Opens an inotify instance of its own and watches the directories
  // (created first when missing) for files written, renamed in or out, or
  // removed.  False when that failed (logged).
  bool Open();
  // The descriptor to poll.
  int fd() const { return inotify_.get(); }
  // Reads the pending events.  True when a queue file changed, events were
  // lost or a configuration directory went away (it is then made and
  // watched again); names beginning with "." (the library's temporary
  // files) do not count.
  bool ReadChanges();

 private:
  // Watches the three configuration directories, creating missing ones.
  // False when a watch could not be added (logged).
  bool WatchDirs();

  UniqueFd inotify_;
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_EXAMPLES_DAEMON_CATALOGUE_H_
