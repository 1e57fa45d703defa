// Whether a file or the directories above it are root's alone: what the
// tool and the daemon check before trusting a queue file or a socket's
// place, since a user who may write any of them could swap what is there.
#ifndef ZORVNOTIFYD_COMMON_ROOT_OWNED_H_
#define ZORVNOTIFYD_COMMON_ROOT_OWNED_H_

#include <sys/stat.h>

#include <string>

namespace zorvcommon {

// Why |st|, the status of what |what| names, is not root's alone (another
// owner, or writable by group or others), or "" when it is.
std::string NotRootsAlone(const struct stat& st, const std::string& what);

// Why |dir| (absolute) or a directory above it is not root's alone, or ""
// when every one is.  With |sticky_ok|, a root-owned directory that others
// may write but whose sticky bit is set (/tmp) is trusted too: no one else
// may rename or remove root's entries there.  Links are followed, as a
// path lookup of the caller's would.
std::string UntrustedDirectories(std::string dir, bool sticky_ok = false);

}  // namespace zorvcommon

#endif  // ZORVNOTIFYD_COMMON_ROOT_OWNED_H_
