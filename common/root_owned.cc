// Checking that files and their directories are root's alone.

#include "root_owned.h"

#include <pwd.h>

#include <cerrno>
#include <cstring>

#include "text.h"

namespace zorvcommon {

std::string NotRootsAlone(const struct stat& st, const std::string& what) {
  if (st.st_uid != 0) {
    const struct passwd* user = getpwuid(st.st_uid);
    return what + " belongs to uid " + std::to_string(st.st_uid) +
           (user != nullptr ? " (user " + Printable(user->pw_name) + ")" : "") + ", not root";
  }
  if ((st.st_mode & (S_IWGRP | S_IWOTH)) != 0) return what + " is writable by group or others";
  return std::string();
}

std::string UntrustedDirectories(std::string dir, bool sticky_ok) {
  for (;;) {
    struct stat st;
    if (stat(dir.c_str(), &st) != 0) {
      return "its directory " + Printable(dir) + " cannot be checked: " + strerror(errno);
    }
    if (!(sticky_ok && st.st_uid == 0 && (st.st_mode & S_ISVTX) != 0)) {
      std::string why = NotRootsAlone(st, "its directory " + Printable(dir));
      if (!why.empty()) return why;
    }
    const std::string::size_type slash = dir.rfind('/');
    if (dir == "/" || slash == std::string::npos) return std::string();
    dir = slash == 0 ? "/" : dir.substr(0, slash);
  }
}

}  // namespace zorvcommon
