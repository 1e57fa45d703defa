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

}  // namespace zorvcommon

#endif  // ZORVNOTIFYD_COMMON_QUEUE_FILES_H_
