// The syslog entry points that replace the C library's in a test program,
// and the store of captured lines.  <syslog.h> is not included: under
// _FORTIFY_SOURCE it turns syslog into an inline wrapper around __syslog_chk.

#include "support/syslog_capture.h"

#include <pthread.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>

#include <cerrno>
#include <mutex>

namespace zorv_test {
namespace {

std::mutex g_mutex;
// Never destroyed, so that lines logged while the program exits still find it.
std::vector<LogLine>& g_lines = *new std::vector<LogLine>;

// Held across fork(), so that no child inherits it locked by a thread it does not have.
[[maybe_unused]] const int g_fork_safe =
    pthread_atfork([] { g_mutex.lock(); }, [] { g_mutex.unlock(); }, [] { g_mutex.unlock(); });

// The C library's printf expands "%m" to the text of errno, as syslog does.
void Capture(int priority, const char* format, va_list args) {
  const int saved = errno;
  char* text = nullptr;
  if (vasprintf(&text, format, args) < 0) text = nullptr;
  std::lock_guard<std::mutex> lock(g_mutex);
  g_lines.push_back({priority, format, text != nullptr ? text : ""});
  free(text);
  errno = saved;
}

}  // namespace

std::vector<LogLine> CapturedLogs() {
  std::lock_guard<std::mutex> lock(g_mutex);
  return g_lines;
}

void ClearLogs() {
  std::lock_guard<std::mutex> lock(g_mutex);
  g_lines.clear();
}

std::vector<LogLine> LogsContaining(const std::string& needle) {
  std::vector<LogLine> found;
  for (const LogLine& line : CapturedLogs()) {
    if (line.text.find(needle) != std::string::npos) found.push_back(line);
  }
  return found;
}

std::string DumpLogs() {
  std::string out;
  for (const LogLine& line : CapturedLogs()) {
    out += std::to_string(line.priority) + ' ' + line.text + '\n';
  }
  return out;
}

}  // namespace zorv_test

extern "C" {

void vsyslog(int priority, const char* format, va_list args) {
  zorv_test::Capture(priority, format, args);
}

void __vsyslog_chk(int priority, int /*flag*/, const char* format, va_list args) {
  zorv_test::Capture(priority, format, args);
}

void syslog(int priority, const char* format, ...) {
  va_list args;
  va_start(args, format);
  zorv_test::Capture(priority, format, args);
  va_end(args);
}

void __syslog_chk(int priority, int /*flag*/, const char* format, ...) {
  va_list args;
  va_start(args, format);
  zorv_test::Capture(priority, format, args);
  va_end(args);
}

}  // extern "C"
