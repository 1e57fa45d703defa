#include "support/child_process.h"

#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>

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

ScriptedServer::ScriptedServer(const char* path, uid_t uid,
                               const std::vector<std::vector<std::string>>& script,
                               const char* log) {
  unlink(path);
  int ready[2];
  if (pipe(ready) != 0) return;
  if ((pid_ = fork()) != 0) {
    close(ready[1]);
    char byte;
    if (read(ready[0], &byte, 1) != 1) Stop();
    close(ready[0]);
    return;
  }
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  strncpy(address.sun_path, path, sizeof(address.sun_path) - 1);
  if (bind(fd, reinterpret_cast<struct sockaddr*>(&address), sizeof(address)) != 0 ||
      setresgid(uid, uid, uid) != 0 || setresuid(uid, uid, uid) != 0 || listen(fd, 8) != 0 ||
      write(ready[1], "x", 1) != 1) {
    _exit(1);
  }
  FILE* out = fopen(log, "w");
  for (size_t n = 0;; ++n) {
    const int client = accept(fd, nullptr, nullptr);
    if (client < 0) _exit(1);
    std::string buffer, line;
    for (size_t i = 0; n >= script.size() || i < script[n].size(); ++i) {
      if (!ReadLine(client, buffer, &line)) break;
      if (out != nullptr) {
        fprintf(out, "%zu %s\n", n, line.c_str());
        fflush(out);
      }
      if (n >= script.size()) continue;
      const std::string& answer = script[n][i];
      if (write(client, answer.data(), answer.size()) != ssize_t(answer.size())) break;
    }
    if (n + 1 < script.size()) close(client);
  }
}

void ScriptedServer::Stop() {
  if (pid_ > 0 && kill(pid_, SIGKILL) == 0) waitpid(pid_, nullptr, 0);
  pid_ = -1;
}

}  // namespace zorv_test
