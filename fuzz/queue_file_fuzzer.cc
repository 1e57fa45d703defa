// Fuzz target: the queue-file reader on arbitrary bytes.
//
// The bytes become the content of an in-memory file (a memfd, reached by its
// /proc/self/fd path) that MonitorQueue::LoadFromFile reads into a vector
// already holding two queues.  Checked: those two stay first and unchanged;
// a text that is not a JSON array appends nothing and fails; a success
// appends one queue per element, each equal to the queue built from that
// element; a failure appends the queues of the elements before the faulty
// one only.

#include <sys/mman.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include <json/json.h>

#include "fuzz_common.h"
#include "monitor_queue.h"

using ZORV::ZORVNOTIFYD::MonitorQueue;
using zorv_fuzz::Check;

namespace {

int memfd = -1;
std::string path;
Json::Value prefix_json;

// The JSON reader as the loader configures it, for the reference parse.
bool Parse(const uint8_t* data, size_t size, Json::Value& root) {
  Json::CharReaderBuilder builder;
  builder["collectComments"] = false;
  builder["failIfExtra"] = true;
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  const char* begin = reinterpret_cast<const char*>(data);
  try {
    return reader->parse(begin, begin + size, &root, nullptr);
  } catch (const std::exception&) {
    return false;
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  zorv_fuzz::RequireRoot();
  memfd = memfd_create("queue_file_fuzzer", MFD_CLOEXEC);
  Check(memfd >= 0, "memfd_create");
  path = "/proc/self/fd/" + std::to_string(memfd);
  std::istringstream(R"([{"queue": "first", "config": [{"path": "/a", "mask": 1}]},
                         {"queue": "second", "config": []}])") >>
      prefix_json;
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  Check(ftruncate(memfd, 0) == 0 && pwrite(memfd, data, size, 0) == static_cast<ssize_t>(size),
        "writing the memfd");

  std::vector<MonitorQueue> queues;
  for (const Json::Value& element : prefix_json) queues.emplace_back(element);
  const bool loaded = MonitorQueue::LoadFromFile(queues, path);

  const Json::Value all = zorv_fuzz::ToJsonArray(queues);
  Check(all.size() >= 2, "the vector never shrinks");
  Check(MonitorQueue(prefix_json[0]).ToJson() == all[0] &&
            MonitorQueue(prefix_json[1]).ToJson() == all[1],
        "the queues already in the vector stay first and unchanged");
  const Json::ArrayIndex appended = all.size() - 2;

  Json::Value root;
  if (!Parse(data, size, root) || !root.isArray()) {
    Check(!loaded && appended == 0, "a text that is not a JSON array appends nothing and fails");
    return 0;
  }
  Check(loaded ? appended == root.size() : appended < root.size(),
        "one queue per element on success, fewer on failure");
  for (Json::ArrayIndex i = 0; i < appended; ++i) {
    Check(MonitorQueue(root[i]).ToJson() == all[i + 2], "each queue is built from its element");
  }
  if (!loaded) {
    bool threw = false;
    try {
      MonitorQueue faulty(root[appended]);
    } catch (const std::exception&) {
      threw = true;
    }
    Check(threw, "a load fails only at an element that cannot be converted");
  }
  return 0;
}
