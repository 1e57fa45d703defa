// Events the daemon zorvnotifyd handles, beside a bare inotify read loop
// over the same events.  The catalogue holds 100 queues of 8 configurations
// each, every configuration on a directory of its own with an ignore
// pattern; the events happen in the directory of the last configuration of
// the last queue, so every event is asked of all 100 queues before the one
// that wants it answers.  A batch is timed from the first file written until
// the daemon has printed its line for the last event (or, for the bare loop,
// until the last event has been read).  Runs in the test sandbox (root).

#include <fcntl.h>
#include <signal.h>
#include <sys/inotify.h>
#include <sys/wait.h>
#include <unistd.h>

#include <benchmark/benchmark.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include <json/json.h>

#include "monitor_queue.h"
#include "support/sandbox.h"

namespace {

using ZORV::ZORVNOTIFYD::MonitorQueue;

constexpr int kQueues = 100;
constexpr int kConfigs = 8;
constexpr int kBatch = 1000;
constexpr unsigned int kMask = IN_CLOSE_WRITE;
const std::string kRoot = "/tmp/bench";
const std::string kHotDir = kRoot + "/q99/c7";
const std::string kBareDir = kRoot + "/bare";  // not in the catalogue: the daemon ignores it

using Clock = std::chrono::steady_clock;

// Writes the catalogue and creates the directories it names.
bool MakeCatalogue() {
  std::vector<MonitorQueue> queues;
  for (int q = 0; q < kQueues; ++q) {
    Json::Value value(Json::objectValue);
    value["queue"] = "q" + std::to_string(q);
    for (int c = 0; c < kConfigs; ++c) {
      const std::string dir = kRoot + "/q" + std::to_string(q) + "/c" + std::to_string(c);
      std::error_code error;
      std::filesystem::create_directories(dir, error);
      if (error) return false;
      Json::Value config(Json::objectValue);
      config["path"] = dir;
      config["mask"] = kMask;
      config["ignore"].append("\\.tmp$");
      value["config"].append(config);
    }
    queues.emplace_back(value);
  }
  std::error_code error;
  std::filesystem::create_directories(kBareDir, error);
  if (error) return false;
  const std::string dir = MonitorQueue::GetConfDir(ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_ETC_DIR);
  return MonitorQueue::SaveToFile(queues, dir + "/bench");
}

// Creates (or truncates) and closes |kBatch| files of |dir|, each one event
// of kind kMask.
void MakeEvents(const std::string& dir) {
  for (int i = 0; i < kBatch; ++i) {
    const int fd = open((dir + "/f" + std::to_string(i)).c_str(),
                        O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd >= 0) close(fd);
  }
}

// The daemon, started with --json, its report lines read from a pipe.
class Daemon {
 public:
  Daemon() {
    int out[2];
    int err[2];
    if (pipe2(out, O_CLOEXEC) != 0 || pipe2(err, O_CLOEXEC) != 0) return;
    pid_ = fork();
    if (pid_ == 0) {
      dup2(out[1], 1);
      dup2(err[1], 2);
      execl(ZORVNOTIFYD_PATH, "zorvnotifyd", "--json", static_cast<char*>(nullptr));
      _exit(127);
    }
    close(out[1]);
    close(err[1]);
    out_ = out[0];
    err_ = err[0];
  }
  Daemon(const Daemon&) = delete;
  Daemon& operator=(const Daemon&) = delete;
  ~Daemon() {
    if (pid_ > 0) {
      kill(pid_, SIGTERM);
      waitpid(pid_, nullptr, 0);
    }
    if (out_ >= 0) close(out_);
    if (err_ >= 0) close(err_);
  }

  // Waits until the daemon logs that it watches the catalogue.
  bool WaitReady() {
    std::string log;
    char buffer[4096];
    while (log.find("ready:") == std::string::npos) {
      const ssize_t n = read(err_, buffer, sizeof buffer);
      if (n <= 0) return false;
      log.append(buffer, static_cast<size_t>(n));
    }
    return true;
  }

  // Reads report lines until |lines| more have arrived.
  void ReadLines(int lines) {
    char buffer[65536];
    while (lines > 0) {
      const ssize_t n = read(out_, buffer, sizeof buffer);
      if (n <= 0) return;
      for (ssize_t i = 0; i < n; ++i) lines -= buffer[i] == '\n';
    }
  }

 private:
  pid_t pid_ = -1;
  int out_ = -1;
  int err_ = -1;
};

Daemon* g_daemon = nullptr;

void DaemonHandles(benchmark::State& state) {
  for (auto _ : state) {
    const auto start = Clock::now();
    MakeEvents(kHotDir);
    g_daemon->ReadLines(kBatch);
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
  }
  state.SetLabel("100 queues of 8 configurations");
}

// The bare loop: one inotify watch, with the kinds the daemon watches, on a
// directory of its own (so that the daemon does not see these events), read
// by a second thread as the daemon reads in a process of its own.
void BareInotify(benchmark::State& state) {
  const int fd = inotify_init1(IN_CLOEXEC);
  inotify_add_watch(fd, kBareDir.c_str(),
                    kMask | IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO);
  for (auto _ : state) {
    const auto start = Clock::now();
    std::thread reader([fd] {
      alignas(struct inotify_event) char buffer[65536];
      for (int seen = 0; seen < kBatch;) {
        const ssize_t n = read(fd, buffer, sizeof buffer);
        if (n <= 0) return;
        for (ssize_t i = 0; i < n;) {
          const auto* event = reinterpret_cast<const struct inotify_event*>(buffer + i);
          seen += (event->mask & kMask) != 0;
          i += static_cast<ssize_t>(sizeof(struct inotify_event) + event->len);
        }
      }
    });
    MakeEvents(kBareDir);
    reader.join();
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
  }
  close(fd);
  state.SetLabel("inotify read loop, one watch, no catalogue");
}

}  // namespace

int main(int argc, char** argv) {
  if (!zorv_test::EnterSandbox()) {
    std::fprintf(stderr, "daemon_bench: sandbox unavailable: %s\n", zorv_test::SandboxSkipReason());
    return 1;
  }
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  if (!MakeCatalogue()) {
    std::fprintf(stderr, "daemon_bench: cannot write the catalogue\n");
    return 1;
  }
  Daemon daemon;
  if (!daemon.WaitReady()) {
    std::fprintf(stderr, "daemon_bench: the daemon did not start\n");
    return 1;
  }
  g_daemon = &daemon;
  const std::string name = "zorvnotifyd/" + std::to_string(kBatch) + " events";
  benchmark::RegisterBenchmark(("lib/" + name).c_str(), DaemonHandles)
      ->UseManualTime()
      ->Unit(benchmark::kMicrosecond);
  benchmark::RegisterBenchmark(("base/" + name).c_str(), BareInotify)
      ->UseManualTime()
      ->Unit(benchmark::kMicrosecond);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
