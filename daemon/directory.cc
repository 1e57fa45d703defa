// Directory access relative to open descriptors.

#include "directory.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

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
  // Straight from the kernel into a buffer on the stack: a DIR stream would
  // cost a duplicate descriptor, two fcntl calls and a heap buffer for
  // every directory of a walk.
  alignas(struct dirent64) char buffer[16 * 1024];
  for (;;) {
    const ssize_t n = getdents64(dir, buffer, sizeof(buffer));
    if (n <= 0) break;  // the end, or a directory that cannot be read further
    for (ssize_t at = 0; at < n;) {
      const auto* entry = reinterpret_cast<const struct dirent64*>(buffer + at);
      at += entry->d_reclen;
      const char* name = entry->d_name;
      if (name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'))) continue;
      bool is_dir = entry->d_type == DT_DIR;
      if (entry->d_type == DT_UNKNOWN) {
        struct stat st;
        is_dir = fstatat(dir, name, &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(st.st_mode);
      }
      entries.push_back({name, is_dir});
    }
  }
  return entries;
}

}  // namespace zorvnotifyd
