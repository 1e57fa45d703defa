// Fuzz target: records built from arbitrary JSON and written back.
//
// The bytes are parsed as JSON; a watch configuration and a queue are built
// from the value (a conversion the JSON library refuses ends the input).
// Checked: ToJson has the documented shape; building again from ToJson and
// calling ToJson again gives the same value; so does a save to a queue file
// and a load of it; copies and copy assignments equal the original; copies
// of prepared configurations are unprepared; a move takes the compiled
// patterns and leaves the source empty.  The sanitizers watch every
// compiled pattern being released exactly once.

#include <stdlib.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include <json/json.h>

#include "fuzz_common.h"
#include "monitor_queue.h"

using ZORV::ZORVNOTIFYD::MonitorQueue;
using Config = ZORV::ZORVNOTIFYD::MonitorQueue::MonitorQueueConfig;
using zorv_fuzz::Check;

namespace {

std::string dir;   // scratch directory of the file round trip
std::string file;  // its queue file

void RemoveScratch() {
  unlink(file.c_str());
  rmdir(dir.c_str());  // fails, harmlessly, if a temporary file was left
}

bool IsConfigObject(const Json::Value& value) {
  if (!value.isObject() || value.size() != 3 || !value["path"].isString() ||
      !value["mask"].isUInt() || !value["ignore"].isArray()) {
    return false;
  }
  for (const Json::Value& pattern : value["ignore"]) {
    if (!pattern.isString()) return false;
  }
  return true;
}

bool IsQueueObject(const Json::Value& value) {
  if (!value.isObject() || value.size() != 2 || !value["queue"].isString() ||
      !value["config"].isArray()) {
    return false;
  }
  for (const Json::Value& config : value["config"]) {
    if (!IsConfigObject(config)) return false;
  }
  return true;
}

bool AllTame(const Config& config) {
  for (const std::string& pattern : config._ignore) {
    if (!zorv_fuzz::Tame(pattern)) return false;
  }
  return true;
}

bool Unprepared(const Config& config) { return !config._prepared && config._regexes.empty(); }

// Copies and moves of one configuration, prepared where its patterns allow.
void CheckConfigCopiesAndMoves(const Config& original) {
  const Json::Value json = original.ToJson();
  Check(IsConfigObject(json), "configuration ToJson has path, mask and ignore");
  Check(Config(json).ToJson() == json, "configuration round trip is stable");
  if (!AllTame(original)) return;

  Config prepared(original);
  Check(Unprepared(prepared), "a copy starts unprepared");
  prepared.PrepareRegex();
  Check(prepared._prepared && prepared._regexes.size() <= prepared._ignore.size(),
        "PrepareRegex marks the record prepared and compiles at most every pattern");
  const size_t compiled = prepared._regexes.size();

  Config copy(prepared);
  Check(Unprepared(copy) && copy.ToJson() == json, "a copy of a prepared record is unprepared");
  copy.PrepareRegex();
  copy = prepared;
  Check(Unprepared(copy) && copy.ToJson() == json, "copy assignment leaves the target unprepared");
  copy.PrepareRegex();
  const Config& self = copy;
  copy = self;
  Check(Unprepared(copy) && copy.ToJson() == json, "self-assignment discards compiled patterns");

  Config moved(std::move(prepared));
  Check(moved._prepared && moved._regexes.size() == compiled && moved.ToJson() == json,
        "a move takes the compiled patterns");
  Check(Unprepared(prepared) && prepared._path.empty() && prepared._ignore.empty(),
        "a moved-from record is empty and unprepared");
  copy.PrepareRegex();
  copy = std::move(moved);
  Check(copy._prepared && copy._regexes.size() == compiled && copy.ToJson() == json,
        "move assignment takes the compiled patterns");
  Check(Unprepared(moved) && moved._ignore.empty(), "move assignment empties the source");
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  zorv_fuzz::RequireRoot();
  const char* tmp = getenv("TMPDIR");
  std::string pattern =
      std::string(tmp != nullptr && *tmp != '\0' ? tmp : "/tmp") + "/record_json_fuzzer.XXXXXX";
  Check(mkdtemp(&pattern[0]) != nullptr, "mkdtemp");
  dir = pattern;
  file = dir + "/q";
  atexit(RemoveScratch);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  Json::CharReaderBuilder builder;
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  const char* begin = reinterpret_cast<const char*>(data);
  Json::Value value;
  try {
    if (!reader->parse(begin, begin + size, &value, nullptr)) return 0;
  } catch (const std::exception&) {
    return 0;  // nesting beyond the reader's limit
  }

  try {
    CheckConfigCopiesAndMoves(Config(value));
  } catch (const std::exception&) {
    // A member the JSON library cannot convert: nothing was built.
  }

  std::vector<MonitorQueue> queues;
  try {
    queues.emplace_back(value);
  } catch (const std::exception&) {
    return 0;
  }
  MonitorQueue& queue = queues[0];
  const Json::Value first = queue.ToJson();
  Check(IsQueueObject(first), "queue ToJson has queue and config of the right types");
  Json::Value second;
  try {
    second = MonitorQueue(first).ToJson();
  } catch (const std::exception&) {
    Check(false, "a queue built from ToJson converts without exception");
  }
  Check(first == second, "queue round trip is stable");

  for (const Config& config : queue._configs) CheckConfigCopiesAndMoves(config);

  MonitorQueue copy(queue);
  MonitorQueue assigned{Json::Value()};
  assigned = queue;
  Check(copy.ToJson() == first && assigned.ToJson() == first, "copies equal the original");

  bool all_tame = true;
  for (Config& config : queue._configs) {
    if (!AllTame(config)) all_tame = false;
  }
  if (all_tame) {
    for (Config& config : queue._configs) config.PrepareRegex();
    for (Config& config : assigned._configs) config.PrepareRegex();
    assigned = queue;
    const MonitorQueue prepared_copy(queue);
    for (const Config& config : prepared_copy._configs) {
      Check(Unprepared(config), "a copy of a prepared queue has unprepared configurations");
    }
    for (const Config& config : assigned._configs) {
      Check(Unprepared(config), "an assigned queue has unprepared configurations");
    }
  }

  // Written back: a queue file of the queue twice reads back as the same.
  queues.push_back(copy);
  Check(MonitorQueue::SaveToFile(queues, file), "SaveToFile");
  std::vector<MonitorQueue> loaded;
  Check(MonitorQueue::LoadFromFile(loaded, file), "LoadFromFile of a saved file");
  Check(zorv_fuzz::ToJsonArray(loaded) == zorv_fuzz::ToJsonArray(queues),
        "a saved file loads back as the same queues");
  return 0;
}
