// Cost of the matching queries.  IsMonitoring is set beside regexec called
// directly on the same compiled patterns and path, so the table shows what
// the mask, prefix and boundary tests add (or save); GetUnionMask is set
// beside the same selection made on concatenated strings.

#include <benchmark/benchmark.h>
#include <regex.h>

#include <cstdio>
#include <string>
#include <vector>

#include "monitor_queue.h"
#include "register.h"

namespace {

using ZORV::ZORVNOTIFYD::MonitorQueue;

constexpr unsigned int kWatched = 0x3;      // the event kinds every configuration wants
constexpr unsigned int kUnwatched = 0x100;  // an event kind none wants
constexpr int kConfigs = 8;
constexpr int kQueues = 100;

// A queue of kConfigs configurations on "<root>0" .. "<root>7", each
// ignoring temporary files, editor backups, git metadata and, last, its own
// "private" folder.
MonitorQueue MakeQueue(const std::string& root) {
  Json::Value value(Json::objectValue);
  value["queue"] = root;
  Json::Value configs(Json::arrayValue);
  for (int i = 0; i < kConfigs; ++i) {
    const std::string path = root + std::to_string(i);
    Json::Value config(Json::objectValue);
    config["path"] = path;
    config["mask"] = kWatched;
    Json::Value ignore(Json::arrayValue);
    ignore.append("\\.tmp$");
    ignore.append("~$");
    ignore.append("/\\.git(/|$)");
    ignore.append("^" + path + "/private(/|$)");
    config["ignore"] = ignore;
    configs.append(config);
  }
  value["config"] = configs;
  return MonitorQueue(value);
}

// GetUnionMask's selection written on the strings path + "/" and dir + "/",
// built for every configuration.
unsigned int UnionMaskByConcatenation(const MonitorQueue& queue, const std::string& dir) {
  unsigned int mask = 0;
  for (const MonitorQueue::MonitorQueueConfig& config : queue._configs) {
    const std::string config_dir = config._path + "/";
    const std::string wanted_dir = dir + "/";
    if (config_dir.compare(0, wanted_dir.size(), wanted_dir) == 0) mask |= config._mask;
  }
  return mask;
}

struct PathCase {
  const char* name;
  std::string path;
  unsigned int mask;
  bool want;
};

struct DirCase {
  const char* name;
  std::string dir;
  bool want;
};

using zorv_bench::Register;

}  // namespace

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;

  // IsMonitoring: the paths lie under the last configuration, so the seven
  // before it are passed over on the way.
  static MonitorQueue queue = MakeQueue("/volume1/share");
  const std::string last = "/volume1/share7";
  const PathCase paths[] = {
      {"wanted", last + "/docs/report.txt", kWatched, true},
      {"rejected by mask", last + "/docs/report.txt", kUnwatched, false},
      {"rejected by prefix", "/volume2/share7/docs/report.txt", kWatched, false},
      {"ignored by last pattern", last + "/private/report.txt", kWatched, false},
  };
  for (const PathCase& c : paths) {
    if (queue.IsMonitoring(c.path, c.mask) != c.want) {  // also compiles the patterns
      std::fprintf(stderr, "matching_bench: unexpected answer for %s\n", c.path.c_str());
      return 1;
    }
  }
  const std::vector<regex_t>& regexes = queue._configs.back()._regexes;
  for (const PathCase& c : paths) {
    Register("lib/IsMonitoring/" + std::string(c.name),
             "queue of 8 configurations, 4 ignore patterns each",
             [c] { benchmark::DoNotOptimize(queue.IsMonitoring(c.path, c.mask)); });
    Register("base/IsMonitoring/" + std::string(c.name),
             "regexec on the 4 compiled patterns of the configuration", [c, &regexes] {
               for (const regex_t& regex : regexes) {
                 benchmark::DoNotOptimize(regexec(&regex, c.path.c_str(), 0, nullptr, 0));
               }
             });
  }

  // IsDirMonitoring over a list of queues on "/vol<q>/share<i>".
  static std::vector<MonitorQueue> queues;
  for (int q = 0; q < kQueues; ++q)
    queues.push_back(MakeQueue("/vol" + std::to_string(q) + "/share"));
  const DirCase dirs[] = {
      {"watched by the last queue", "/vol99", true},
      {"watched by none", "/vol100", false},
  };
  for (const DirCase& c : dirs) {
    if (MonitorQueue::IsDirMonitoring(queues, c.dir) != c.want) {
      std::fprintf(stderr, "matching_bench: unexpected answer for %s\n", c.dir.c_str());
      return 1;
    }
    Register("lib/IsDirMonitoring/" + std::string(c.name), "list of 100 queues of 8 configurations",
             [c] { benchmark::DoNotOptimize(MonitorQueue::IsDirMonitoring(queues, c.dir)); });
  }

  // GetUnionMask on the queue of IsMonitoring.
  const DirCase unions[] = {
      {"all 8 selected", "/volume1", true},
      {"1 selected", "/volume1/share3", true},
  };
  for (const DirCase& c : unions) {
    if (queue.GetUnionMask(c.dir) != UnionMaskByConcatenation(queue, c.dir)) {
      std::fprintf(stderr, "matching_bench: union masks differ for %s\n", c.dir.c_str());
      return 1;
    }
    Register("lib/GetUnionMask/" + std::string(c.name), "queue of 8 configurations",
             [c] { benchmark::DoNotOptimize(queue.GetUnionMask(c.dir)); });
    Register("base/GetUnionMask/" + std::string(c.name),
             "the same test on path + \"/\" and dir + \"/\" built per configuration",
             [c] { benchmark::DoNotOptimize(UnionMaskByConcatenation(queue, c.dir)); });
  }

  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
