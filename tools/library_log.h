// The library's log lines, as the tool sees them: the tool defines the
// syslog entry points the library calls, notes the lines it needs to act on
// and passes every other line on to the C library's syslog.
#ifndef ZORVNOTIFYD_TOOLS_LIBRARY_LOG_H_
#define ZORVNOTIFYD_TOOLS_LIBRARY_LOG_H_

namespace zorvnotifyctl {

// Forgets the lines noted so far.  While |quiet_lock_failures| is true, the
// library's "Lock failed" lines are noted but not logged, since the caller
// retries and reports the outcome itself.
void ResetLibraryLog(bool quiet_lock_failures);

// True when the library logged "Lock failed" (the store lock stayed held
// by another writer through its bounded retries) since ResetLibraryLog.
bool LibraryReportedLockFailure();

// True when the library logged that it could not ask the service manager
// to start or stop zorvnotifyd (systemctl missing or failing) since
// ResetLibraryLog.
bool LibraryReportedServiceFailure();

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_LIBRARY_LOG_H_
