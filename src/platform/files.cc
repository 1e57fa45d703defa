// Directory and file tests of the platform layer.

#include <errno.h>
#include <sys/stat.h>

#include <string>

#include "platform/platform.h"

int ZORBCFileCheckDir(const char* path) {
  struct stat st;
  return path != nullptr && stat(path, &st) == 0 && S_ISDIR(st.st_mode) ? 1 : 0;
}

int ZORBCFileExist(const char* path) {
  struct stat st;
  return path != nullptr && stat(path, &st) == 0 ? 1 : 0;
}

namespace {

// Creates one directory with exactly |mode| (mkdir applies the umask, so a
// created directory gets a chmod).  An existing directory is left as it is.
bool MakeOne(const std::string& path, mode_t mode) {
  if (mkdir(path.c_str(), mode) == 0) return chmod(path.c_str(), mode) == 0;
  return errno == EEXIST && ZORBCFileCheckDir(path.c_str()) != 0;
}

}  // namespace

int ZORVFSMkdirP(const char* path, const void* /*reserved*/, int parents, int /*owner_uid*/,
                 int /*owner_gid*/, mode_t mode) {
  if (path == nullptr || *path == '\0') return -1;
  const std::string full(path);
  if (parents != 0) {
    // Every leading component, skipping runs of "/".
    for (std::string::size_type pos = full.find('/', 1); pos != std::string::npos;
         pos = full.find('/', pos + 1)) {
      if (full[pos - 1] == '/') continue;
      if (!MakeOne(full.substr(0, pos), mode)) return -1;
    }
  }
  return MakeOne(full, mode) ? 0 : -1;
}
