// Listing a tree on two threads.

#include "tree_lister.h"

#include <sys/stat.h>
#include <syslog.h>

#include <system_error>
#include <utility>

#include "directory.h"

namespace zorvnotifyd {

TreeLister::~TreeLister() {
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    stop_ = true;
  }
  changed_.notify_all();
  if (worker_.joinable()) worker_.join();
}

ListedDir* TreeLister::List(UniqueFd root, const std::function<void()>& between,
                            std::function<void()> beside) {
  std::unique_lock<std::mutex> lock(mutex_);
  // The worker is idle between calls: nothing refers to the nodes.
  nodes_.clear();
  ListedDir* top = &nodes_.emplace_back();
  beside_ = std::move(beside);
  lock.unlock();
  ListInto(top, std::make_shared<const UniqueFd>(std::move(root)));
  between();
  lock.lock();
  for (;;) {
    if (stack_.size() > 1 && !worker_.joinable() && !alone_) StartWorker();
    if (RunOne(lock, &between)) continue;
    if (busy_ == 0) break;
    ++waiting_;
    changed_.wait(lock);
    --waiting_;
  }
  return top;
}

void TreeLister::StartWorker() {
  try {
    worker_ = std::thread(&TreeLister::Work, this);
  } catch (const std::system_error& error) {
    alone_ = true;
    syslog(LOG_WARNING, "cannot start a thread to list the trees: %s: listing them on one",
           error.what());
  }
}

void TreeLister::Work() {
  std::unique_lock<std::mutex> lock(mutex_);
  while (!stop_) {
    if (RunOne(lock, nullptr)) continue;
    ++waiting_;
    changed_.wait(lock);
    --waiting_;
  }
}

bool TreeLister::RunOne(std::unique_lock<std::mutex>& lock, const std::function<void()>* between) {
  if (beside_) {
    const std::function<void()> beside = std::move(beside_);
    beside_ = nullptr;
    ++busy_;
    lock.unlock();
    beside();
    lock.lock();
    if (--busy_ == 0 && stack_.empty() && waiting_ > 0) changed_.notify_all();
    return true;
  }
  if (stack_.empty()) return false;
  Item item = std::move(stack_.back());
  stack_.pop_back();
  ++busy_;
  lock.unlock();
  UniqueFd dir = OpenSubdir(item.parent->get(), item.name);
  item.parent.reset();  // closed once its last subdirectory is open
  if (dir.get() >= 0) ListInto(item.node, std::make_shared<const UniqueFd>(std::move(dir)));
  if (between != nullptr) (*between)();
  lock.lock();
  // The other thread waits for more work or, on the caller's side, for the
  // last item to be done.
  if (--busy_ == 0 && stack_.empty() && waiting_ > 0) changed_.notify_all();
  return true;
}

void TreeLister::ListInto(ListedDir* node, std::shared_ptr<const UniqueFd> dir) {
  struct stat st;
  if (dir->get() < 0 || fstat(dir->get(), &st) != 0) return;
  for (const ListedDir* above = node->parent; above != nullptr; above = above->parent) {
    if (above->dev == st.st_dev && above->listing.ino == uint64_t(st.st_ino)) return;
  }
  node->dev = st.st_dev;
  node->listing.ino = st.st_ino;
  ListWithStatus(dir->get(), &node->listing);
  node->listed = true;
  size_t subdirs = 0;
  for (const SnapshotEntry& entry : node->listing.entries) subdirs += entry.is_dir ? 1 : 0;
  if (subdirs == 0) return;
  const std::lock_guard<std::mutex> lock(mutex_);
  node->subdirs.reserve(subdirs);
  for (const SnapshotEntry& entry : node->listing.entries) {
    if (!entry.is_dir) continue;
    ListedDir* child = &nodes_.emplace_back();
    child->parent = node;
    node->subdirs.push_back(child);
  }
  // Stacked last first, so that each thread takes them in name order.
  size_t next = subdirs;
  for (auto it = node->listing.entries.rbegin(); it != node->listing.entries.rend(); ++it) {
    if (it->is_dir) stack_.push_back({node->subdirs[--next], dir, it->name});
  }
  if (waiting_ > 0) changed_.notify_all();
}

}  // namespace zorvnotifyd
