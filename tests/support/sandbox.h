// The test sandbox: a private mount namespace in which /usr is an overlay
// whose writes land on a throw-away tmpfs and /tmp is a fresh, empty tmpfs.
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

// Sets the sandbox up.  Called by main() before any test and before any
// thread exists.  Enters a private mount namespace, mounts the overlay on
// /usr (upper and work directories on a tmpfs hidden under the new /tmp), a
// fresh tmpfs on /tmp, and installs the fake systemctl.  True on success.
// On failure records the reason, undoes the mounts it made and returns
// false; the host is never touched.  Calling it again after a success does
// nothing and returns true.
bool EnterSandbox();

// True once EnterSandbox has succeeded.
bool SandboxActive();

// Why the sandbox is not active ("EnterSandbox was not called" before the
// first call).  The pointer stays valid for the life of the program.
const char* SandboxSkipReason();

// Returns the store of the sandbox to its initial state: removes
// /usr/zorv, /usr/local/etc/zorvnotifyd and /tmp/zorvnotifyd_monitor_q.lock
// (whole trees, whatever their type), reinstalls the fake systemctl and
// empties its records, and sets its exit status back to 0.  Does nothing
// when the sandbox is inactive.  A step that fails is reported as a
// non-fatal test failure.  Must run with effective root (tests call it in
// SetUp).
void ResetStore();

// The arguments of every fake systemctl call since the last ResetStore,
// one entry per call, joined by single spaces (e.g. "--no-block start
// zorvnotifyd").  Empty when the sandbox is inactive.
std::vector<std::string> SystemctlCalls();

// What a fake systemctl process saw about itself when it started.  /bin/sh
// drops privileges when its real and effective ids differ, so the ids show
// the privileges systemctl would really run with.
struct SystemctlProcess {
  uid_t ruid, euid, suid;
  gid_t rgid, egid, sgid;
  std::vector<int> fds;  // open descriptors, ascending, the script's own excluded
  bool stdin_null;       // descriptor 0 is /dev/null
  bool stdout_null;      // descriptor 1 is /dev/null
};

// One entry per fake systemctl process since the last ResetStore.  Under
// concurrent calls the order may differ from SystemctlCalls().
std::vector<SystemctlProcess> SystemctlProcesses();

// Makes every later fake systemctl call exit with |status| (0..255).
void SetSystemctlExitStatus(int status);

// Removes /usr/bin/systemctl, as on a host without it.  ResetStore puts it
// back.
void RemoveSystemctl();

}  // namespace zorv_test

// Skips the current test when the sandbox is inactive.  Use it at the top of
// every test (or in SetUp) that touches /usr/zorv, /usr/local/etc, /tmp or
// the service: without the sandbox those are the host's.
#define ZORV_REQUIRE_SANDBOX()                                                     \
  do {                                                                             \
    if (!::zorv_test::SandboxActive()) {                                           \
      GTEST_SKIP() << "sandbox unavailable: " << ::zorv_test::SandboxSkipReason(); \
    }                                                                              \
  } while (0)

#endif  // ZORVNOTIFYD_TESTS_SUPPORT_SANDBOX_H_
