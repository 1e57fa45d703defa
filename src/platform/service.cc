// Starting and stopping a systemd service through systemctl.
//
// The caller holds the store lock and effective root while the request
// runs, so the child must not inherit any descriptor (the lock's included)
// nor any environment of the host process, and the wait must be bounded and
// end as soon as the child has exited.

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cstdint>

#include "platform/platform.h"
#include "platform/scoped.h"

namespace ZORV {
namespace ZORVNOTIFYD {
namespace platform {

namespace {

constexpr char kSystemctl[] = "/usr/bin/systemctl";
constexpr int kTimeoutMs = 10000;

// Runs in the forked child: only async-signal-safe calls from here on.
[[noreturn]] void ExecSystemctl(const char* verb, const char* name) {
  // The caller is effective root; a real id of another user must not let
  // a shell or systemctl drop the privilege.
  if (setresgid(0, 0, 0) != 0 || setresuid(0, 0, 0) != 0) _exit(126);
  const int null_fd = open("/dev/null", O_RDWR);
  if (null_fd < 0) _exit(126);
  for (int fd = 0; fd <= 2; ++fd) {
    if (dup2(null_fd, fd) < 0) _exit(126);
  }
  // No other descriptor of the host process reaches systemctl.
#ifdef SYS_close_range
  if (syscall(SYS_close_range, 3U, ~0U, 0U) != 0)
#endif
  {
    const long max_fd = sysconf(_SC_OPEN_MAX);
    for (long fd = 3; fd < (max_fd > 0 ? max_fd : 1024); ++fd) close(static_cast<int>(fd));
  }
  sigset_t none;
  sigemptyset(&none);
  sigprocmask(SIG_SETMASK, &none, nullptr);
  char* const argv[] = {const_cast<char*>(kSystemctl), const_cast<char*>("--no-block"),
                        const_cast<char*>(verb), const_cast<char*>(name), nullptr};
  char* const envp[] = {const_cast<char*>("PATH=/usr/sbin:/usr/bin:/sbin:/bin"),
                        const_cast<char*>("LANG=C"), nullptr};
  execve(kSystemctl, argv, envp);
  _exit(127);
}

// 64 bits: with a 32-bit long and time_t (armhf), seconds * 1000 overflows
// once the system has been up for 24.8 days.
std::int64_t MonotonicMs() {
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return std::int64_t{now.tv_sec} * 1000 + now.tv_nsec / 1000000;
}

enum class WaitResult { kExited, kTimedOut, kLost };

// Waits until |pid| has exited (its status in |status|) or |deadline_ms|
// has passed.  kLost when the child cannot be waited for (for instance
// because the host process ignores SIGCHLD and the kernel reaped it).
WaitResult WaitUntil(pid_t pid, std::int64_t deadline_ms, int& status) {
#ifdef SYS_pidfd_open
  ScopedFd pidfd(static_cast<int>(syscall(SYS_pidfd_open, pid, 0)));  // close-on-exec
  if (pidfd.valid()) {
    for (;;) {
      const std::int64_t left = deadline_ms - MonotonicMs();
      if (left <= 0) break;
      struct pollfd item = {pidfd.get(), POLLIN, 0};
      const int ready = poll(&item, 1, static_cast<int>(left));
      if (ready < 0 && errno != EINTR) break;
      if (ready > 0) break;
    }
  }
#endif
  // Without pidfd (or once it reported the exit): poll waitpid with naps
  // of a millisecond, never a long sleep.
  for (;;) {
    const pid_t done = waitpid(pid, &status, WNOHANG);
    if (done == pid) return WaitResult::kExited;
    if (done < 0 && errno != EINTR) return WaitResult::kLost;
    if (MonotonicMs() >= deadline_ms) return WaitResult::kTimedOut;
    const struct timespec nap = {0, 1000000};
    nanosleep(&nap, nullptr);
  }
}

int RunSystemctl(const char* verb, const char* name) {
  if (name == nullptr) name = "";
  const pid_t pid = fork();
  if (pid < 0) {
    ZORB_SET_ERROR(kErrSpawn);
    return -1;
  }
  if (pid == 0) ExecSystemctl(verb, name);

  int status = 0;
  switch (WaitUntil(pid, MonotonicMs() + kTimeoutMs, status)) {
    case WaitResult::kExited:
      break;
    case WaitResult::kLost:
      ZORB_SET_ERROR(kErrWait);
      return -1;
    case WaitResult::kTimedOut:
      kill(pid, SIGKILL);
      while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
      }
      ZORB_SET_ERROR(kErrTimeout);
      return -1;
  }
  if (WIFEXITED(status)) {
    if (WEXITSTATUS(status) == 0) return 0;
    ZORB_SET_ERROR(kErrExitStatus | static_cast<unsigned int>(WEXITSTATUS(status)));
    return -1;
  }
  ZORB_SET_ERROR(kErrKilled | static_cast<unsigned int>(WIFSIGNALED(status) ? WTERMSIG(status) : 0));
  return -1;
}

}  // namespace

}  // namespace platform
}  // namespace ZORVNOTIFYD
}  // namespace ZORV

int ZORBServiceStart(const char* name, int /*flags*/) {
  return ZORV::ZORVNOTIFYD::platform::RunSystemctl("start", name);
}

int ZORBServiceStop(const char* name, int /*flags*/) {
  return ZORV::ZORVNOTIFYD::platform::RunSystemctl("stop", name);
}
