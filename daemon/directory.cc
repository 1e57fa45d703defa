// Directory access relative to open descriptors.

#include "directory.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <memory>

namespace zorvnotifyd {
namespace {

constexpr int kDirFlags = O_RDONLY | O_DIRECTORY | O_CLOEXEC | O_NONBLOCK;

}  // namespace

UniqueFd OpenConfiguredDir(const std::string& path) {
  return UniqueFd(open(path.c_str(), kDirFlags));
}

UniqueFd OpenSubdir(int parent, const std::string& name) {
  return UniqueFd(openat(parent, name.c_str(), kDirFlags | O_NOFOLLOW));
}

UniqueFd OpenBelow(const std::string& root, const std::string& path) {
  UniqueFd dir = OpenConfiguredDir(root);
  size_t start = root.size() + 1;
  while (dir.get() >= 0 && start <= path.size()) {
    size_t end = path.find('/', start);
    if (end == std::string::npos) end = path.size();
    dir = OpenSubdir(dir.get(), path.substr(start, end - start));
    start = end + 1;
  }
  return dir;
}

std::vector<DirEntry> ListDir(int dir) {
  std::vector<DirEntry> entries;
  // A descriptor of its own, which fdopendir takes over; it shares the
  // read position with |dir|, which is only ever used for openat.
  const int own = fcntl(dir, F_DUPFD_CLOEXEC, 0);
  if (own < 0) return entries;
  std::unique_ptr<DIR, int (*)(DIR*)> handle(fdopendir(own), closedir);
  if (!handle) {
    close(own);
    return entries;
  }
  while (const struct dirent* entry = readdir(handle.get())) {
    const std::string name = entry->d_name;
    if (name == "." || name == "..") continue;
    bool is_dir = entry->d_type == DT_DIR;
    if (entry->d_type == DT_UNKNOWN) {
      struct stat st;
      is_dir = fstatat(dir, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(st.st_mode);
    }
    entries.push_back({name, is_dir});
  }
  return entries;
}

}  // namespace zorvnotifyd
