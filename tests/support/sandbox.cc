// The mount namespace sandbox of the test programs and its fake systemctl.

#include "support/sandbox.h"

#include <fcntl.h>
#include <ftw.h>
#include <sched.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <fstream>
#include <sstream>

namespace zorv_test {
namespace {

// Mount point of the stash tmpfs while the overlay is built; the fresh /tmp
// is mounted over it afterwards, so tests never see the overlay's layers.
constexpr char kStash[] = "/tmp";
constexpr char kUpper[] = "/tmp/upper";
constexpr char kWork[] = "/tmp/work";
constexpr char kOverlayOptions[] = "lowerdir=/usr,upperdir=/tmp/upper,workdir=/tmp/work";

constexpr char kSystemctl[] = "/usr/bin/systemctl";
constexpr char kFakeDir[] = "/usr/lib/zorv-test";
constexpr char kCallLog[] = "/usr/lib/zorv-test/systemctl.log";
constexpr char kProcessLog[] = "/usr/lib/zorv-test/systemctl.procs";
constexpr char kStatusFile[] = "/usr/lib/zorv-test/systemctl.status";

// Built-ins only: the script runs with an empty environment (no PATH).  The
// descriptors are listed first, before any redirection of its own opens
// one.  The record files are writable by everyone, so a call that runs
// without root is recorded too.
constexpr char kFakeSystemctl[] = R"(#!/bin/sh
# Test double of systemctl: records the call, exits with the configured status.
fds=
for f in /proc/$$/fd/*; do
  # Skips the directory the glob read (closed by now) and the script itself.
  [ -h "$f" ] && ! [ "$f" -ef /usr/bin/systemctl ] && fds="$fds ${f##*/}"
done
stdin_null=0
stdout_null=0
[ /proc/$$/fd/0 -ef /dev/null ] && stdin_null=1
[ /proc/$$/fd/1 -ef /dev/null ] && stdout_null=1
ids=
while read -r key real effective saved rest; do
  case $key in Uid:|Gid:) ids="$ids $real $effective $saved" ;; esac
done < /proc/$$/status
IFS=' '
printf '%s\n' "$*" >> /usr/lib/zorv-test/systemctl.log
printf '%s|%s|%s %s\n' "${ids# }" "${fds# }" "$stdin_null" "$stdout_null" \
  >> /usr/lib/zorv-test/systemctl.procs
status=0
if [ -r /usr/lib/zorv-test/systemctl.status ]; then
  read -r status < /usr/lib/zorv-test/systemctl.status
fi
exit "$status"
)";

constexpr char kStoreLock[] = "/tmp/zorvnotifyd_monitor_q.lock";
constexpr const char* kStoreTrees[] = {"/usr/zorv", "/usr/local/etc/zorvnotifyd", kStoreLock};

bool g_active = false;
std::string g_reason = "EnterSandbox was not called";

std::string Failure(const std::string& what, int err) { return what + ": " + strerror(err); }

// Closes a descriptor when the scope ends.
class FdCloser {
 public:
  explicit FdCloser(int fd) : fd_(fd) {}
  FdCloser(const FdCloser&) = delete;
  FdCloser& operator=(const FdCloser&) = delete;
  ~FdCloser() {
    if (fd_ >= 0) close(fd_);
  }

 private:
  int fd_;
};

// Replaces |path| by a new regular file holding |content| with exactly
// |mode| (the umask plays no part).  Returns "" or what failed.
std::string WriteNewFile(const char* path, const std::string& content, mode_t mode) {
  if (unlink(path) != 0 && errno != ENOENT) return Failure(std::string("unlink ") + path, errno);
  int fd = open(path, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode);
  if (fd < 0) return Failure(std::string("create ") + path, errno);
  FdCloser closer(fd);
  size_t done = 0;
  while (done < content.size()) {
    ssize_t n = write(fd, content.data() + done, content.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return Failure(std::string("write ") + path, errno);
    done += static_cast<size_t>(n);
  }
  if (fchmod(fd, mode) != 0) return Failure(std::string("chmod ") + path, errno);
  return std::string();
}

int RemoveEntry(const char* path, const struct stat* /*st*/, int /*flag*/, struct FTW* /*ftw*/) {
  return remove(path) == 0 ? 0 : -1;
}

// Removes |path| and everything below it, without following links.  A
// missing path is a success.
std::string RemoveTree(const char* path) {
  struct stat st;
  if (lstat(path, &st) != 0) {
    return errno == ENOENT ? std::string() : Failure(std::string("lstat ") + path, errno);
  }
  if (nftw(path, RemoveEntry, 16, FTW_DEPTH | FTW_PHYS) != 0) {
    return Failure(std::string("remove ") + path, errno);
  }
  return std::string();
}

// Installs the fake systemctl and empties its records and exit status.
std::string InstallFakeSystemctl() {
  if (mkdir(kFakeDir, 0755) != 0 && errno != EEXIST) {
    return Failure(std::string("mkdir ") + kFakeDir, errno);
  }
  std::string error = WriteNewFile(kSystemctl, kFakeSystemctl, 0755);
  if (error.empty()) error = WriteNewFile(kCallLog, "", 0666);
  if (error.empty()) error = WriteNewFile(kProcessLog, "", 0666);
  if (error.empty() && unlink(kStatusFile) != 0 && errno != ENOENT) {
    error = Failure(std::string("unlink ") + kStatusFile, errno);
  }
  return error;
}

std::vector<std::string> ReadLines(const char* path) {
  std::vector<std::string> lines;
  std::ifstream in(path);
  for (std::string line; std::getline(in, line);) lines.push_back(line);
  return lines;
}

// Mounts made so far by EnterSandbox, undone in reverse order unless
// released.
class MountStack {
 public:
  MountStack() = default;
  MountStack(const MountStack&) = delete;
  MountStack& operator=(const MountStack&) = delete;
  ~MountStack() {
    for (auto it = targets_.rbegin(); it != targets_.rend(); ++it) umount2(*it, MNT_DETACH);
  }
  // Mounts and remembers the mount; returns "" or what failed.
  std::string Mount(const char* source, const char* target, const char* type, unsigned long flags,
                    const char* options) {
    if (mount(source, target, type, flags, options) != 0) {
      return Failure(std::string("mount ") + type + " on " + target, errno);
    }
    targets_.push_back(target);
    return std::string();
  }
  void Release() { targets_.clear(); }

 private:
  std::vector<const char*> targets_;
};

// The overlay's upper directory gives /usr its owner and mode: copy them
// from the real /usr so that the merged /usr looks the same.
std::string PrepareLayers() {
  struct stat usr;
  if (stat("/usr", &usr) != 0) return Failure("stat /usr", errno);
  if (mkdir(kUpper, 0755) != 0) return Failure(std::string("mkdir ") + kUpper, errno);
  if (mkdir(kWork, 0700) != 0) return Failure(std::string("mkdir ") + kWork, errno);
  if (chown(kUpper, usr.st_uid, usr.st_gid) != 0) return Failure("chown upper", errno);
  if (chmod(kUpper, usr.st_mode & 07777) != 0) return Failure("chmod upper", errno);
  return std::string();
}

std::string SetUp() {
  if (unshare(CLONE_NEWNS) != 0) return Failure("unshare(CLONE_NEWNS)", errno);
  // From here on nothing propagates back to the host's mounts.
  if (mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
    return Failure("make / private", errno);
  }
  MountStack mounts;
  std::string error = mounts.Mount("zorv-stash", kStash, "tmpfs", 0, "mode=0700");
  if (error.empty()) error = PrepareLayers();
  if (error.empty()) error = mounts.Mount("zorv-usr", "/usr", "overlay", 0, kOverlayOptions);
  if (error.empty()) {
    error = mounts.Mount("zorv-tmp", "/tmp", "tmpfs", MS_NOSUID | MS_NODEV, "mode=1777");
  }
  if (error.empty()) error = InstallFakeSystemctl();
  if (error.empty()) mounts.Release();
  return error;
}

}  // namespace

bool EnterSandbox() {
  if (g_active) return true;
  std::string error = SetUp();
  if (!error.empty()) {
    g_reason = error;
    return false;
  }
  g_active = true;
  g_reason.clear();
  return true;
}

bool SandboxActive() { return g_active; }

const char* SandboxSkipReason() { return g_reason.c_str(); }

void ResetStore() {
  if (!g_active) return;
  for (const char* tree : kStoreTrees) {
    std::string error = RemoveTree(tree);
    if (!error.empty()) ADD_FAILURE() << "ResetStore: " << error;
  }
  std::string error = InstallFakeSystemctl();
  if (!error.empty()) ADD_FAILURE() << "ResetStore: " << error;
}

std::vector<std::string> SystemctlCalls() {
  if (!g_active) return {};
  return ReadLines(kCallLog);
}

std::vector<SystemctlProcess> SystemctlProcesses() {
  std::vector<SystemctlProcess> processes;
  if (!g_active) return processes;
  for (const std::string& line : ReadLines(kProcessLog)) {
    // "ruid euid suid rgid egid sgid|fd fd ...|stdin_null stdout_null"
    std::string ids = line.substr(0, line.find('|'));
    std::string rest = line.substr(std::min(line.size(), ids.size() + 1));
    std::string fds = rest.substr(0, rest.find('|'));
    std::string flags = rest.substr(std::min(rest.size(), fds.size() + 1));
    SystemctlProcess process{};
    std::istringstream(ids) >> process.ruid >> process.euid >> process.suid >> process.rgid >>
        process.egid >> process.sgid;
    std::istringstream fd_stream(fds);
    for (int fd; fd_stream >> fd;) process.fds.push_back(fd);
    std::sort(process.fds.begin(), process.fds.end());
    int stdin_null = 0;
    int stdout_null = 0;
    std::istringstream(flags) >> stdin_null >> stdout_null;
    process.stdin_null = stdin_null == 1;
    process.stdout_null = stdout_null == 1;
    processes.push_back(process);
  }
  return processes;
}

void SetSystemctlExitStatus(int status) {
  if (!g_active) return;
  std::string error = WriteNewFile(kStatusFile, std::to_string(status) + "\n", 0644);
  if (!error.empty()) ADD_FAILURE() << "SetSystemctlExitStatus: " << error;
}

void RemoveSystemctl() {
  if (!g_active) return;
  if (unlink(kSystemctl) != 0 && errno != ENOENT) {
    ADD_FAILURE() << "RemoveSystemctl: " << Failure("unlink", errno);
  }
}

}  // namespace zorv_test
