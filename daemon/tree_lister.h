// Listing a whole tree, with the status of every entry, on two threads:
// the comparison with the snapshot is mostly kernel work (a getdents64 of
// each directory and an fstatat of each entry) that a second CPU can
// share, while what it finds is compared on one thread in a fixed order.
#ifndef ZORVNOTIFYD_DAEMON_TREE_LISTER_H_
#define ZORVNOTIFYD_DAEMON_TREE_LISTER_H_

#include <sys/types.h>

#include <condition_variable>
#include <cstddef>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "snapshot.h"
#include "unique_fd.h"

namespace zorvnotifyd {

using zorvcommon::UniqueFd;

// One directory of a listed tree.
struct ListedDir {
  // False when it could not be opened or its status read, or when it is
  // one of its own ancestors (a bind mount inside itself): then nothing
  // else here is set and nothing below it was listed.
  bool listed = false;
  dev_t dev = 0;
  SnapshotListing listing;  // as ListWithStatus gives it; listing.ino its inode
  // The node of each directory among listing.entries, in their order.
  std::vector<ListedDir*> subdirs;
  const ListedDir* parent = nullptr;
};

// Lists trees on the calling thread and one worker thread, which starts
// at the first tree with two directories to list at once and is stopped
// and joined when the lister is destroyed.
class TreeLister {
 public:
  TreeLister() = default;
  // Stops and joins the worker.
  ~TreeLister();
  TreeLister(const TreeLister&) = delete;
  TreeLister& operator=(const TreeLister&) = delete;

  // Lists the open directory |root| and every directory below it, each
  // opened through its parent without following a symbolic link, and
  // returns the root's node (never null).  |between| runs on the calling
  // thread after each directory that thread lists; |beside| runs once, on
  // either thread, while the listing goes on, and is done when List
  // returns.  The nodes stay valid until the next call or the lister's end.
  ListedDir* List(UniqueFd root, const std::function<void()>& between,
                  std::function<void()> beside);

 private:
  // A directory to open and list: |name| in the directory |parent|, which
  // stays open while some of its subdirectories wait.
  struct Item {
    ListedDir* node;
    std::shared_ptr<const UniqueFd> parent;
    std::string name;
  };

  // Starts the worker, with |mutex_| held; when the system refuses a
  // thread (logged), the calling thread lists alone from then on.
  void StartWorker();
  // The worker's loop: lists what the stack holds until stopped.
  void Work();
  // Runs |beside_| or takes the next item and lists it, |lock| released
  // meanwhile; false when there was nothing to do.
  bool RunOne(std::unique_lock<std::mutex>& lock, const std::function<void()>* between);
  // Lists the open directory |dir| into |node| and stacks its
  // subdirectories.
  void ListInto(ListedDir* node, std::shared_ptr<const UniqueFd> dir);

  std::mutex mutex_;
  std::condition_variable changed_;  // work stacked, the last item done, or stop
  std::vector<Item> stack_;          // directories to list, next at the back
  std::function<void()> beside_;     // List's |beside|, until a thread takes it
  size_t busy_ = 0;                  // items being listed
  size_t waiting_ = 0;               // threads waiting on changed_
  bool stop_ = false;
  bool alone_ = false;           // the worker could not be started
  std::deque<ListedDir> nodes_;  // the current tree's, never moved
  std::thread worker_;
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_TREE_LISTER_H_
