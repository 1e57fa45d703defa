// Who holds the store lock, for the message of a writer that gave up.
#ifndef ZORVNOTIFYD_TOOLS_LOCK_HOLDER_H_
#define ZORVNOTIFYD_TOOLS_LOCK_HOLDER_H_

#include <string>

namespace zorvnotifyctl {

// The file whose exclusive flock is the library's store lock.
inline constexpr char kStoreLockFile[] = "/tmp/zorvnotifyd_monitor_q.lock";

// "pid 1234 (user backup, uid 1000)" for the process holding the flock on
// |lock_file| according to /proc/locks; "" when no holder is found (the
// lock was released meanwhile, the file does not exist, or /proc is not
// readable).  The file is only inspected, never opened or created.
std::string LockHolder(const std::string& lock_file);

// What stands at |lock_file| in place of a regular file, "" when it is one
// or nothing is there: "a symbolic link (owner uid 1000, user backup)" and
// likewise for a directory, fifo, socket or device.  The library opens the
// lock file without following a link and cannot lock anything else, so then
// nobody holds the lock and every writer fails until root removes it.  The
// path is only inspected (lstat), never followed or opened.
std::string PlantedLockFile(const std::string& lock_file);

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_LOCK_HOLDER_H_
