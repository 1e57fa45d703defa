// Finding the holder of a flock through /proc/locks.

#include "lock_holder.h"

#include <pwd.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <cstdio>
#include <fstream>
#include <sstream>

#include "text.h"

namespace zorvnotifyctl {
namespace {

// The real user id of process |pid|, from the first field of its "Uid:"
// line; false when the process is gone.
bool RealUid(const std::string& pid, uid_t* uid) {
  std::ifstream status("/proc/" + pid + "/status");
  for (std::string line; std::getline(status, line);) {
    unsigned long value = 0;
    if (sscanf(line.c_str(), "Uid: %lu", &value) == 1) {
      *uid = static_cast<uid_t>(value);
      return true;
    }
  }
  return false;
}

// "user NAME" of |uid|, or "" when it has no user name.
std::string UserName(uid_t uid) {
  const struct passwd* user = getpwuid(uid);
  return user != nullptr ? "user " + std::string(user->pw_name) : std::string();
}

}  // namespace

std::string PlantedLockFile(const std::string& lock_file) {
  struct stat st;
  if (lstat(lock_file.c_str(), &st) != 0 || S_ISREG(st.st_mode)) return std::string();
  const char* kind = S_ISLNK(st.st_mode)    ? "a symbolic link"
                     : S_ISDIR(st.st_mode)  ? "a directory"
                     : S_ISFIFO(st.st_mode) ? "a fifo"
                     : S_ISSOCK(st.st_mode) ? "a socket"
                     : S_ISCHR(st.st_mode)  ? "a character device"
                     : S_ISBLK(st.st_mode)  ? "a block device"
                                            : "not a regular file";
  const std::string name = UserName(st.st_uid);
  return std::string(kind) + " (owner uid " + std::to_string(st.st_uid) +
         (name.empty() ? "" : ", " + zorvcommon::Printable(name)) + ")";
}

std::string LockHolder(const std::string& lock_file) {
  struct stat st;
  if (lstat(lock_file.c_str(), &st) != 0) return std::string();
  // A line reads "1: FLOCK  ADVISORY  WRITE 1234 08:02:131 0 EOF": number,
  // class, mode, access, pid, device (hexadecimal major:minor) and inode;
  // a waiter's line has "->" after the number and is skipped.
  std::ifstream locks("/proc/locks");
  for (std::string line; std::getline(locks, line);) {
    std::istringstream fields(line);
    std::string number, kind, mode, access, pid, where;
    if (!(fields >> number >> kind) || kind == "->") continue;
    if (!(fields >> mode >> access >> pid >> where)) continue;
    unsigned int major_id = 0, minor_id = 0;
    unsigned long long inode = 0;
    if (kind != "FLOCK" || sscanf(where.c_str(), "%x:%x:%llu", &major_id, &minor_id, &inode) != 3 ||
        inode != st.st_ino || major_id != major(st.st_dev) || minor_id != minor(st.st_dev)) {
      continue;
    }
    std::string holder = "pid " + pid;
    uid_t uid = 0;
    if (RealUid(pid, &uid)) {
      const std::string name = UserName(uid);
      holder += " (" + (name.empty() ? "" : zorvcommon::Printable(name) + ", ") + "uid " +
                std::to_string(uid) + ")";
    }
    return holder;
  }
  return std::string();
}

}  // namespace zorvnotifyctl
