// The queue files of a configuration directory, as the tool and the daemon
// read them.
#ifndef ZORVNOTIFYD_COMMON_QUEUE_FILES_H_
#define ZORVNOTIFYD_COMMON_QUEUE_FILES_H_

#include <string>
#include <vector>

namespace zorvcommon {

// The names of the files of |dir| that the library's catalogue reads
// (regular files, links followed, whose name does not begin with "."), in
// byte-wise name order.  False with errno set when |dir| cannot be listed.
bool QueueFileNames(const std::string& dir, std::vector<std::string>* names);

// True when the queue file name |file| looks like a backup or packaging
// copy ("nas.bak", "nas~", "nas.dpkg-old", ...), which the library loads
// like any queue file.
bool LooksLikeBackupCopy(const std::string& file);

// Why the library could not load the queue file at |path| completely, in
// words ("not a regular file", "too large (N bytes)", "not valid JSON
// (...)", "not a JSON array of queues", "a queue in it has a value of the
// wrong type"): the file is read without blocking and within
// kMaxQueueFileSize, and parsed as strictly as the library does.
std::string WhyUnloadable(const std::string& path);

// Why the queue file |file| of the configuration directory |dir| must not
// be loaded, or "" when it may be.  A root process acts on every queue, so
// only what root alone controls is trusted, as sshd's StrictModes does: the
// file (its link followed), |dir| and each directory above it up to "/",
// and each directory above the file's real path, must belong to root and
// must not be writable by group or others.  The directories the library
// creates (mode 0700) pass.  Only inspected: nothing is opened.
std::string UntrustedQueueFile(const std::string& dir, const std::string& file);

}  // namespace zorvcommon

#endif  // ZORVNOTIFYD_COMMON_QUEUE_FILES_H_
