// Telling the service manager about the daemon's state: the datagram
// protocol of systemd's sd_notify, spoken directly, so that the daemon needs
// no libsystemd and tells a Type=notify unit the same on every target.
#ifndef ZORVNOTIFYD_DAEMON_NOTIFY_H_
#define ZORVNOTIFYD_DAEMON_NOTIFY_H_

#include <string>

namespace zorvnotifyd {

// Sends |state| (newline-separated VARIABLE=VALUE assignments, such as
// "READY=1") in one datagram to the AF_UNIX socket that $NOTIFY_SOCKET
// names: a path, or an abstract socket when it begins with '@'.  Nothing is
// sent when the variable is unset or empty (not started by a service
// manager that listens).  True when the datagram was sent; false when there
// was nothing to send to, or the name is not usable (neither '/' nor '@' at
// its start, or too long) or the send failed, which the caller may ignore as
// sd_notify's callers do.  Never raises SIGPIPE.
bool NotifyServiceManager(const std::string& state);

// True when standard error is the stream a service manager connected to
// its journal ($JOURNAL_STREAM names that stream's device and inode, and
// standard error is still it).  A daemon that logs through syslog then
// leaves its lines off standard error, or the journal holds each twice.
bool StderrIsJournal();

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_NOTIFY_H_
