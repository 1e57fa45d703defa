#include "support/child_process.h"

#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

namespace zorv_test {

bool ReadLine(int fd, std::string& buffer, std::string* line) {
  for (size_t end; (end = buffer.find('\n')) == std::string::npos;) {
    struct pollfd p = {fd, POLLIN, 0};
    char chunk[65536];
    ssize_t n = 0;
    if (poll(&p, 1, 10000) <= 0 || (n = read(fd, chunk, sizeof(chunk))) <= 0) return false;
    buffer.append(chunk, size_t(n));
  }
  const size_t end = buffer.find('\n');
  *line = buffer.substr(0, end);
  buffer.erase(0, end + 1);
  return true;
}

bool PrivateReadOnlyUsr() {
  return unshare(CLONE_NEWNS) == 0 &&
         mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
         mount(nullptr, "/usr", nullptr, MS_REMOUNT | MS_BIND | MS_RDONLY, nullptr) == 0;
}

ChildProcess::ChildProcess(std::vector<std::string> args, const std::function<bool()>& in_child,
                           bool merge) {
  EXPECT_TRUE(pipe2(out_, O_CLOEXEC) == 0 && pipe2(err_, O_CLOEXEC) == 0);
  if ((pid_ = fork()) == 0) {
    if (dup2(out_[1], 1) < 0 || dup2(merge ? out_[1] : err_[1], 2) < 0) _exit(125);
    if (in_child && !in_child()) _exit(126);
    std::vector<char*> argv;
    for (std::string& arg : args) argv.push_back(&arg[0]);
    argv.push_back(nullptr);
    execv(argv[0], argv.data());
    _exit(127);
  }
  for (int fd : {out_[1], err_[1]}) close(fd);
}

ChildProcess::~ChildProcess() {
  if (pid_ > 0 && kill(pid_, SIGKILL) == 0) waitpid(pid_, nullptr, 0);
  for (int fd : {out_[0], err_[0]}) close(fd);
}

std::string ChildProcess::Read(bool err) {
  std::string line;
  return ReadLine(err ? err_[0] : out_[0], err ? err_text_ : out_text_, &line) ? line : "";
}

std::string ChildProcess::WaitFor(const std::string& text, bool err) {
  std::string line;
  while (ReadLine(err ? err_[0] : out_[0], err ? err_text_ : out_text_, &line)) {
    if (line.find(text) != std::string::npos) return line;
  }
  return "";
}

int ChildProcess::Stop(int signal) {
  int status = 0;
  if (kill(pid_, signal) != 0) return -1;
  for (int i = 0; i < 1000; ++i, usleep(10000)) {
    if (waitpid(pid_, &status, WNOHANG) != pid_) continue;
    pid_ = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
  return -1;
}

}  // namespace zorv_test
