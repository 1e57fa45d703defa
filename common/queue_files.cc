// Listing queue files.

#include "queue_files.h"

#include <dirent.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstring>
#include <memory>

namespace zorvcommon {

bool QueueFileNames(const std::string& dir, std::vector<std::string>* names) {
  std::unique_ptr<DIR, int (*)(DIR*)> handle(opendir(dir.c_str()), closedir);
  if (!handle) return false;
  while (const struct dirent* entry = readdir(handle.get())) {
    struct stat st;
    if (entry->d_name[0] != '.' && stat((dir + "/" + entry->d_name).c_str(), &st) == 0 &&
        S_ISREG(st.st_mode)) {
      names->emplace_back(entry->d_name);
    }
  }
  std::sort(names->begin(), names->end());
  return true;
}

bool LooksLikeBackupCopy(const std::string& file) {
  for (const char* suffix : {"~", ".bak", ".orig", ".swp", ".dpkg-old", ".dpkg-new", ".dpkg-dist",
                             ".dpkg-bak", ".rpmnew", ".rpmsave", ".rpmorig"}) {
    const size_t n = strlen(suffix);
    if (file.size() > n && file.compare(file.size() - n, n, suffix) == 0) return true;
  }
  return false;
}

}  // namespace zorvcommon
