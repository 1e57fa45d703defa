// Forked children with chosen ids, reporting back through shared memory.

#include "support/run_as.h"

#include <grp.h>
#include <stdio.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

namespace zorv_test {
namespace {

// What the child reports, in memory it shares with the parent (zero-filled).
struct Report {
  char error[64];  // why the child could not set its ids, or ""
  bool done;       // the child ran the function and reported
  int result, err;
  Ids after;
  size_t size;          // bytes of |lines| in use
  char lines[1 << 20];  // the captured lines, each as "priority\0format\0text\0"
};

[[noreturn]] void Child(Report& report, const Ids& ids, const std::function<int()>& fn) {
  ClearLogs();
  const char* failed = setgroups(0, nullptr) != 0                     ? "setgroups"
                       : setresgid(ids.rgid, ids.egid, ids.sgid) != 0 ? "setresgid"
                       : setresuid(ids.ruid, ids.euid, ids.suid) != 0 ? "setresuid"
                                                                      : nullptr;
  if (failed != nullptr) {
    snprintf(report.error, sizeof(report.error), "%s failed: %s", failed, strerror(errno));
    _exit(0);
  }
  errno = 0;
  report.result = fn();
  report.err = errno;
  getresuid(&report.after.ruid, &report.after.euid, &report.after.suid);
  getresgid(&report.after.rgid, &report.after.egid, &report.after.sgid);
  for (const LogLine& line : CapturedLogs()) {
    const std::string fields =
        std::to_string(line.priority) + '\0' + line.format + '\0' + line.text + '\0';
    if (report.size + fields.size() > sizeof(report.lines)) _exit(3);
    report.size += fields.copy(report.lines + report.size, fields.size());
  }
  report.done = true;
  _exit(0);
}

}  // namespace

ChildResult RunAs(const Ids& ids, const std::function<int()>& fn) {
  void* shared =
      mmap(nullptr, sizeof(Report), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
  if (shared == MAP_FAILED) return {false, 0, 0, Ids{}, {}, "mmap failed"};
  const Report& report = *static_cast<Report*>(shared);
  const pid_t pid = fork();
  if (pid == 0) Child(*static_cast<Report*>(shared), ids, fn);
  int status = 0;
  while (pid > 0 && waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  ChildResult result{false, report.result, report.err, report.after, {}, report.error};
  if (pid < 0) {
    result.error = "fork failed";
  } else if (WIFSIGNALED(status)) {
    result.error = "child killed by signal " + std::to_string(WTERMSIG(status));
  } else if (WEXITSTATUS(status) != 0) {
    result.error = "child exited with status " + std::to_string(WEXITSTATUS(status));
  } else if (!report.done && result.error.empty()) {
    result.error = "child exited without reporting";
  }
  result.exited = result.error.empty();
  // Braced initializers are evaluated in order.
  const char* field = report.lines;
  auto next = [&field] {
    std::string value = field;
    field += value.size() + 1;
    return value;
  };
  while (result.exited && field < report.lines + report.size) {
    result.logs.push_back({std::stoi(next()), next(), next()});
  }
  munmap(shared, sizeof(Report));
  return result;
}

// Six ids of one type, without padding.
bool operator==(const Ids& a, const Ids& b) { return memcmp(&a, &b, sizeof(Ids)) == 0; }

std::ostream& operator<<(std::ostream& out, const Ids& ids) {
  return out << "uid " << ids.ruid << '/' << ids.euid << '/' << ids.suid << " gid " << ids.rgid
             << '/' << ids.egid << '/' << ids.sgid;
}

}  // namespace zorv_test
