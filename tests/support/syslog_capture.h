// Capture of syslog output in test programs.
//
// The test support defines syslog, vsyslog, __syslog_chk and __vsyslog_chk
// in the test executable.  Test programs export their symbols, and the
// executable comes first in dynamic symbol lookup, so every call made inside
// libzorvnotifyd.so lands here instead of in the C library.  Nothing reaches
// the system log.
#ifndef ZORVNOTIFYD_TESTS_SUPPORT_SYSLOG_CAPTURE_H_
#define ZORVNOTIFYD_TESTS_SUPPORT_SYSLOG_CAPTURE_H_

#include <string>
#include <vector>

namespace zorv_test {

// One captured syslog call.
struct LogLine {
  int priority;        // the priority argument, facility bits included
  std::string format;  // the format string exactly as passed
  std::string text;    // the formatted line, "%m" expanded to the text of
                       // the errno the caller had at the time of the call
};

// Every line captured since the last ClearLogs, in call order.  Safe to call
// from any thread, and in a child forked while another thread was logging.
std::vector<LogLine> CapturedLogs();

// Forgets every captured line.
void ClearLogs();

// The captured lines whose text contains |needle|, in call order.
std::vector<LogLine> LogsContaining(const std::string& needle);

// All captured lines, one per line as "<priority> <text>", for failure messages.
std::string DumpLogs();

}  // namespace zorv_test

#endif  // ZORVNOTIFYD_TESTS_SUPPORT_SYSLOG_CAPTURE_H_
