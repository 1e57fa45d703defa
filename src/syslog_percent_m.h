// "%m" in a syslog format is the text of the current errno, a GNU extension
// that syslog expands itself.  Pedantic ISO C++ format checking flags it, so
// the few lines that use it are bracketed by these two macros; every other
// line keeps full format checking.
#ifndef ZORVNOTIFYD_SRC_SYSLOG_PERCENT_M_H_
#define ZORVNOTIFYD_SRC_SYSLOG_PERCENT_M_H_

#define ZORV_PERCENT_M_BEGIN \
  _Pragma("GCC diagnostic push") _Pragma("GCC diagnostic ignored \"-Wformat\"")
#define ZORV_PERCENT_M_END _Pragma("GCC diagnostic pop")

#endif  // ZORVNOTIFYD_SRC_SYSLOG_PERCENT_M_H_
