// Definitions of the syslog entry points that replace the C library's in a
// test program, and the store of captured lines.

// The fortified <syslog.h> turns syslog into an inline wrapper, which would
// clash with the definition below; __syslog_chk is defined here as well, so
// fortified callers elsewhere are still captured.
#ifdef _FORTIFY_SOURCE
#undef _FORTIFY_SOURCE
#endif

#include "support/syslog_capture.h"

#include <pthread.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <syslog.h>

#include <cerrno>
#include <mutex>
#include <sstream>

namespace zorv_test {
namespace {

struct CaptureStore {
  std::mutex mutex;
  std::vector<LogLine> lines;
  int openlog_calls = 0;
  bool echo = false;
};

// Holding the store's mutex across fork() keeps a child from inheriting it
// locked by a thread that does not exist in the child.
void LockForFork();
void UnlockAfterFork();

// Created on first use and never destroyed, so that lines logged while the
// program exits (static destructors, other threads) still find it.
CaptureStore& Store() {
  static CaptureStore* store = [] {
    auto* created = new CaptureStore;
    created->echo = getenv("ZORV_TEST_ECHO_LOGS") != nullptr;
    pthread_atfork(LockForFork, UnlockAfterFork, UnlockAfterFork);
    return created;
  }();
  return *store;
}

void LockForFork() { Store().mutex.lock(); }
void UnlockAfterFork() { Store().mutex.unlock(); }

// Restores errno when the capture returns, whatever happened inside it.
class ErrnoKeeper {
 public:
  ErrnoKeeper() : saved_(errno) {}
  ErrnoKeeper(const ErrnoKeeper&) = delete;
  ErrnoKeeper& operator=(const ErrnoKeeper&) = delete;
  ~ErrnoKeeper() { errno = saved_; }
  int saved() const { return saved_; }

 private:
  int saved_;
};

// |format| with every "%m" replaced by the text of |err|, as syslog does.
// "%%" is kept as it is, so "%%m" stays a literal "%m".
std::string ExpandErrno(const char* format, int err) {
  char buffer[256] = {};
  const char* message = strerror_r(err, buffer, sizeof(buffer));
  std::string out;
  for (const char* p = format; *p != '\0'; ++p) {
    if (*p != '%' || (p[1] != 'm' && p[1] != '%')) {
      out += *p;
      continue;
    }
    ++p;
    if (*p == '%') {
      out += "%%";
      continue;
    }
    for (const char* m = message; *m != '\0'; ++m) {
      out += *m;
      if (*m == '%') out += '%';
    }
  }
  return out;
}

std::string Format(const std::string& format, va_list args) {
  va_list copy;
  va_copy(copy, args);
  char small[512];
  int length = vsnprintf(small, sizeof(small), format.c_str(), copy);
  va_end(copy);
  if (length < 0) return std::string();
  if (static_cast<size_t>(length) < sizeof(small)) return std::string(small, length);
  std::string large(static_cast<size_t>(length) + 1, '\0');
  vsnprintf(&large[0], large.size(), format.c_str(), args);
  large.resize(static_cast<size_t>(length));
  return large;
}

void Capture(int priority, const char* format, va_list args) {
  ErrnoKeeper keeper;
  LogLine line{priority, format != nullptr ? format : "", std::string()};
  line.text = Format(ExpandErrno(line.format.c_str(), keeper.saved()), args);
  CaptureStore& store = Store();
  std::lock_guard<std::mutex> guard(store.mutex);
  if (store.echo) fprintf(stderr, "[syslog %d] %s\n", line.priority, line.text.c_str());
  store.lines.push_back(std::move(line));
}

}  // namespace

std::vector<LogLine> CapturedLogs() {
  CaptureStore& store = Store();
  std::lock_guard<std::mutex> guard(store.mutex);
  return store.lines;
}

void ClearLogs() {
  CaptureStore& store = Store();
  std::lock_guard<std::mutex> guard(store.mutex);
  store.lines.clear();
}

std::vector<LogLine> LogsContaining(const std::string& needle) {
  std::vector<LogLine> found;
  for (LogLine& line : CapturedLogs()) {
    if (line.text.find(needle) != std::string::npos) found.push_back(std::move(line));
  }
  return found;
}

std::string DumpLogs() {
  std::ostringstream out;
  for (const LogLine& line : CapturedLogs()) out << line.priority << ' ' << line.text << '\n';
  return out.str();
}

int OpenlogCalls() {
  CaptureStore& store = Store();
  std::lock_guard<std::mutex> guard(store.mutex);
  return store.openlog_calls;
}

}  // namespace zorv_test

// The replacements, with the C library's signatures.
extern "C" {

void openlog(const char* /*ident*/, int /*option*/, int /*facility*/) {
  zorv_test::ErrnoKeeper keeper;
  zorv_test::CaptureStore& store = zorv_test::Store();
  std::lock_guard<std::mutex> guard(store.mutex);
  ++store.openlog_calls;
}

void closelog(void) {}

void vsyslog(int priority, const char* format, va_list args) {
  zorv_test::Capture(priority, format, args);
}

void syslog(int priority, const char* format, ...) {
  va_list args;
  va_start(args, format);
  zorv_test::Capture(priority, format, args);
  va_end(args);
}

void __vsyslog_chk(int priority, int /*flag*/, const char* format, va_list args) {
  zorv_test::Capture(priority, format, args);
}

void __syslog_chk(int priority, int /*flag*/, const char* format, ...) {
  va_list args;
  va_start(args, format);
  zorv_test::Capture(priority, format, args);
  va_end(args);
}

}  // extern "C"
