// Opening the state directory and its subdirectories safely.

#include "state_dir.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>

#include <cstdio>

#include "text.h"

namespace zorvnotifyd {
namespace {

using zorvcommon::Quoted;

// Makes directory |name| at |dir| (0700) when missing, opens it without
// following a link, and checks that it is root's and writable by root
// alone.  |shown| names it in |reason|.
UniqueFd OpenPrivateDirectory(int dir, const char* name, const std::string& shown,
                              std::string* reason) {
  // mkdir never follows a link: one planted there makes open fail below.
  if (mkdirat(dir, name, 0700) == 0) {
    syslog(LOG_NOTICE, "made the state directory %s", Quoted(shown).c_str());
  }
  UniqueFd fd(openat(dir, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (fd.get() < 0) {
    *reason = Quoted(shown) + " cannot be used: " +
              (errno == ELOOP || errno == ENOTDIR
                   ? std::string("it is not a directory (a link is not followed)")
                   : std::string(strerror(errno)));
    return UniqueFd();
  }
  struct stat st;
  if (fstat(fd.get(), &st) != 0) {
    *reason = Quoted(shown) + " cannot be used: " + strerror(errno);
    return UniqueFd();
  }
  if (st.st_uid != 0 || (st.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
    char mode[8];
    snprintf(mode, sizeof(mode), "%04o", unsigned(st.st_mode & 07777));
    *reason = Quoted(shown) + " is owned by uid " + std::to_string(st.st_uid) + " with mode " +
              mode + "; it must be root's and writable by root alone";
    return UniqueFd();
  }
  return fd;
}

}  // namespace

bool StateDir::Open(const std::string& path) {
  path_ = path;
  std::string reason;
  if (path.empty()) {
    reason = "the path is empty";
  } else {
    fd_ = OpenPrivateDirectory(AT_FDCWD, path.c_str(), path, &reason);
  }
  if (fd_.get() < 0) {
    syslog(LOG_ERR, "cannot use the state directory: %s", reason.c_str());
    return false;
  }
  return true;
}

UniqueFd StateDir::OpenSubdirectory(const char* name, std::string* reason) const {
  return OpenPrivateDirectory(fd_.get(), name, path_ + "/" + name, reason);
}

}  // namespace zorvnotifyd
