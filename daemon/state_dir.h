// The daemon's state directory: what it keeps across restarts (each queue's
// journal, what it last saw of each tree).  Everything in it is reached
// through the descriptor held here, with openat and O_NOFOLLOW, so a link
// planted on the way can never lead a write elsewhere.
#ifndef ZORVNOTIFYD_DAEMON_STATE_DIR_H_
#define ZORVNOTIFYD_DAEMON_STATE_DIR_H_

#include <string>

#include "unique_fd.h"

namespace zorvnotifyd {

using zorvcommon::UniqueFd;

// The state directory when none is named.
constexpr char kDefaultStateDir[] = "/var/lib/zorvnotifyd";

class StateDir {
 public:
  StateDir() = default;
  StateDir(const StateDir&) = delete;
  StateDir& operator=(const StateDir&) = delete;

  // Opens the directory at |path|, making it (mode 0700) when missing: that
  // directory alone, never its parents.  Refuses, with a log line, a
  // symbolic link, another kind of file, or a directory that is not root's
  // or that group or others may write: anyone who may write it could plant
  // or replace the state.  False when refused or not opened.
  bool Open(const std::string& path);

  // Opens subdirectory |name| of the state directory, made (0700) when
  // missing, under the same rules; an empty descriptor with |reason| when
  // it cannot be used.  The descriptor is O_DIRECTORY|O_NOFOLLOW|O_CLOEXEC.
  UniqueFd OpenSubdirectory(const char* name, std::string* reason) const;

  // The directory, O_DIRECTORY|O_NOFOLLOW|O_CLOEXEC; -1 before Open.
  int fd() const { return fd_.get(); }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
  UniqueFd fd_;
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_STATE_DIR_H_
