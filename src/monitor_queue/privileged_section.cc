// Switching effective ids around store operations, with the log lines that
// record every switch.

#include "monitor_queue/privileged_section.h"

#include <errno.h>
#include <string.h>
#include <syslog.h>
#include <unistd.h>

#include "monitor_queue/log.h"

namespace ZORV {
namespace ZORVNOTIFYD {

namespace {

constexpr int kWarning = LOG_AUTH | LOG_INFO;  // 38
constexpr int kError = LOG_AUTH | LOG_ERR;     // 35
constexpr int kUnchanged = -1;                 // real and saved ids are left alone

// Which call a log line names: "set" + "resgid" / "resuid".
constexpr char kResgid[] = "resgid";
constexpr char kResuid[] = "resuid";

// Logs the outcome of one setres[ug]id call that set the effective id to
// |id|: the ERROR line when it failed (with the text of |error|), or the
// WARNING line when it succeeded and |id| is 0.  Returns |ok|.
bool Report(bool ok, int error, const char* which, int id, const char* file, int line) {
  if (ok) {
    if (id == 0) {
      syslog(kWarning, "%s:%d WARNING: set%s(%d, %d, %d)", file, line, which, kUnchanged, id,
             kUnchanged);
    }
    return true;
  }
  char buffer[1024];
  memset(buffer, 0, sizeof buffer);
  const char* text = strerror_r(error, buffer, sizeof buffer);
  syslog(kError, "%s:%d ERROR: set%s(%d, %d, %d) [%s]", file, line, which, kUnchanged, id,
         kUnchanged, text);
  return false;
}

bool SetEffectiveGid(gid_t gid, const char* file, int line) {
  const bool ok = setresgid(static_cast<gid_t>(-1), gid, static_cast<gid_t>(-1)) == 0;
  return Report(ok, errno, kResgid, static_cast<int>(gid), file, line);
}

bool SetEffectiveUid(uid_t uid, const char* file, int line) {
  const bool ok = setresuid(static_cast<uid_t>(-1), uid, static_cast<uid_t>(-1)) == 0;
  return Report(ok, errno, kResuid, static_cast<int>(uid), file, line);
}

}  // namespace

void ENTERCriticalSection(const char* file, int line, SavedIds& saved) {
  saved.uid = geteuid();
  saved.gid = getegid();
  if ((saved.gid == 0 || SetEffectiveGid(0, file, line)) &&
      (saved.uid == 0 || SetEffectiveUid(0, file, line))) {
    errno = 0;
    return;
  }
  syslog(kError, "%s:%d ERROR: ENTERCriticalSection", file, line);
  errno = EPERM;
}

void LEAVECriticalSection(const SavedIds& saved, const char* file, int line) {
  const uid_t uid = geteuid();
  const gid_t gid = getegid();
  // Root is needed to put the group back, so the uid goes to 0 first.
  if ((saved.uid == uid || SetEffectiveUid(0, file, line)) &&
      (saved.gid == gid || SetEffectiveGid(saved.gid, file, line)) &&
      (saved.uid == uid || SetEffectiveUid(saved.uid, file, line))) {
    errno = 0;
    return;
  }
  syslog(kError, "%s:%d ERROR: LEAVECriticalSection", file, line);
  errno = EPERM;
}

bool RootCheck(const char* file, int line) {
  if (geteuid() == 0) return true;
  syslog(LOG_ERR, "%s:%d Permission denied", file, line);
  return false;
}

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
