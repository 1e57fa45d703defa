// Helpers shared by the fuzz targets.
#ifndef ZORVNOTIFYD_FUZZ_FUZZ_COMMON_H_
#define ZORVNOTIFYD_FUZZ_FUZZ_COMMON_H_

#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include <fuzzer/FuzzedDataProvider.h>

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

// A path of up to |max_length| bytes, mostly "/", "a", "b" and ".", with
// now and then any byte or a control byte (NUL included): the bytes the
// boundary rules single out.
inline std::string Path(FuzzedDataProvider& input, size_t max_length) {
  std::string path = input.ConsumeRandomLengthString(max_length);
  for (char& c : path) {
    switch (static_cast<unsigned char>(c) % 8) {
      case 0:
      case 1:
      case 2:
        c = '/';
        break;
      case 3:
        c = 'a';
        break;
      case 4:
        c = 'b';
        break;
      case 5:
        c = '.';
        break;
      case 6:
        break;  // any byte
      default:
        c = static_cast<char>(static_cast<unsigned char>(c) >> 3);  // a control byte
        break;
    }
  }
  return path;
}

// A mask of one to eight neighbouring bits anywhere in the low 32.
inline unsigned Mask(FuzzedDataProvider& input) {
  const unsigned low = input.ConsumeIntegral<uint8_t>();
  return low << input.ConsumeIntegralInRange(0, 24);
}

// A queue "q" of up to four configurations, each with a path of up to
// |path_length| bytes (see Path), a mask and up to three ignore patterns
// from |next_pattern|.
template <typename NextPattern>
ZORV::ZORVNOTIFYD::MonitorQueue RandomQueue(FuzzedDataProvider& input, size_t path_length,
                                            NextPattern next_pattern) {
  Json::Value value(Json::objectValue);
  value["queue"] = "q";
  value["config"] = Json::Value(Json::arrayValue);
  const int configs = input.ConsumeIntegralInRange(0, 4);
  for (int i = 0; i < configs; ++i) {
    Json::Value config(Json::objectValue);
    config["path"] = Path(input, path_length);
    config["mask"] = Mask(input);
    config["ignore"] = Json::Value(Json::arrayValue);
    const int patterns = input.ConsumeIntegralInRange(0, 3);
    for (int j = 0; j < patterns; ++j) config["ignore"].append(next_pattern());
    value["config"].append(config);
  }
  return ZORV::ZORVNOTIFYD::MonitorQueue(value);
}

}  // namespace zorv_fuzz

#endif  // ZORVNOTIFYD_FUZZ_FUZZ_COMMON_H_
