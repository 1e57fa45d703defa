// The privileged section: raises the process's effective group and user ids
// to root for the time of a store operation and puts them back afterwards,
// logging every switch.  It excludes nobody; it only switches effective ids,
// which belong to the whole process.
#ifndef ZORVNOTIFYD_SRC_MONITOR_QUEUE_PRIVILEGED_SECTION_H_
#define ZORVNOTIFYD_SRC_MONITOR_QUEUE_PRIVILEGED_SECTION_H_

#include <sys/types.h>

namespace ZORV {
namespace ZORVNOTIFYD {

// The effective ids found on entry, restored on leaving.
struct SavedIds {
  uid_t uid;
  gid_t gid;
};

// Reads the effective ids into |saved|, then raises the effective gid and
// then the effective uid to 0 where they are not 0 already.  Logs a
// WARNING line (priority 38) after each successful raise; after a failed one
// an ERROR line (35) with the system's error text and "ERROR:
// ENTERCriticalSection", and the uid step is not attempted after a failed
// gid step.  Leaves errno 0 after a clean run, 1 (EPERM) after a failure.
// |file| and |line| name the call site in every line.
void ENTERCriticalSection(const char* file, int line, SavedIds& saved);

// Puts back the effective ids of |saved| where they differ from the current
// ones: the uid to 0, then the gid back, then the uid back.  Stops at the
// first failure (ERROR line, "ERROR: LEAVECriticalSection", errno 1);
// otherwise errno 0.  A WARNING line follows each successful switch to 0.
void LEAVECriticalSection(const SavedIds& saved, const char* file, int line);

// The root check: true when the effective uid is 0; otherwise logs
// "%s:%d Permission denied" at LOG_ERR with |file| and |line| and returns
// false.
bool RootCheck(const char* file, int line);

// Scoped form of the section: enters on construction and leaves exactly
// once on destruction, so that every path out of an operation, exceptions
// included, restores the ids.  Sections nest: an inner one finds the ids
// already 0 and changes nothing.
class PrivilegedSection {
 public:
  PrivilegedSection(const char* file, int line) : file_(file), line_(line) {
    ENTERCriticalSection(file_, line_, saved_);
  }
  PrivilegedSection(const PrivilegedSection&) = delete;
  PrivilegedSection& operator=(const PrivilegedSection&) = delete;
  ~PrivilegedSection() { LEAVECriticalSection(saved_, file_, line_); }

 private:
  const char* file_;
  int line_;
  SavedIds saved_;
};

}  // namespace ZORVNOTIFYD
}  // namespace ZORV

#endif  // ZORVNOTIFYD_SRC_MONITOR_QUEUE_PRIVILEGED_SECTION_H_
