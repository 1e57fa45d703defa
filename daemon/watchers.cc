// Choosing the watcher of each tree.

#include "watchers.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>

#include <algorithm>
#include <string_view>
#include <unordered_map>
#include <utility>

#include "directory.h"
#include "json_writer.h"
#include "mount_table.h"
#include "text.h"

namespace zorvnotifyd {
namespace {

constexpr const char* kInotify = "inotify";
constexpr const char* kFanotify = "fanotify";

// True when |path| lies strictly below |top|.
bool Below(const std::string& path, const std::string& top) {
  if (top == "/") return path.size() > 1;
  return path.size() > top.size() && path.compare(0, top.size(), top) == 0 &&
         path[top.size()] == '/';
}

constexpr const char* kNotMountPointWhy =
    "it is not a mount point (fanotify would pay for the events of the rest of its file "
    "system; --backend fanotify serves it so)";

// A reason for a choice, to share among the trees it is given to.
std::shared_ptr<const std::string> Why(std::string text) {
  return std::make_shared<const std::string>(std::move(text));
}

// True when the open directory |dir| is the root of its file system, as
// mounted: a mount of |mounts| whose root is the file system's own (a bind
// mount of a directory inside one is not).
bool IsFileSystemRoot(int dir, const MountTable& mounts) {
  struct statx stx;
  if (statx(dir, "", AT_EMPTY_PATH | AT_STATX_DONT_SYNC, STATX_BASIC_STATS | STATX_MNT_ID, &stx) !=
          0 ||
      !(stx.stx_attributes_mask & STATX_ATTR_MOUNT_ROOT) || !(stx.stx_mask & STATX_MNT_ID)) {
    struct stat self, parent;  // kernels before 5.8: a mount's root
    return fstat(dir, &self) == 0 && fstatat(dir, "..", &parent, 0) == 0 &&
           (self.st_dev != parent.st_dev || self.st_ino == parent.st_ino);
  }
  if (!(stx.stx_attributes & STATX_ATTR_MOUNT_ROOT)) return false;
  const std::string* root = mounts.RootOf(stx.stx_mnt_id);
  return root != nullptr && *root == "/";
}

}  // namespace

bool ParseBackend(const std::string& text, Backend* backend) {
  if (text == "auto") {
    *backend = Backend::kAuto;
  } else if (text == kInotify) {
    *backend = Backend::kInotify;
  } else if (text == kFanotify) {
    *backend = Backend::kFanotify;
  } else {
    return false;
  }
  return true;
}

Watchers::Watchers(UniqueFd inotify, double retry_seconds, Backend backend)
    : inotify_(std::move(inotify), retry_seconds), fanotify_(retry_seconds), backend_(backend) {}

void Watchers::Sync(std::vector<std::string> roots, const WatchMasks& masks) {
  std::string cannot;
  const bool can = backend_ != Backend::kInotify && fanotify_.Open(&cannot);
  MountTable mounts;
  std::string unread;
  if (can && backend_ == Backend::kAuto && !mounts.Read(&unread)) {
    syslog(LOG_WARNING, "cannot read the mount table (%s): inotify serves every tree",
           unread.c_str());
  }
  const auto not_mount_point = Why(kNotMountPointWhy);
  const auto by_option =
      Why(backend_ == Backend::kInotify ? "--backend inotify" : "--backend fanotify");
  const auto cannot_why = Why(cannot);
  std::vector<std::string> sorted = std::move(roots);
  std::sort(sorted.begin(), sorted.end());
  sorted.erase(std::unique(sorted.begin(), sorted.end()), sorted.end());
  // The choice of each tree of |sorted|, and where each tree chosen is
  // there: looking a path up hashes it, rather than comparing it with
  // paths that share most of it along a tree of thousands.
  std::vector<Choice> choices;
  choices.reserve(sorted.size());
  std::unordered_map<std::string_view, size_t> chosen_at;
  chosen_at.reserve(sorted.size());
  for (const std::string& root : sorted) {
    // The innermost tree chosen already that holds this one: its nearest
    // ancestor among them (ancestors sort first, so all are chosen by now),
    // looked up by each of its leading paths.
    const std::string* outer = nullptr;
    const Choice* outer_choice = nullptr;
    ForEachLeadingPath(root, [&](std::string_view prefix) {
      const auto found = prefix.size() < root.size() ? chosen_at.find(prefix) : chosen_at.end();
      if (found != chosen_at.end()) {
        outer = &sorted[found->second];
        outer_choice = &choices[found->second];
      }
      return true;
    });
    std::string why;
    Choice choice{kInotify, nullptr};
    if (outer != nullptr && outer_choice->backend == kInotify) {
      choice.why = Why("it lies in tree " + zorvcommon::Quoted(*outer) + ", which inotify serves");
    } else if (backend_ == Backend::kInotify) {
      choice.why = by_option;
    } else if (!can) {
      choice.why = cannot_why;
    } else {
      // The mount table tells most trees apart without a look at each.
      const bool top = backend_ == Backend::kAuto && outer == nullptr;
      const bool point = top && mounts.IsMountPoint(root);
      const UniqueFd dir = !top || point ? OpenConfiguredDir(root) : UniqueFd();
      if (top && !point) {
        choice.why = not_mount_point;
      } else if (dir.get() < 0) {
        // Looked for again by the watcher chosen.
        choice = backend_ == Backend::kFanotify ? Choice{kFanotify, by_option}
                                                : Choice{kInotify, Why("it is missing")};
      } else if (top && !IsFileSystemRoot(dir.get(), mounts)) {
        choice.why = not_mount_point;
      } else if (!FanotifySupports(dir.get(), &why)) {
        choice.why = Why(why);
      } else if (backend_ == Backend::kFanotify) {
        choice = {kFanotify, by_option};
      } else if (outer != nullptr) {
        choice = {kFanotify,
                  Why("it lies in tree " + zorvcommon::Quoted(*outer) + ", which fanotify serves")};
      } else {
        choice = {kFanotify, Why("it is a whole file system, with file handles")};
      }
    }
    chosen_at.emplace(root, choices.size());
    choices.push_back(std::move(choice));
  }
  std::map<std::string, Choice, std::less<>> chosen;
  for (size_t i = 0; i < sorted.size(); ++i) {
    chosen.emplace_hint(chosen.end(), std::move(sorted[i]), std::move(choices[i]));
  }
  // A tree fanotify refuses (a mark it cannot have) goes to inotify, and
  // the trees inside it with it, since inotify's walk covers them.
  std::vector<std::string> by_fanotify, by_inotify;
  for (bool again = true; again;) {
    by_fanotify.clear();
    by_inotify.clear();
    for (const auto& [root, choice] : chosen) {
      (choice.backend == kFanotify ? by_fanotify : by_inotify).push_back(root);
    }
    std::map<std::string, std::string> refused;
    fanotify_.Sync(by_fanotify, masks, &refused);
    again = false;
    for (const auto& [root, why] : refused) {
      chosen[root] = {kInotify, Why(why)};
      const auto inside =
          Why("it lies in tree " + zorvcommon::Quoted(root) + ", which inotify serves");
      for (auto& [path, choice] : chosen) {
        if (Below(path, root) && choice.backend == kFanotify) {
          choice = {kInotify, inside};
          again = true;
        }
      }
    }
    if (!again) {
      for (const auto& [root, why] : refused) by_inotify.push_back(root);
    }
  }
  inotify_.Sync(std::move(by_inotify), masks);
  for (const auto& [root, choice] : chosen) {
    const auto before = chosen_.find(root);
    if (before != chosen_.end() && before->second.backend == choice.backend &&
        *before->second.why == *choice.why) {
      continue;
    }
    // Only the lines LogChoices prints are made: a catalogue of thousands
    // of trees would otherwise build thousands of them at every start.
    if (unlogged_.size() == kMaxChoiceLines) {
      ++unlogged_more_;
      continue;
    }
    unlogged_.push_back("tree " + zorvcommon::Quoted(root) + " is served by " + choice.backend +
                        ": " + *choice.why);
  }
  chosen_ = std::move(chosen);
}

void Watchers::LogChoices() {
  for (const std::string& line : unlogged_) syslog(LOG_INFO, "%s", line.c_str());
  if (unlogged_more_ > 0) {
    syslog(LOG_INFO, "and %zu trees more, as the status reply lists", unlogged_more_);
  }
  unlogged_.clear();
  unlogged_more_ = 0;
}

void Watchers::AppendStatus(std::string* out) const {
  out->append("\"trees\":[");
  bool first = true;
  for (const auto& [root, choice] : chosen_) {
    if (!first) out->push_back(',');
    first = false;
    out->push_back('{');
    AppendJsonBytesField(out, "path", root);
    out->push_back(',');
    AppendJsonField(out, "backend", choice.backend);
    out->push_back(',');
    AppendJsonField(out, "why", *choice.why);
    out->push_back('}');
  }
  out->push_back(']');
}

}  // namespace zorvnotifyd
