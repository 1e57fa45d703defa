// Cost of the store operations, each beside the cost of just reading,
// parsing and writing the JSON of the same files, so that the library's own
// work (ids, lock, records, atomic save, service start) shows as a ratio.
//
// The program enters the test sandbox before anything else: the store's
// directories, the lock file and systemctl are then private, throw-away
// copies, and the host is never touched.

#include <benchmark/benchmark.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include <json/json.h>

#include "monitor_queue.h"
#include "support/sandbox.h"

namespace {

using ZORV::ZORVNOTIFYD::_tag_monitor_queue_type_;
using ZORV::ZORVNOTIFYD::MonitorQueue;

constexpr char kQueueFile[] = "bench.json";

// A queue named |name| with 4 configurations of 4 ignore patterns each.
MonitorQueue MakeQueue(const std::string& name) {
  Json::Value value(Json::objectValue);
  value["queue"] = name;
  Json::Value configs(Json::arrayValue);
  for (int i = 0; i < 4; ++i) {
    Json::Value config(Json::objectValue);
    config["path"] = "/volume1/share" + std::to_string(i);
    config["mask"] = 0xFFFu;
    Json::Value ignore(Json::arrayValue);
    for (const char* pattern : {"\\.tmp$", "~$", "/\\.git(/|$)", "/private(/|$)"}) {
      ignore.append(pattern);
    }
    config["ignore"] = ignore;
    configs.append(config);
  }
  value["config"] = configs;
  return MonitorQueue(value);
}

_tag_monitor_queue_type_ TypeOf(int index) {
  return static_cast<_tag_monitor_queue_type_>(index % 3);
}

// Empties the three configuration directories.
void ClearCatalogue() {
  for (int type = 0; type < 3; ++type) {
    const std::string dir = MonitorQueue::GetConfDir(TypeOf(type));
    for (const auto& entry : std::filesystem::directory_iterator(dir)) {
      std::filesystem::remove_all(entry.path());
    }
  }
}

// Reads and parses the JSON file at |path|.
Json::Value ParseFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  Json::CharReaderBuilder builder;
  Json::Value value;
  std::string errors;
  if (!Json::parseFromStream(builder, in, &value, &errors))
    std::fprintf(stderr, "%s\n", errors.c_str());
  return value;
}

// A catalogue of |files| queue files of one queue each, spread over the
// three types.  Returns their paths.
std::vector<std::string> MakeCatalogue(int files) {
  ClearCatalogue();
  std::vector<std::string> paths;
  for (int i = 0; i < files; ++i) {
    const std::string name = "queue" + std::to_string(i);
    paths.push_back(MonitorQueue::GetConfDir(TypeOf(i)) + "/" + name + ".json");
    if (!MonitorQueue::SaveToFile({MakeQueue(name)}, paths.back())) {
      std::fprintf(stderr, "store_bench: cannot write %s\n", paths.back().c_str());
    }
  }
  return paths;
}

// One queue file of type 0 holding |count| queues; returns its path.
std::string MakeQueueFile(int count) {
  ClearCatalogue();
  std::vector<MonitorQueue> queues;
  for (int i = 0; i < count; ++i) queues.push_back(MakeQueue("queue" + std::to_string(i)));
  const std::string path = MonitorQueue::GetConfDir(TypeOf(0)) + "/" + kQueueFile;
  if (!MonitorQueue::SaveToFile(queues, path)) {
    std::fprintf(stderr, "store_bench: cannot write %s\n", path.c_str());
  }
  return path;
}

void LoadAll(benchmark::State& state, int files) {
  MakeCatalogue(files);
  std::vector<MonitorQueue> queues;
  for (auto _ : state) {
    if (!MonitorQueue::LoadAll(queues) || queues.size() != static_cast<size_t>(files)) {
      state.SkipWithError("LoadAll failed");
      break;
    }
  }
  state.SetLabel("catalogue of " + std::to_string(files) + " queue files");
}

void ParseCatalogue(benchmark::State& state, int files) {
  const std::vector<std::string> paths = MakeCatalogue(files);
  for (auto _ : state) {
    for (const std::string& path : paths) benchmark::DoNotOptimize(ParseFile(path));
  }
  state.SetLabel("read and parse each file");
}

void LoadFromFile(benchmark::State& state, int count) {
  const std::string path = MakeQueueFile(count);
  for (auto _ : state) {
    std::vector<MonitorQueue> queues;
    if (!MonitorQueue::LoadFromFile(queues, path) || queues.size() != static_cast<size_t>(count)) {
      state.SkipWithError("LoadFromFile failed");
      break;
    }
  }
  state.SetLabel("queue file of " + std::to_string(count) + " queues");
}

void ParseQueueFile(benchmark::State& state, int count) {
  const std::string path = MakeQueueFile(count);
  for (auto _ : state) benchmark::DoNotOptimize(ParseFile(path));
  state.SetLabel("read and parse the file");
}

void Upsert(benchmark::State& state, int count) {
  MakeQueueFile(count);
  const MonitorQueue queue = MakeQueue("queue" + std::to_string(count / 2));
  for (auto _ : state) {
    if (!MonitorQueue::Upsert(queue, kQueueFile, TypeOf(0))) {
      state.SkipWithError("Upsert failed");
      break;
    }
  }
  state.SetLabel("queue file of " + std::to_string(count) + " queues, one replaced");
}

void ParseAndWrite(benchmark::State& state, int count) {
  const std::string path = MakeQueueFile(count);
  const Json::StreamWriterBuilder writer;
  for (auto _ : state) {
    const Json::Value value = ParseFile(path);
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << Json::writeString(writer, value);
  }
  state.SetLabel("read and parse the file, write it back (no lock, sync or service)");
}

// Registers |function| with |size| under |name|, timed in microseconds of
// wall-clock time (the service start waits for a child process).
void Register(const std::string& name, void (*function)(benchmark::State&, int), int size) {
  benchmark::RegisterBenchmark(name.c_str(), function, size)
      ->Unit(benchmark::kMicrosecond)
      ->UseRealTime();
}

}  // namespace

int main(int argc, char** argv) {
  if (!zorv_test::EnterSandbox()) {
    std::fprintf(stderr, "store_bench: sandbox unavailable: %s\n", zorv_test::SandboxSkipReason());
    return 1;
  }
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;

  for (int files : {10, 100}) {
    const std::string suffix = "/" + std::to_string(files) + " files";
    Register("lib/LoadAll" + suffix, LoadAll, files);
    Register("base/LoadAll" + suffix, ParseCatalogue, files);
  }
  for (int count : {10, 100, 1000}) {
    const std::string suffix = "/" + std::to_string(count) + " queues";
    Register("lib/LoadFromFile" + suffix, LoadFromFile, count);
    Register("base/LoadFromFile" + suffix, ParseQueueFile, count);
    Register("lib/Upsert" + suffix, Upsert, count);
    Register("base/Upsert" + suffix, ParseAndWrite, count);
  }

  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
