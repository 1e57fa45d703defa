// Forked children with chosen ids, reporting back through a pipe.

#include "support/run_as.h"

#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <stdint.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>

namespace zorv_test {
namespace {

// Closes a descriptor when the scope ends, unless it was closed already.
class Fd {
 public:
  explicit Fd(int fd) : fd_(fd) {}
  Fd(const Fd&) = delete;
  Fd& operator=(const Fd&) = delete;
  ~Fd() { Close(); }
  int get() const { return fd_; }
  void Close() {
    if (fd_ >= 0) close(fd_);
    fd_ = -1;
  }

 private:
  int fd_;
};

// The report starts with a tag: a result, or the failure of a set-up step.
constexpr char kResultTag = 'R';
constexpr char kSetupFailedTag = 'E';

void PutInt(std::string& out, int64_t value) {
  uint32_t bits = static_cast<uint32_t>(value);
  out.append(reinterpret_cast<const char*>(&bits), sizeof(bits));
}

void PutString(std::string& out, const std::string& value) {
  PutInt(out, static_cast<int64_t>(value.size()));
  out += value;
}

// Reads what PutInt and PutString wrote; ok() turns false on a short report.
class Reader {
 public:
  explicit Reader(const std::string& data) : data_(data) {}
  uint32_t Int() {
    uint32_t bits = 0;
    if (!Take(sizeof(bits))) return 0;
    memcpy(&bits, data_.data() + pos_ - sizeof(bits), sizeof(bits));
    return bits;
  }
  std::string String() {
    uint32_t size = Int();
    if (!Take(size)) return std::string();
    return data_.substr(pos_ - size, size);
  }
  char Tag() { return Take(1) ? data_[pos_ - 1] : '\0'; }
  bool ok() const { return ok_; }
  bool AtEnd() const { return pos_ == data_.size(); }

 private:
  bool Take(size_t size) {
    if (!ok_ || data_.size() - pos_ < size) {
      ok_ = false;
      return false;
    }
    pos_ += size;
    return true;
  }
  const std::string& data_;
  size_t pos_ = 0;
  bool ok_ = true;
};

void PutIds(std::string& out, const Ids& ids) {
  for (int64_t id : {ids.ruid, ids.euid, ids.suid, ids.rgid, ids.egid, ids.sgid}) PutInt(out, id);
}

Ids GetIds(Reader& in) {
  Ids ids;
  ids.ruid = in.Int();
  ids.euid = in.Int();
  ids.suid = in.Int();
  ids.rgid = in.Int();
  ids.egid = in.Int();
  ids.sgid = in.Int();
  return ids;
}

bool WriteAll(int fd, const std::string& data) {
  size_t done = 0;
  while (done < data.size()) {
    ssize_t n = write(fd, data.data() + done, data.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

std::string ReadAll(int fd) {
  std::string data;
  char buffer[4096];
  for (;;) {
    ssize_t n = read(fd, buffer, sizeof(buffer));
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return data;
    data.append(buffer, static_cast<size_t>(n));
  }
}

// Returns the name of the call that failed, with its errno in |err|, or
// nullptr.
const char* SetIds(const Ids& ids, int& err) {
  const char* failed = nullptr;
  if (setgroups(0, nullptr) != 0) {
    failed = "setgroups";
  } else if (setresgid(ids.rgid, ids.egid, ids.sgid) != 0) {
    failed = "setresgid";
  } else if (setresuid(ids.ruid, ids.euid, ids.suid) != 0) {
    failed = "setresuid";
  }
  err = errno;
  return failed;
}

// The child's side: never returns.
[[noreturn]] void ChildMain(int report_fd, const Ids* ids, const std::function<int()>& fn) {
  ClearLogs();
  std::string report;
  int setup_err = 0;
  const char* failed_step = ids != nullptr ? SetIds(*ids, setup_err) : nullptr;
  if (failed_step != nullptr) {
    report += kSetupFailedTag;
    PutInt(report, setup_err);
    PutString(report, failed_step);
    _exit(WriteAll(report_fd, report) ? 0 : 2);
  }
  errno = 0;
  int result = fn();
  int err = errno;
  Ids after = CurrentIds();
  std::vector<LogLine> logs = CapturedLogs();
  report += kResultTag;
  PutInt(report, result);
  PutInt(report, err);
  PutIds(report, after);
  PutInt(report, static_cast<int64_t>(logs.size()));
  for (const LogLine& line : logs) {
    PutInt(report, line.priority);
    PutString(report, line.format);
    PutString(report, line.text);
  }
  _exit(WriteAll(report_fd, report) ? 0 : 2);
}

std::string DescribeStatus(int status) {
  if (WIFSIGNALED(status)) return "child killed by signal " + std::to_string(WTERMSIG(status));
  if (WIFEXITED(status)) return "child exited with status " + std::to_string(WEXITSTATUS(status));
  return "child stopped";
}

// Fills |result| from the report and the wait status.
void Decode(const std::string& report, int status, ChildResult& result) {
  if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
    result.error = DescribeStatus(status);
    return;
  }
  Reader in(report);
  char tag = in.Tag();
  if (tag == kSetupFailedTag) {
    int err = static_cast<int>(in.Int());
    std::string step = in.String();
    result.error = step + " failed: " + strerror(err);
    return;
  }
  if (tag != kResultTag) {
    result.error = "child exited without reporting";
    return;
  }
  result.result = static_cast<int>(in.Int());
  result.err = static_cast<int>(in.Int());
  result.after = GetIds(in);
  uint32_t count = in.Int();
  for (uint32_t i = 0; i < count && in.ok(); ++i) {
    LogLine line;
    line.priority = static_cast<int>(in.Int());
    line.format = in.String();
    line.text = in.String();
    result.logs.push_back(std::move(line));
  }
  if (!in.ok() || !in.AtEnd()) {
    result.error = "child sent a malformed report";
    return;
  }
  result.exited = true;
}

ChildResult Run(const Ids* ids, const std::function<int()>& fn) {
  ChildResult result{false, 0, 0, Ids{}, {}, std::string()};
  int pipe_fds[2];
  if (pipe2(pipe_fds, O_CLOEXEC) != 0) {
    result.error = std::string("pipe2: ") + strerror(errno);
    return result;
  }
  Fd read_end(pipe_fds[0]);
  Fd write_end(pipe_fds[1]);
  pid_t pid = fork();
  if (pid < 0) {
    result.error = std::string("fork: ") + strerror(errno);
    return result;
  }
  if (pid == 0) {
    read_end.Close();
    ChildMain(write_end.get(), ids, fn);
  }
  // The parent's write end must go, or reading never sees the end.
  write_end.Close();
  std::string report = ReadAll(read_end.get());
  int status = 0;
  while (waitpid(pid, &status, 0) < 0) {
    if (errno != EINTR) {
      result.error = std::string("waitpid: ") + strerror(errno);
      return result;
    }
  }
  Decode(report, status, result);
  return result;
}

}  // namespace

bool operator==(const Ids& a, const Ids& b) {
  return a.ruid == b.ruid && a.euid == b.euid && a.suid == b.suid && a.rgid == b.rgid &&
         a.egid == b.egid && a.sgid == b.sgid;
}

bool operator!=(const Ids& a, const Ids& b) { return !(a == b); }

std::ostream& operator<<(std::ostream& out, const Ids& ids) {
  return out << "uid " << ids.ruid << '/' << ids.euid << '/' << ids.suid << " gid " << ids.rgid
             << '/' << ids.egid << '/' << ids.sgid;
}

Ids CurrentIds() {
  Ids ids{};
  getresuid(&ids.ruid, &ids.euid, &ids.suid);
  getresgid(&ids.rgid, &ids.egid, &ids.sgid);
  return ids;
}

ChildResult RunAs(const Ids& ids, const std::function<int()>& fn) { return Run(&ids, fn); }

ChildResult RunInChild(const std::function<int()>& fn) { return Run(nullptr, fn); }

}  // namespace zorv_test
