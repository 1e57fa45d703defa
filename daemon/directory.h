// Opening and listing directories in trees that other users can write,
// without following a symbolic link that root did not configure.
#ifndef ZORVNOTIFYD_DAEMON_DIRECTORY_H_
#define ZORVNOTIFYD_DAEMON_DIRECTORY_H_

#include <string>
#include <string_view>
#include <vector>

#include "unique_fd.h"

namespace zorvnotifyd {

using zorvcommon::UniqueFd;

// Calls |visit| with each leading part of the absolute |path| that ends
// where a component does, shortest first: "/a", "/a/b", then "/a/b/c" for
// "/a/b/c".  The trees that hold |path| are rooted at some of them ("/" is
// never a tree).  Stops early when |visit| returns false.
template <typename Visit>
void ForEachLeadingPath(std::string_view path, Visit visit) {
  for (size_t end = path.find('/', 1);; end = path.find('/', end + 1)) {
    if (!visit(path.substr(0, end == std::string_view::npos ? path.size() : end))) return;
    if (end == std::string_view::npos) return;
  }
}

// Opens the directory |path| for reading and for openat(), following
// symbolic links (the path of a configured tree, which root chose).
// Never blocks on a special file.  Empty (errno set) on failure.
UniqueFd OpenConfiguredDir(const std::string& path);

// Opens the directory |name| inside the open directory |parent| without
// following a symbolic link in its place.  Empty (errno set) when it is not
// a directory, is a link, or cannot be opened.
UniqueFd OpenSubdir(int parent, const std::string& name);

// Opens |path|, which lies at or below the configured tree |root|: |root|
// as OpenConfiguredDir does, each further component of |path| as
// OpenSubdir does.  |path| must begin with |root| at a "/" boundary.
UniqueFd OpenBelow(const std::string& root, const std::string& path);

struct DirEntry {
  std::string name;
  bool is_dir;  // a directory itself, not a link to one
};

// The entries of the open directory |dir| but "." and "..", in the order
// the file system gives them.  Reads from |dir|'s position (a directory
// just opened: all of it) to the end, leaving it open; |dir| stays usable
// for openat().  Empty when it cannot be read.
std::vector<DirEntry> ListDir(int dir);

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_DIRECTORY_H_
