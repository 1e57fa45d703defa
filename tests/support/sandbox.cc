// The mount namespace sandbox of the test programs and its fake systemctl.

#include "support/sandbox.h"

#include <linux/magic.h>
#include <sched.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/vfs.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>

namespace zorv_test {
namespace {

namespace fs = std::filesystem;

const std::string kDir = "/usr/lib/zorv-test/";  // the fake's records and exit status

// Records its arguments and what it saw of itself, then exits with the
// configured status.  Built-ins only (the environment is empty); the
// descriptors are listed before any redirection opens one, the script's own
// excluded.
constexpr char kScript[] = R"(#!/bin/sh
fds= ids= null0=0 null1=0 status=0
for f in /proc/$$/fd/*; do [ -h $f ] && ! [ $f -ef $0 ] && fds="$fds ${f##*/}"; done
while read -r k r e s x; do case $k in Uid:|Gid:) ids="$ids $r $e $s" ;; esac; done </proc/$$/status
[ /proc/$$/fd/0 -ef /dev/null ] && null0=1; [ /proc/$$/fd/1 -ef /dev/null ] && null1=1
cd /usr/lib/zorv-test && printf '%s\n' "$*" >>calls && echo "$ids $null0 $null1$fds" >>procs
[ -r status ] && read -r status <status
exit $status
)";

bool g_active = false;
std::string g_reason = "EnterSandbox was not called";

// Replaces |path| by a new file holding |content| with exactly |mode|; throws on failure.
void WriteFile(const std::string& path, const std::string& content, int mode) {
  if (!g_active) return;
  fs::remove(path);
  std::ofstream(path) << content;
  fs::permissions(path, fs::perms(mode));
}

// "" or what failed.  Mounts made before a failure stay, in the private namespace.
std::string SetUp() {
  if (unshare(CLONE_NEWNS) != 0) return std::string("unshare(CLONE_NEWNS): ") + strerror(errno);
  // From here on nothing propagates back to the host's mounts.
  if (mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) return "make / private";
  // The overlay's layers are on a tmpfs that the fresh /tmp hides; the upper
  // directory gives the merged /usr its owner and mode.
  struct stat usr;
  struct statfs usr_fs, tmp_fs;
  if (mount("stash", "/tmp", "tmpfs", 0, "mode=0700") != 0 || stat("/usr", &usr) != 0 ||
      mkdir("/tmp/upper", 0) != 0 || chmod("/tmp/upper", usr.st_mode & 07777) != 0 ||
      chown("/tmp/upper", usr.st_uid, usr.st_gid) != 0 || mkdir("/tmp/work", 0700) != 0 ||
      mount("usr", "/usr", "overlay", 0, "lowerdir=/usr,upperdir=/tmp/upper,workdir=/tmp/work") ||
      mount("tmp", "/tmp", "tmpfs", MS_NOSUID | MS_NODEV, "mode=1777") != 0) {
    return std::string("overlay on /usr, tmpfs on /tmp: ") + strerror(errno);
  }
  // The daemon's default state directory is made there, never on the host.
  if (mount("varlib", "/var/lib", "tmpfs", MS_NOSUID | MS_NODEV, "mode=0755") != 0) {
    return std::string("tmpfs on /var/lib: ") + strerror(errno);
  }
  // The host's /usr and /tmp are out of reach.
  if (statfs("/usr", &usr_fs) != 0 || usr_fs.f_type != OVERLAYFS_SUPER_MAGIC ||
      statfs("/tmp", &tmp_fs) != 0 || tmp_fs.f_type != TMPFS_MAGIC || !fs::is_empty("/tmp")) {
    return "the overlay on /usr or the empty tmpfs on /tmp is not in place";
  }
  g_active = true;
  ResetStore();
  return "";
}

}  // namespace

bool EnterSandbox() {
  try {
    g_reason = g_active ? "" : SetUp();
  } catch (const std::exception& e) {
    g_reason = e.what();
  }
  return g_active = g_reason.empty();
}

bool SandboxActive() { return g_active; }

const char* SandboxSkipReason() { return g_reason.c_str(); }

void ResetStore() {
  if (!g_active) return;
  for (const char* tree : {"/usr/zorv", "/usr/local/etc/zorvnotifyd",
                           "/tmp/zorvnotifyd_monitor_q.lock", "/var/lib/zorvnotifyd"}) {
    fs::remove_all(tree);
  }
  fs::create_directories(kDir);
  fs::remove(kDir + "status");
  // Where the tests' daemons listen: root's and writable by root alone, as
  // the daemon requires of its socket's directory (/tmp itself is not).
  fs::create_directories(kSocketDir);
  fs::permissions(kSocketDir, fs::perms(0755));
  WriteFile("/usr/bin/systemctl", kScript, 0755);
  WriteFile(kDir + "calls", "", 0666);
  WriteFile(kDir + "procs", "", 0666);
}

std::vector<std::string> SystemctlCalls() {
  std::vector<std::string> calls;
  std::ifstream in(g_active ? kDir + "calls" : "");
  for (std::string line; std::getline(in, line);) calls.push_back(line);
  return calls;
}

std::vector<SystemctlProcess> SystemctlProcesses() {
  std::vector<SystemctlProcess> processes;
  std::ifstream in(g_active ? kDir + "procs" : "");
  // "ruid euid suid rgid egid sgid stdin_null stdout_null fd..."
  for (std::string line; std::getline(in, line);) {
    std::istringstream fields(line);
    SystemctlProcess& p = processes.emplace_back();
    fields >> p.ruid >> p.euid >> p.suid >> p.rgid >> p.egid >> p.sgid >> p.stdin_null >>
        p.stdout_null;
    for (int fd; fields >> fd;) p.fds.push_back(fd);
    std::sort(p.fds.begin(), p.fds.end());
  }
  return processes;
}

void SetSystemctlExitStatus(int status) {
  WriteFile(kDir + "status", std::to_string(status) + "\n", 0644);
}

void RemoveSystemctl() {
  if (g_active) fs::remove("/usr/bin/systemctl");
}

}  // namespace zorv_test
