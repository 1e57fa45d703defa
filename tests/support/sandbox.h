// The test sandbox: a private mount namespace in which /usr is an overlay
// whose writes land on a throw-away tmpfs and /tmp and /var/lib are fresh,
// empty tmpfs (the daemon's default state directory is made there).
// Tests may create /usr/zorv, /usr/local/etc/zorvnotifyd and the store lock
// in /tmp without changing anything on the host, and the sandbox's fake
// /usr/bin/systemctl records service requests instead of performing them.
#ifndef ZORVNOTIFYD_TESTS_SUPPORT_SANDBOX_H_
#define ZORVNOTIFYD_TESTS_SUPPORT_SANDBOX_H_

#include <sys/types.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

namespace zorv_test {

// Sets the sandbox up; main() calls it before any test and any thread.  On
// failure it records the reason, undoes its mounts and returns false; the
// host is never touched.
bool EnterSandbox();

// True once EnterSandbox has succeeded.
bool SandboxActive();

// Why the sandbox is not active.
const char* SandboxSkipReason();

// Returns the store to its initial state: removes /usr/zorv,
// /usr/local/etc/zorvnotifyd, /tmp/zorvnotifyd_monitor_q.lock and the
// daemon's state in /var/lib/zorvnotifyd (whole trees), reinstalls the fake systemctl, empties its
// records and sets its exit status back to 0.  A failure throws (gtest reports it as a failure of
// the test).  Needs effective root; does nothing when the sandbox is inactive.
void ResetStore();

// A directory for the tests' daemon sockets, made (root's, 0755) by
// ResetStore.
constexpr const char* kSocketDir = "/tmp/zorvrun";

// The arguments of every fake systemctl call since the last ResetStore, one
// entry per call, joined by single spaces ("--no-block start zorvnotifyd").
std::vector<std::string> SystemctlCalls();

// What a fake systemctl process saw about itself.  /bin/sh drops privileges
// when its real and effective ids differ, so the ids are those systemctl
// would really run with.
struct SystemctlProcess {
  uid_t ruid, euid, suid;
  gid_t rgid, egid, sgid;
  std::vector<int> fds;  // open descriptors, ascending, the script's own excluded
  bool stdin_null;       // descriptor 0 is /dev/null
  bool stdout_null;      // descriptor 1 is /dev/null
};

// One entry per fake systemctl process since the last ResetStore.
std::vector<SystemctlProcess> SystemctlProcesses();

// Makes every later fake systemctl call exit with |status| (0..255); throws on failure.
void SetSystemctlExitStatus(int status);

// Removes /usr/bin/systemctl, as on a host without it; ResetStore puts it back.
void RemoveSystemctl();

}  // namespace zorv_test

// Skips the current test when the sandbox is inactive: without it /usr,
// /tmp and the service are the host's.
#define ZORV_REQUIRE_SANDBOX()                                                     \
  do {                                                                             \
    if (!::zorv_test::SandboxActive()) {                                           \
      GTEST_SKIP() << "sandbox unavailable: " << ::zorv_test::SandboxSkipReason(); \
    }                                                                              \
  } while (0)

#endif  // ZORVNOTIFYD_TESTS_SUPPORT_SANDBOX_H_
