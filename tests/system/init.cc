// The first process of the ARM system that script/test-arm-system boots: it
// turns the boot into one run of the test programs.
//
// It mounts /dev, /proc, /sys and /tmp, loads the kernel modules found in
// /modules (the sandbox's overlay file system), installs busybox's applets,
// then runs each line of /tests.list in turn: a program and its arguments,
// separated by tabs.  Each program runs in its own process group, with the
// directory it lives in as its working directory, and is killed with the
// whole group when it outlives /tests.timeout seconds.  After each program a
// line
//   @@zorv-exit <program> <status>@@
// gives its exit status (128 + signal when killed, 124 on time-out); the line
// "@@zorv-done@@" closes the run, and the machine powers off.  The host reads
// these lines from the console.

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/reboot.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <fstream>
#include <sstream>
#include <string>
#include <vector>

namespace {

void Mount(const char* source, const char* target, const char* type) {
  mkdir(target, 0755);
  if (mount(source, target, type, 0, nullptr) != 0 && errno != EBUSY) {
    printf("init: mount %s on %s: %s\n", type, target, strerror(errno));
  }
}

void LoadModules() {
  DIR* dir = opendir("/modules");
  if (dir == nullptr) return;
  while (const dirent* entry = readdir(dir)) {
    if (entry->d_name[0] == '.') continue;
    const std::string path = std::string("/modules/") + entry->d_name;
    const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0 || syscall(SYS_finit_module, fd, "", 0) != 0) {
      printf("init: loading %s: %s\n", path.c_str(), strerror(errno));
    }
    if (fd >= 0) close(fd);
  }
  closedir(dir);
}

double Now() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return ts.tv_sec + ts.tv_nsec / 1e9;
}

// Runs |args| and returns its exit status: 128 + signal when it was killed,
// 124 when it was still running after |timeout| seconds (its process group
// is then killed), 127 when it could not be started.
int Run(std::vector<std::string> args, int timeout) {
  std::vector<char*> argv;
  for (std::string& arg : args) argv.push_back(arg.data());
  argv.push_back(nullptr);
  const std::string program = args[0];
  const std::string dir = program.substr(0, program.rfind('/') + 1);
  fflush(stdout);
  const pid_t pid = fork();
  if (pid < 0) return 127;
  if (pid == 0) {
    setpgid(0, 0);
    if (!dir.empty() && chdir(dir.c_str()) != 0) _exit(127);
    execv(argv[0], argv.data());
    printf("init: exec %s: %s\n", argv[0], strerror(errno));
    _exit(127);
  }
  setpgid(pid, pid);
  const double deadline = Now() + timeout;
  bool ended = false, timed_out = false;
  int status = 0;
  while (!ended) {
    // As the first process, collects every orphan too: a test that waits
    // for a grandchild to vanish must not find it a zombie.
    for (int any = 0;;) {
      const pid_t done = waitpid(-1, &any, WNOHANG);
      if (done <= 0) break;
      if (done == pid) {
        ended = true;
        status = any;
      }
    }
    if (!ended && Now() > deadline) {
      printf("init: %s still running after %d s: killed\n", program.c_str(), timeout);
      kill(-pid, SIGKILL);
      timed_out = true;
      while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
      }
      ended = true;
    }
    if (!ended) usleep(50 * 1000);
  }
  kill(-pid, SIGKILL);  // whatever the program left running in its group
  if (timed_out) return 124;
  return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

}  // namespace

int main() {
  Mount("devtmpfs", "/dev", "devtmpfs");
  const int console = open("/dev/console", O_RDWR);
  if (console >= 0) {
    dup2(console, 0);
    dup2(console, 1);
    dup2(console, 2);
    if (console > 2) close(console);
  }
  setvbuf(stdout, nullptr, _IOLBF, 0);
  Mount("proc", "/proc", "proc");
  Mount("sysfs", "/sys", "sysfs");
  Mount("tmpfs", "/tmp", "tmpfs");
  // As on a booted system: the daemon's runtime directory belongs in /run,
  // its state under /var/lib (where the tests' sandbox mounts a tmpfs).
  Mount("tmpfs", "/run", "tmpfs");
  mkdir("/var", 0755);
  mkdir("/var/lib", 0755);
  setenv("PATH", "/usr/sbin:/usr/bin:/sbin:/bin", 1);
  setenv("HOME", "/root", 1);
  setenv("GTEST_COLOR", "no", 1);
  LoadModules();
  Run({"/bin/busybox", "--install", "-s"}, 60);

  int timeout = 600;
  std::ifstream("/tests.timeout") >> timeout;
  std::ifstream list("/tests.list");
  for (std::string line; std::getline(list, line);) {
    std::vector<std::string> args;
    std::istringstream words(line);
    for (std::string word; std::getline(words, word, '\t');) args.push_back(word);
    if (args.empty() || args[0].empty()) continue;
    printf("init: running %s\n", line.c_str());
    const int status = Run(args, timeout);
    printf("@@zorv-exit %s %d@@\n", args[0].c_str(), status);
  }
  printf("@@zorv-done@@\n");
  sync();
  reboot(RB_POWER_OFF);
  for (;;) pause();
}
