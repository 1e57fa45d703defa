// Fuzz target: the daemon's reader of request lines (ParseRequest) on
// arbitrary bytes.
//
// Checked: it returns (never throws, never recurses without end) for any
// line, deep nesting included; what it accepts is an object and nests at
// most kMaxRequestDepth levels; and it agrees with itself on a second
// reading.

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <string>

#include <json/json.h>

#include "fuzz_common.h"
#include "request.h"

using zorv_fuzz::Check;

namespace {

// How deep |value| nests, itself counting as one.
int Depth(const Json::Value& value) {
  int deepest = 0;
  if (value.isObject() || value.isArray()) {
    for (const Json::Value& member : value) deepest = std::max(deepest, Depth(member));
  }
  return deepest + 1;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string line(reinterpret_cast<const char*>(data), size);
  Json::Value request, again;
  const bool ok = zorvnotifyd::ParseRequest(line, &request);
  Check(ok == zorvnotifyd::ParseRequest(line, &again), "deterministic");
  if (!ok) return 0;
  Check(request.isObject(), "a request is an object");
  Check(Depth(request) <= zorvnotifyd::kMaxRequestDepth, "nested within the bound");
  Check(request == again, "the same request twice");
  return 0;
}
