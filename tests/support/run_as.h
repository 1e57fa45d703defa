// Running a function in a forked child, optionally under other user and
// group ids, and collecting what it did.  Id changes apply to the whole
// process, so tests that need them run the code under test in a child and
// leave the test process's ids alone.
#ifndef ZORVNOTIFYD_TESTS_SUPPORT_RUN_AS_H_
#define ZORVNOTIFYD_TESTS_SUPPORT_RUN_AS_H_

#include <sys/types.h>

#include <functional>
#include <ostream>
#include <string>

#include "support/syslog_capture.h"

namespace zorv_test {

// Real, effective and saved user and group ids.
struct Ids {
  uid_t ruid, euid, suid;
  gid_t rgid, egid, sgid;
};

bool operator==(const Ids& a, const Ids& b);
// Prints "uid r/e/s gid r/e/s", for failure messages.
std::ostream& operator<<(std::ostream& out, const Ids& ids);

// What a child reported.
struct ChildResult {
  bool exited;                // the child set its ids, ran the function, reported and exited
                              // normally; false when it could not set its ids, crashed, was
                              // killed or exited on its own (see |error|)
  int result;                 // the int the function returned
  int err;                    // errno right after the function returned
  Ids after;                  // ids right after the function returned
  std::vector<LogLine> logs;  // lines the child captured while the function ran
  std::string error;          // why |exited| is false; empty otherwise
};

// Forks.  The child forgets the captured lines, drops its supplementary
// groups, sets its gids then its uids to |ids| with setresgid/setresuid (the
// caller must be root), runs |fn|, records errno and its ids at once, hands
// everything to the parent in shared memory and _exit(0)s.  Returns after
// the child has been reaped.  gtest assertions made inside |fn| are lost with the
// child: report through the result instead.
ChildResult RunAs(const Ids& ids, const std::function<int()>& fn);

}  // namespace zorv_test

#endif  // ZORVNOTIFYD_TESTS_SUPPORT_RUN_AS_H_
