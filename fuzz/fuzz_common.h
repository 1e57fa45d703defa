// Helpers shared by the fuzz targets.
#ifndef ZORVNOTIFYD_FUZZ_FUZZ_COMMON_H_
#define ZORVNOTIFYD_FUZZ_FUZZ_COMMON_H_

#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include <json/json.h>

#include "monitor_queue.h"

namespace zorv_fuzz {

// Stops the run with |what| when |ok| is false: libFuzzer then keeps the
// input that led here.
inline void Check(bool ok, const char* what) {
  if (ok) return;
  std::fprintf(stderr, "fuzz check failed: %s\n", what);
  std::abort();
}

// The store operations need effective root; without it every load would
// fail early and nothing would be exercised.
inline void RequireRoot() {
  if (geteuid() == 0) return;
  std::fprintf(stderr, "the fuzz targets must run as root\n");
  std::exit(1);
}

// The queues as one JSON array of their ToJson objects.
inline Json::Value ToJsonArray(const std::vector<ZORV::ZORVNOTIFYD::MonitorQueue>& queues) {
  Json::Value array(Json::arrayValue);
  for (const ZORV::ZORVNOTIFYD::MonitorQueue& queue : queues) array.append(queue.ToJson());
  return array;
}

// Patterns that glibc compiles and runs quickly, so that a slow pattern is
// never taken for a fault of the library: no "{" (bounded repetition, whose
// compiled size multiplies when nested), no back-reference ("\\" and a
// digit, exponential to execute) and few "+" (each one copies the compiled
// form before it: "a" followed by twenty "+" takes seconds to compile).
inline bool Tame(const std::string& pattern) {
  if (pattern.size() > 64 || pattern.find('{') != std::string::npos) return false;
  int pluses = 0;
  for (size_t i = 0; i < pattern.size(); ++i) {
    if (pattern[i] == '+') ++pluses;
    if (pattern[i] == '\\' && i + 1 < pattern.size() && pattern[i + 1] >= '0' &&
        pattern[i + 1] <= '9') {
      return false;
    }
  }
  return pluses <= 8;
}

}  // namespace zorv_fuzz

#endif  // ZORVNOTIFYD_FUZZ_FUZZ_COMMON_H_
