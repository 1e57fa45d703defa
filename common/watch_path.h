// Which configuration paths zorvnotifyd can watch.
//
// The library compares paths byte for byte: a configuration path "/a/b/"
// wants "/a/b//x" but not "/a/b/x", "/" wants only paths beginning with
// "//", and "" wants every absolute path.  inotify reports paths built from
// the real names, "/a/b/x", so the daemon honours only configuration paths
// that such paths can match: absolute and normalised.  zorvnotifyctl refuses
// the others when a queue is stored.
#ifndef ZORVNOTIFYD_COMMON_WATCH_PATH_H_
#define ZORVNOTIFYD_COMMON_WATCH_PATH_H_

#include <string>

namespace zorvcommon {

// "" when |path| is a watchable directory path: it begins with "/", is not
// "/" alone, and has no empty, "." or ".." component (so no "//" and no
// trailing "/") and no NUL byte.  Otherwise one sentence saying what is
// wrong and how to write the path instead, e.g. "it ends in \"/\"; write
// it as \"/srv/share\"".
std::string WatchPathProblem(const std::string& path);

}  // namespace zorvcommon

#endif  // ZORVNOTIFYD_COMMON_WATCH_PATH_H_
