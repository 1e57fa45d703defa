// Cost of MonitorQueueIndex against the plain way of asking a catalogue.
//
// Match is set beside the loop the daemon would otherwise run for every
// event: IsMonitoring asked of each queue, the queues already prepared.  The
// catalogues hold 10 to 10,000 queues of 8 configurations on directories of
// their own in one share, every configuration with the same 3 ignore
// pattern texts.  The memory rows count what regcomp allocates while the
// index is built, beside what preparing every configuration of the same
// queues allocates: the index compiles each distinct text once, whatever
// the number of queues.  mallinfo2 counts the chunks held in glibc's
// per-thread cache as in use, so the byte counts are exact only with that
// cache off: script/bench runs this program with
// GLIBC_TUNABLES=glibc.malloc.tcache_count=0 (neither Match nor the loop
// allocates, so the times do not change).

#include <benchmark/benchmark.h>
#include <dlfcn.h>
#include <malloc.h>
#include <regex.h>

#include <cstddef>
#include <cstdio>
#include <cstring>
#include <iterator>
#include <memory>
#include <string>
#include <vector>

#include "monitor_queue.h"
#include "monitor_queue_index.h"
#include "register.h"

namespace {

using ZORV::ZORVNOTIFYD::MonitorQueue;
using ZORV::ZORVNOTIFYD::MonitorQueueIndex;

constexpr unsigned int kWatched = 0x3;  // the event kinds every configuration wants
constexpr int kConfigs = 8;
const char* const kIgnore[] = {"\\.tmp$", "~$", "/\\.git(/|$)"};

// What regcomp allocated while |counting| was set: the compiled patterns
// and the heap they hold right after compilation (glibc adds matcher states
// later, on use, for each compiled pattern).
struct Compiled {
  bool counting = false;
  size_t patterns = 0;
  size_t bytes = 0;
} compiled;

size_t HeapInUse() {
  const struct mallinfo2 info = mallinfo2();
  return info.uordblks + info.hblkhd;
}

}  // namespace

// Every regcomp of the process, the library's included, comes here first
// (the program's definition is found before the C library's) and is passed
// on to the C library's.
extern "C" int regcomp(regex_t* __restrict regex, const char* __restrict pattern, int flags) {
  using Regcomp = int (*)(regex_t*, const char*, int);
  static const Regcomp next = [] {
    void* symbol = dlsym(RTLD_NEXT, "regcomp");
    Regcomp function = nullptr;
    std::memcpy(&function, &symbol, sizeof function);
    return function;
  }();
  if (!compiled.counting) return next(regex, pattern, flags);
  const size_t before = HeapInUse();
  const int result = next(regex, pattern, flags);
  if (result == 0) {
    ++compiled.patterns;
    compiled.bytes += HeapInUse() - before;
  }
  return result;
}

namespace {

std::string Dir(int queue, int config) {
  return "/vol/share/q" + std::to_string(queue) + "/d" + std::to_string(config);
}

// |queues| queues; queue q watches Dir(q, 0) .. Dir(q, 7).
std::vector<MonitorQueue> MakeCatalogue(int queues) {
  std::vector<MonitorQueue> catalogue;
  catalogue.reserve(queues);
  for (int q = 0; q < queues; ++q) {
    Json::Value value(Json::objectValue);
    value["queue"] = "q" + std::to_string(q);
    Json::Value configs(Json::arrayValue);
    for (int i = 0; i < kConfigs; ++i) {
      Json::Value config(Json::objectValue);
      config["path"] = Dir(q, i);
      config["mask"] = kWatched;
      Json::Value ignore(Json::arrayValue);
      for (const char* pattern : kIgnore) ignore.append(pattern);
      config["ignore"] = ignore;
      configs.append(config);
    }
    value["config"] = configs;
    catalogue.emplace_back(value);
  }
  return catalogue;
}

// The catalogue of MakeCatalogue(queues) where 80 queues spread over it
// have their last configuration on "/vol/share/hot", in four kinds of 20:
// wanting kWatched with kIgnore, wanting another kind, wanting an event
// kind none asks, and wanting kWatched with other patterns.
std::vector<MonitorQueue> MakeHotCatalogue(int queues) {
  std::vector<MonitorQueue> catalogue = MakeCatalogue(queues);
  const std::vector<std::string> ignore(std::begin(kIgnore), std::end(kIgnore));
  const struct {
    unsigned int mask;
    std::vector<std::string> ignore;
  } kinds[] = {{kWatched, ignore}, {0x4, ignore}, {0x100, ignore}, {kWatched, {"\\.dat$", "~$"}}};
  for (int k = 0; k < 80; ++k) {
    MonitorQueue::MonitorQueueConfig& config = catalogue[k * queues / 80]._configs.back();
    config._path = "/vol/share/hot";
    config._mask = kinds[k % 4].mask;
    config._ignore = kinds[k % 4].ignore;
  }
  return catalogue;
}

// The daemon's question without the index.
void Loop(std::vector<MonitorQueue>& queues, const std::string& path, unsigned int mask,
          std::vector<size_t>& out) {
  out.clear();
  for (size_t i = 0; i < queues.size(); ++i) {
    if (queues[i].IsMonitoring(path, mask)) out.push_back(i);
  }
}

// "1000" -> "1,000".
std::string Thousands(int n) {
  std::string text = std::to_string(n);
  for (int i = static_cast<int>(text.size()) - 3; i > 0; i -= 3) text.insert(i, ",");
  return text;
}

using zorv_bench::Register;

// Registers a memory row: |compile| runs once per repetition with regcomp
// counted; the row's value is the counter "heap_bytes" and its label says
// how many patterns were compiled.
template <typename Compile>
void RegisterMemory(const std::string& name, const std::string& label, Compile compile) {
  benchmark::RegisterBenchmark(name.c_str(), [label, compile](benchmark::State& state) {
    for (auto _ : state) {
      compiled = Compiled{};
      compile();
    }
    if (compiled.patterns == 0) state.SkipWithError("regcomp was not counted");
    state.counters["heap_bytes"] = static_cast<double>(compiled.bytes);
    state.SetLabel(label + ": " + Thousands(static_cast<int>(compiled.patterns)) +
                   " patterns compiled");
  })->Iterations(1);
}

}  // namespace

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;

  // The catalogues, prepared by the loop, live until the end (reserved:
  // the benchmarks hold references to them).
  static std::vector<std::vector<MonitorQueue>> catalogues;
  const int sizes[] = {10, 100, 1000, 10000};
  catalogues.reserve(std::size(sizes) + 1);
  for (int n : sizes) {
    catalogues.push_back(MakeCatalogue(n));
    std::vector<MonitorQueue>& queues = catalogues.back();
    const MonitorQueueIndex index(queues);
    // Both paths lie in the tree of the middle queue: one in its last
    // configured directory, one beside its configured directories.
    const struct {
      const char* name;
      std::string path;
      std::vector<size_t> want;
    } cases[] = {
        {"path wanted by 1 queue",
         Dir(n / 2, kConfigs - 1) + "/docs/report.txt",
         {static_cast<size_t>(n / 2)}},
        {"path wanted by none", "/vol/share/q" + std::to_string(n / 2) + "/scratch/report.txt", {}},
    };
    const std::string setup =
        "index; queues of 8 configurations on their own directories, the same 3 ignore patterns";
    const std::string baseline = "IsMonitoring asked of every queue, the queues prepared";
    for (const auto& c : cases) {
      std::vector<size_t> got;
      Loop(queues, c.path, kWatched, got);  // also prepares what the loop reaches
      std::vector<size_t> matched;
      index.Match(c.path, kWatched, matched);
      if (got != c.want || matched != c.want) {
        std::fprintf(stderr, "index_bench: unexpected answer for %s\n", c.path.c_str());
        return 1;
      }
      const std::string name = "Match/" + Thousands(n) + " queues, " + c.name;
      const auto out = std::make_shared<std::vector<size_t>>();
      Register("lib/" + name, setup, [index, path = c.path, out] {
        index.Match(path, kWatched, *out);
        benchmark::DoNotOptimize(out->data());
      });
      Register("base/" + name, baseline, [&queues, path = c.path, out] {
        Loop(queues, path, kWatched, *out);
        benchmark::DoNotOptimize(out->data());
      });
    }
  }

  // 80 configurations on the event's directory, in four kinds.
  {
    catalogues.push_back(MakeHotCatalogue(1000));
    std::vector<MonitorQueue>& queues = catalogues.back();
    const MonitorQueueIndex index(queues);
    const std::string path = "/vol/share/hot/report.txt";
    std::vector<size_t> got, matched;
    Loop(queues, path, kWatched, got);
    index.Match(path, kWatched, matched);
    if (got.size() != 40 || matched != got) {
      std::fprintf(stderr, "index_bench: unexpected answer for %s\n", path.c_str());
      return 1;
    }
    const std::string name = "Match/1,000 queues, 80 on the path's directory, path wanted by 40";
    const std::string setup =
        "index; queues of 8 configurations, 80 of them with their last on the event's directory "
        "(4 kinds of mask and patterns)";
    const auto out = std::make_shared<std::vector<size_t>>();
    Register("lib/" + name, setup, [index, path, out] {
      index.Match(path, kWatched, *out);
      benchmark::DoNotOptimize(out->data());
    });
    Register("base/" + name, "IsMonitoring asked of every queue, the queues prepared",
             [&queues, path, out] {
               Loop(queues, path, kWatched, *out);
               benchmark::DoNotOptimize(out->data());
             });
  }

  // Memory of the compiled patterns: the index over 10 and over 1,000
  // queues, each beside every configuration of the same queues prepared.
  for (const std::vector<MonitorQueue>* catalogue : {&catalogues[0], &catalogues[2]}) {
    const std::vector<MonitorQueue>& queues = *catalogue;
    const std::string name =
        "MonitorQueueIndex/" + Thousands(static_cast<int>(queues.size())) + " queues, heap";
    RegisterMemory("lib/" + name,
                   "heap regcomp allocated building the index (8 configurations per queue, the "
                   "same 3 ignore patterns)",
                   [&queues] {
                     compiled.counting = true;
                     const MonitorQueueIndex index(queues);
                     compiled.counting = false;
                   });
    RegisterMemory("base/" + name, "heap regcomp allocated preparing every configuration",
                   [&queues] {
                     std::vector<MonitorQueue> copy = queues;
                     compiled.counting = true;
                     for (MonitorQueue& queue : copy) {
                       for (MonitorQueue::MonitorQueueConfig& config : queue._configs)
                         config.PrepareRegex();
                     }
                     compiled.counting = false;
                   });
  }

  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
