// The syslog entry points of the tool.  The executable exports them, so
// the dynamic linker binds the library's calls to these rather than to the
// C library's.  <syslog.h> is not included for the definitions: under
// _FORTIFY_SOURCE it turns syslog into an inline wrapper.

#include "library_log.h"

#include <stdarg.h>

#include <atomic>
#include <cstring>

extern "C" void vsyslog(int priority, const char* format, va_list args);

namespace zorvnotifyctl {
namespace {

std::atomic<bool> g_quiet{false};
std::atomic<bool> g_lock_failed{false};
std::atomic<bool> g_service_failed{false};

// Notes |format| and tells whether the line is to be logged.
bool Note(const char* format) {
  if (format != nullptr && (strstr(format, "ZORBServiceStart failed") != nullptr ||
                            strstr(format, "ZORBServiceStop failed") != nullptr)) {
    g_service_failed = true;
  }
  if (format == nullptr || strstr(format, "Lock failed") == nullptr) return true;
  g_lock_failed = true;
  return !g_quiet;
}

}  // namespace

void ResetLibraryLog(bool quiet_lock_failures) {
  g_quiet = quiet_lock_failures;
  g_lock_failed = false;
  g_service_failed = false;
}

bool LibraryReportedLockFailure() { return g_lock_failed; }

bool LibraryReportedServiceFailure() { return g_service_failed; }

}  // namespace zorvnotifyctl

extern "C" {

void syslog(int priority, const char* format, ...) {
  if (!zorvnotifyctl::Note(format)) return;
  va_list args;
  va_start(args, format);
  vsyslog(priority, format, args);
  va_end(args);
}

void __syslog_chk(int priority, int /*flag*/, const char* format, ...) {
  if (!zorvnotifyctl::Note(format)) return;
  va_list args;
  va_start(args, format);
  vsyslog(priority, format, args);
  va_end(args);
}

}  // extern "C"
