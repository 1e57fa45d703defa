// Loading the catalogue file by file and noticing when it changes.

#include "catalogue.h"

#include <dirent.h>
#include <errno.h>
#include <string.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <syslog.h>

#include <algorithm>
#include <memory>

namespace zorvnotifyd {

using ZORV::ZORVNOTIFYD::MonitorQueue;

namespace {

// The names of the regular files (links followed) of |dir| whose name does
// not begin with ".", sorted: the files the library's catalogue reads.
std::vector<std::string> QueueFiles(const std::string& dir) {
  std::vector<std::string> names;
  std::unique_ptr<DIR, int (*)(DIR*)> handle(opendir(dir.c_str()), closedir);
  if (!handle) {
    syslog(LOG_ERR, "cannot read %s: %s", dir.c_str(), strerror(errno));
    return names;
  }
  while (const struct dirent* entry = readdir(handle.get())) {
    struct stat st;
    if (entry->d_name[0] != '.' && stat((dir + "/" + entry->d_name).c_str(), &st) == 0 &&
        S_ISREG(st.st_mode)) {
      names.emplace_back(entry->d_name);
    }
  }
  std::sort(names.begin(), names.end());
  return names;
}

}  // namespace

Catalogue LoadCatalogue() {
  Catalogue catalogue;
  for (QueueType type : zorvnotifyctl::kAllQueueTypes) {
    for (const std::string& file : QueueFiles(MonitorQueue::GetConfDir(type))) {
      std::vector<MonitorQueue> queues;
      MonitorQueue::List(queues, file, type);
      for (const MonitorQueue& queue : queues) catalogue.push_back({type, file, queue});
    }
  }
  return catalogue;
}

std::vector<WatchRoot> WatchRoots(const Catalogue& catalogue) {
  std::vector<WatchRoot> roots;
  for (const CatalogueQueue& entry : catalogue) {
    for (const auto& config : entry.queue._configs) roots.push_back({config._path, config._mask});
  }
  return roots;
}

bool CatalogueWatch::Open() {
  inotify_ = OpenInotify();
  return inotify_.get() >= 0 && WatchDirs();
}

bool CatalogueWatch::WatchDirs() {
  for (QueueType type : zorvnotifyctl::kAllQueueTypes) {
    const std::string dir = MonitorQueue::GetConfDir(type);
    // IN_CREATE as well: a queue file added as a symbolic link gives no other event.
    const uint32_t mask =
        IN_CREATE | IN_CLOSE_WRITE | IN_MOVED_TO | IN_DELETE | IN_MOVED_FROM | IN_ONLYDIR;
    if (inotify_add_watch(inotify_.get(), dir.c_str(), mask) < 0) {
      syslog(LOG_ERR, "cannot watch the configuration directory %s: %s", dir.c_str(),
             strerror(errno));
      return false;
    }
  }
  return true;
}

bool CatalogueWatch::ReadChanges() {
  alignas(struct inotify_event) char buffer[16 * 1024];
  bool changed = false;
  bool dir_gone = false;
  for (;;) {
    const ssize_t n = read(inotify_.get(), buffer, sizeof(buffer));
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;  // EAGAIN: drained
    for (const char* p = buffer; p < buffer + n;) {
      const auto* event = reinterpret_cast<const struct inotify_event*>(p);
      p += sizeof(struct inotify_event) + event->len;
      dir_gone = dir_gone || (event->mask & IN_IGNORED) != 0;
      if ((event->mask & (IN_Q_OVERFLOW | IN_IGNORED)) ||
          (event->len > 0 && event->name[0] != '.')) {
        changed = true;
      }
    }
  }
  // A configuration directory that was removed (or unmounted) took its
  // watch along: it is made again and watched anew.
  if (dir_gone) WatchDirs();
  return changed;
}

}  // namespace zorvnotifyd
