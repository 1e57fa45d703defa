// Loading the catalogue file by file and noticing when it changes.

#include "catalogue.h"

#include <dirent.h>
#include <errno.h>
#include <string.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <syslog.h>

#include <algorithm>
#include <cstdio>

#include "queue_files.h"
#include "text.h"
#include "watch_path.h"
#include "watch_tree.h"

namespace zorvnotifyd {

using ZORV::ZORVNOTIFYD::MonitorQueue;
using zorvcommon::Printable;
using zorvcommon::Quoted;

namespace {

// The queue files of |dir| in name order.  A missing directory holds none;
// CatalogueWatch says that it is missing.
std::vector<std::string> QueueFiles(const std::string& dir) {
  std::vector<std::string> names;
  if (!zorvcommon::QueueFileNames(dir, &names) && errno != ENOENT) {
    syslog(LOG_ERR, "cannot read %s: %s", dir.c_str(), strerror(errno));
  }
  return names;
}

// The event kinds the watcher reports: inotify's, on files and directories.
constexpr uint32_t kDeliverable = IN_ALL_EVENTS | IN_ISDIR;

// What a configuration directory is watched for.  IN_CREATE as well: a
// queue file added as a symbolic link gives no other event.
constexpr uint32_t kDirEvents =
    IN_CREATE | IN_CLOSE_WRITE | IN_MOVED_TO | IN_DELETE | IN_MOVED_FROM | IN_ONLYDIR;

}  // namespace

Catalogue CatalogueLoader::Load() {
  Catalogue catalogue;
  std::map<FileKey, std::vector<MonitorQueue>> good;
  std::map<FileKey, std::string> failing;
  std::set<FileKey> backups;
  for (QueueType type : zorvcommon::kAllQueueTypes) {
    const std::string dir = MonitorQueue::GetConfDir(type);
    for (const std::string& file : QueueFiles(dir)) {
      const FileKey key(type, file);
      const std::string label =
          Printable(std::string(zorvcommon::QueueTypeName(type)) + "/" + file);
      if (zorvcommon::LooksLikeBackupCopy(file)) {
        if (backups_.count(key) == 0) {
          syslog(LOG_WARNING,
                 "queue file %s looks like a backup copy, and is loaded like any queue file: "
                 "remove it or move it out of the directory",
                 label.c_str());
        }
        backups.insert(key);
      }
      // A file root alone does not control could have been planted or
      // changed by anyone: none of its queues is served, not even its last
      // good content.
      const std::string untrusted = zorvcommon::UntrustedQueueFile(dir, file);
      if (!untrusted.empty()) {
        const std::string why = "refused: " + untrusted;
        const auto known = failing_.find(key);
        if (known == failing_.end() || known->second != why) {
          syslog(LOG_ERR,
                 "queue file %s is refused: %s; none of its queues is loaded (root alone must be "
                 "able to change it and its directories)",
                 Printable(dir + "/" + file).c_str(), untrusted.c_str());
        }
        failing[key] = why;
        continue;
      }
      std::vector<MonitorQueue> queues;
      bool has_good = true;  // loaded now, or loaded before
      if (MonitorQueue::List(queues, file, type)) {
        if (failing_.count(key) != 0) {
          syslog(LOG_NOTICE, "queue file %s loads again: %zu queues", label.c_str(), queues.size());
        }
      } else {
        const std::string why = zorvcommon::WhyUnloadable(dir + "/" + file);
        const auto last = last_good_.find(key);
        queues.clear();
        if (last != last_good_.end()) queues = last->second;
        has_good = last != last_good_.end();
        const auto known = failing_.find(key);
        if (known == failing_.end() || known->second != why) {
          syslog(LOG_ERR, "queue file %s cannot be loaded: %s; %s", label.c_str(), why.c_str(),
                 last == last_good_.end() ? "it has no earlier content to keep"
                                          : ("keeping its last good content (" +
                                             std::to_string(queues.size()) + " queues)")
                                                .c_str());
        }
        failing[key] = why;
      }
      // One copy for the catalogue; the loaded queues themselves are kept.
      // Room made first, at least doubling: a queue is copied, not moved,
      // when the catalogue grows, which copied a large file's queues about
      // twice more.
      const size_t needed = catalogue.size() + queues.size();
      if (catalogue.capacity() < needed) {
        catalogue.reserve(std::max(needed, 2 * catalogue.capacity()));
      }
      for (const MonitorQueue& queue : queues) catalogue.emplace_back(type, file, queue);
      if (has_good) good[key] = std::move(queues);
    }
  }
  last_good_ = std::move(good);
  failing_ = std::move(failing);
  backups_ = std::move(backups);
  return catalogue;
}

std::vector<std::string> CatalogueLoader::Honour(Catalogue* catalogue) {
  std::vector<std::string> roots;
  std::set<std::string> skipped;
  for (CatalogueQueue& entry : *catalogue) {
    std::vector<MonitorQueue::MonitorQueueConfig> honoured;
    honoured.reserve(entry.queue._configs.size());
    for (auto& config : entry.queue._configs) {
      std::string why = zorvcommon::WatchPathProblem(config._path);
      if (why.empty() && (config._mask & kDeliverable) == 0) {
        char mask[16];
        snprintf(mask, sizeof(mask), "0x%x", config._mask);
        why = config._mask == 0 ? std::string("its mask is 0, so it wants no event")
                                : std::string("its mask ") + mask +
                                      " holds no event kind the watcher reports (inotify's "
                                      "IN_ALL_EVENTS bits and IN_ISDIR)";
      }
      if (why.empty()) {
        roots.push_back(config._path);
        honoured.push_back(std::move(config));  // the old list is dropped below
        continue;
      }
      const std::string line = "skipping configuration " + Quoted(config._path) + " of queue " +
                               Quoted(entry.queue._name) + " (" +
                               zorvcommon::QueueTypeName(entry.type) + "/" + Printable(entry.file) +
                               "): " + why;
      if (skipped_.count(line) == 0) syslog(LOG_WARNING, "%s", line.c_str());
      skipped.insert(line);
    }
    entry.queue._configs = std::move(honoured);
  }
  skipped_ = std::move(skipped);
  return roots;
}

bool CatalogueWatch::Open() {
  inotify_ = OpenInotify();
  return inotify_.get() >= 0 && WatchDirs();
}

bool CatalogueWatch::WatchDirs() {
  std::set<std::string> missing;
  for (QueueType type : zorvcommon::kAllQueueTypes) {
    const std::string dir = MonitorQueue::GetConfDir(type);
    if (inotify_add_watch(inotify_.get(), dir.c_str(), kDirEvents) >= 0) continue;
    if (errno == ENOENT) {
      // Missing and not creatable (a read-only /usr): an empty type.
      if (missing_.count(dir) == 0) {
        syslog(LOG_WARNING,
               "the configuration directory %s is missing and could not be created; its queue "
               "type counts as empty and it is not watched",
               dir.c_str());
      }
      missing.insert(dir);
      continue;
    }
    syslog(LOG_ERR, "cannot watch the configuration directory %s: %s", dir.c_str(),
           strerror(errno));
    return false;
  }
  missing_ = std::move(missing);
  return true;
}

bool CatalogueWatch::WatchMissing() {
  // Only looked for, not made: on a read-only /usr every attempt to create
  // one would log a failure.
  bool appeared = false;
  for (auto it = missing_.begin(); it != missing_.end();) {
    if (inotify_add_watch(inotify_.get(), it->c_str(), kDirEvents) < 0) {
      ++it;
      continue;
    }
    syslog(LOG_INFO, "the configuration directory %s appeared: reading the catalogue again",
           it->c_str());
    it = missing_.erase(it);
    appeared = true;
  }
  return appeared;
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
