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

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_LOCK_HOLDER_H_
