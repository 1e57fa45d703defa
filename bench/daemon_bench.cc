// The daemon zorvnotifyd beside its peer, inotifywait -m -r, and beside
// the floor, a bare inotify reader process (bare_inotify_reader) that
// watches the same directories with the same masks and only reads the
// events.  The three run one after another, in random order within each
// round of repetitions (script/bench interleaves them).
//
// The catalogue: N queues (1, 100, 1,000).  Queue q0 wants the four kinds
// of the load (created, written, closed after writing, removed) on the
// tree /tmp/bench/tree of 100 directories, with three ignore patterns that
// let every file through.  The other queues have 8 configurations each on
// directories of their own (/tmp/bench/share/q<i>/d<j>, 10 directories per
// queue), except that 8 of them, spread over the catalogue, have their
// last configuration on the tree too, with masks or ignore patterns that
// take none of the load's events: the index has work on every event while
// q0 alone gets records.  One client, a MonitorQueueSubscription in a
// thread of this program, follows q0 and reads every record.
//
// Burst: 20,000 files created, written, closed and removed, file n in
// directory d<n % 100>, as fast as one process can (80,000 inotify
// events).  Paced: 2,000 files at 1,000 files per second (8,000 events).
// Each row measures, from just before the load until the last event has
// been read (or has not come for a second):
//  - cpu_ns_per_event: CPU time (user + system) of the watcher's process
//    per inotify event (the daemon with its journal and its coalescing
//    window, its defaults; the rows "no journal" run it with
//    --journal-size 0, those "no coalescing" with --coalesce 0);
//  - with_client_cpu_ns_per_event: the daemon's CPU plus that of the
//    client's thread, per event;
//  - events_lost: the events the client (or inotifywait's output, or the
//    bare reader) did not get; a client counts a rescan or a "missed"
//    notice as losses too;
//  - latency_p50_ns, latency_p99_ns (paced rows but the bare reader's):
//    from just before a file's close to its IN_CLOSE_WRITE record in the
//    client (or its line from inotifywait).
// The daemon's state is in the sandbox's /var/lib, a tmpfs: the rows count
// the CPU of the journal's writes and syncs, not the disk's latency.
//
// Start-up: wall time from exec to the daemon's "ready" log line at 1,000
// queues, a later start (the state of an earlier one) and the first (no
// state: it makes every journal and gives each tree a rescan record), and
// inotifywait -m -r over the same trees to its "Watches established.",
// each beside the bare reader's time to walk the same 10,000 directories
// and add their watches.
//
// Start-up comparison (a catalogue of its own): one queue on a
// tree of 10,000 directories holding 100,000 files.  The daemon is ready
// once its walk has set the watches (exec to "ready", beside the bare
// reader's walk), and then compares the tree with what was saved: exec to
// its "compared" log line, with the snapshot a first start saved (every
// directory compared, nothing changed), beside exec to "ready", and with
// none (the first start, which lists the tree for its first snapshot);
// and the size of the saved snapshot per entry.
//
// With two CPUs or more, the writer has one to itself and the reading side
// (the watcher and the client's thread) another, so that where the
// scheduler puts them does not change the batches the readers find.
//
// Runs in the test sandbox (root): the catalogue is in /usr/zorv, the trees
// in /tmp.  Without inotifywait (package inotify-tools) its rows say so and
// are skipped.

#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <sched.h>
#include <signal.h>
#include <spawn.h>
#include <sys/inotify.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <benchmark/benchmark.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <memory>
#include <mutex>
#include <set>
#include <sstream>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include <json/json.h>

#include "monitor_queue.h"
#include "monitor_queue_index.h"
#include "monitor_queue_subscription.h"
#include "support/sandbox.h"

extern char** environ;

#ifndef INOTIFYWAIT_PATH
#define INOTIFYWAIT_PATH "/usr/bin/inotifywait"  // inotify-tools
#endif

namespace {

using ZORV::ZORVNOTIFYD::MonitorQueue;
using ZORV::ZORVNOTIFYD::MonitorQueueEvent;
using ZORV::ZORVNOTIFYD::MonitorQueueIndex;
using ZORV::ZORVNOTIFYD::MonitorQueueSubscription;
using Clock = std::chrono::steady_clock;

constexpr int kConfigs = 8;
constexpr int kHotQueues = 8;
constexpr int kMaxQueues = 1000;
constexpr int kTreeDirs = 100;
constexpr int kFiles = 20000;
constexpr int kPacedFiles = 2000;
constexpr int kPacedPerSecond = 1000;
// Created, modified, closed after writing, deleted.
constexpr uint32_t kLoadKinds[] = {IN_CREATE, IN_MODIFY, IN_CLOSE_WRITE, IN_DELETE};
constexpr uint32_t kLoadMask = IN_CREATE | IN_MODIFY | IN_CLOSE_WRITE | IN_DELETE;
// The kinds the daemon watches on every directory to keep its tree.
constexpr uint32_t kTreeKeeping =
    IN_CREATE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE | IN_MOVE_SELF | IN_DELETE_SELF;

const std::string kRoot = "/tmp/bench";
const std::string kShare = kRoot + "/share";
const std::string kTree = kRoot + "/tree";
// A socket's directory must be root's and writable by root alone.
const std::string kSocketDir = "/tmp/zorvrun";
const std::string kSocket = kSocketDir + "/zorvnotifyd.sock";
const std::string kRootsFile = kRoot + "/roots";         // "MASK PATH" lines, the bare reader's
const std::string kPlainRoots = kRoot + "/roots.plain";  // "PATH" lines, inotifywait's
const char kInotifywait[] = "/usr/bin/inotifywait";

// The configurations on the tree of the queues other than q0, none of
// which takes an event of the load.
struct HotConfig {
  uint32_t mask;
  std::vector<const char*> ignore;
};
const std::vector<const char*> kIgnore = {"\\.tmp$", "/\\.#[^/]*$", "~$"};
const HotConfig kHot[kHotQueues] = {
    {IN_MOVED_FROM | IN_MOVED_TO, kIgnore},                   // no kind of the load
    {IN_ATTRIB, kIgnore},                                     // no kind of the load
    {IN_MODIFY | IN_CLOSE_WRITE, {"\\.dat$", "~$"}},          // ignores every file
    {IN_DELETE_SELF | IN_MOVE_SELF, kIgnore},                 // no kind of the load
    {IN_CREATE | IN_DELETE, {"\\.tmp$", "/f[0-9]*\\.dat$"}},  // ignores every file
    {IN_CLOSE_WRITE, {"~$", "/d[0-9]*/f[^/]*$"}},             // ignores every file
    {IN_MODIFY, {"\\.(dat|tmp)$"}},                           // ignores every file
    {IN_CREATE, {"[0-9]\\.dat$", "\\.tmp$"}},                 // ignores every file
};
// The masks of the other configurations, by position.
constexpr uint32_t kMasks[4] = {IN_CLOSE_WRITE | IN_MOVED_TO,
                                IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO,
                                IN_MODIFY | IN_ATTRIB, IN_CLOSE_WRITE | IN_DELETE};

// The writer's CPU, the reading side's, and both; |pinned| false with one
// CPU.
struct Placement {
  bool pinned = false;
  cpu_set_t writer, reader, both;
};
Placement g_cpus;

// Puts the calling thread on |cpus| when the program pins.
void RunOn(const cpu_set_t& cpus) {
  if (g_cpus.pinned) sched_setaffinity(0, sizeof(cpus), &cpus);
}

// Picks the first two CPUs the program may use and moves the calling
// thread (the writer) to the first.
void PlaceThreads() {
  cpu_set_t allowed;
  if (sched_getaffinity(0, sizeof(allowed), &allowed) != 0 || CPU_COUNT(&allowed) < 2) return;
  CPU_ZERO(&g_cpus.writer);
  CPU_ZERO(&g_cpus.reader);
  CPU_ZERO(&g_cpus.both);
  int found = 0;
  for (int cpu = 0; cpu < CPU_SETSIZE && found < 2; ++cpu) {
    if (!CPU_ISSET(cpu, &allowed)) continue;
    CPU_SET(cpu, found++ == 0 ? &g_cpus.writer : &g_cpus.reader);
    CPU_SET(cpu, &g_cpus.both);
  }
  g_cpus.pinned = true;
  RunOn(g_cpus.writer);
}

std::string Thousands(long n) {
  std::string digits = std::to_string(n);
  for (int i = static_cast<int>(digits.size()) - 3; i > 0; i -= 3) digits.insert(i, ",");
  return digits;
}

std::string QueueDir(int i) { return kShare + "/q" + std::to_string(i); }

// The position of hot queue |k| in a catalogue of |queues| (> 1): never 0.
int HotQueue(int queues, int k) { return 1 + k * (queues - 1) / kHotQueues; }

// Creates every directory of the largest catalogue: the tree's d0..d99,
// and for each queue q<i>/d0..d7 and two subdirectories of d0; and the
// socket's directory.
bool MakeTrees() {
  std::error_code error;
  for (int d = 0; d < kTreeDirs && !error; ++d) {
    std::filesystem::create_directories(kTree + "/d" + std::to_string(d), error);
  }
  for (int i = 1; i < kMaxQueues && !error; ++i) {
    for (int j = 0; j < kConfigs; ++j) {
      std::filesystem::create_directories(QueueDir(i) + "/d" + std::to_string(j), error);
    }
    for (const char* sub : {"/d0/s0", "/d0/s1"}) {
      std::filesystem::create_directories(QueueDir(i) + sub, error);
    }
  }
  mkdir(kSocketDir.c_str(), 0755);
  return !error && chmod(kSocketDir.c_str(), 0755) == 0;
}

// The load's files: file n in directory d<n % 100>.
const std::vector<std::string>& LoadPaths() {
  static const std::vector<std::string> paths = [] {
    std::vector<std::string> list;
    for (int n = 0; n < kFiles; ++n) {
      list.push_back(kTree + "/d" + std::to_string(n % kTreeDirs) + "/f" + std::to_string(n) +
                     ".dat");
    }
    return list;
  }();
  return paths;
}

// The file number in a path of the load, or -1.
long FileNumber(std::string_view path) {
  const size_t at = path.rfind("/f");
  if (at == std::string_view::npos) return -1;
  char* end = nullptr;
  const long n = std::strtol(path.data() + at + 2, &end, 10);
  return end != path.data() + at + 2 && n >= 0 && n < kFiles ? n : -1;
}

// The catalogue in use: its queue file, the roots files of the bare reader
// and inotifywait, and what q0's client should get per file of the load.
struct Catalogue {
  int queues = 0;
  size_t directories = 0;         // watched, as the daemon should say when ready
  uint64_t records_per_file = 0;  // q0's records for one file of the load
  uint64_t other_records = 0;     // records of the other queues over a burst (0)
};

std::string g_installed;  // the queue file in place

// Puts the queue file |name| ("bench" or "snap", kept in kRoot as NAME.queues)
// in the configuration directory, the other one out: benchmarks that run
// interleaved each find their own catalogue.
bool InstallQueueFile(const std::string& name) {
  if (g_installed == name) return true;
  const std::string dir = MonitorQueue::GetConfDir(ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_ETC_DIR);
  std::error_code error;
  std::filesystem::remove(dir + "/" + (name == "bench" ? "snap" : "bench"), error);
  std::filesystem::copy_file(kRoot + "/" + name + ".queues", dir + "/" + name,
                             std::filesystem::copy_options::overwrite_existing, error);
  if (error) return false;
  g_installed = name;
  return true;
}

const Catalogue* UseCatalogue(int queues) {
  static Catalogue current;
  if (current.queues == queues) return InstallQueueFile("bench") ? &current : nullptr;
  current = Catalogue();
  std::vector<MonitorQueue> catalogue;
  std::vector<std::string> roots;
  std::set<std::string> seen;
  {
    Json::Value value(Json::objectValue);
    value["queue"] = "q0";
    value["config"][0]["path"] = kTree;
    value["config"][0]["mask"] = kLoadMask;
    for (const char* pattern : kIgnore) value["config"][0]["ignore"].append(pattern);
    catalogue.emplace_back(value);
    roots.push_back(kTree);
    seen.insert(kTree);
  }
  for (int i = 1; i < queues; ++i) {
    int hot = -1;
    for (int k = 0; k < kHotQueues; ++k) {
      if (HotQueue(queues, k) == i) hot = k;
    }
    Json::Value value(Json::objectValue);
    value["queue"] = "q" + std::to_string(i);
    for (int j = 0; j < kConfigs; ++j) {
      Json::Value config(Json::objectValue);
      const bool on_tree = hot >= 0 && j == kConfigs - 1;
      config["path"] = on_tree ? kTree : QueueDir(i) + "/d" + std::to_string(j);
      config["mask"] = on_tree ? kHot[hot].mask : kMasks[j % 4];
      for (const char* pattern : on_tree ? kHot[hot].ignore : kIgnore) {
        config["ignore"].append(pattern);
      }
      value["config"].append(config);
      if (seen.insert(config["path"].asString()).second) roots.push_back(config["path"].asString());
    }
    catalogue.emplace_back(value);
  }
  g_installed.clear();  // another catalogue of that name
  if (!MonitorQueue::SaveToFile(catalogue, kRoot + "/bench.queues") || !InstallQueueFile("bench")) {
    return nullptr;
  }
  // The bare reader watches each tree with the mask the daemon gives it.
  const MonitorQueueIndex index(catalogue);
  std::ofstream file(kRootsFile, std::ios::trunc);
  std::ofstream plain(kPlainRoots, std::ios::trunc);
  for (const std::string& root : roots) {
    file << "0x" << std::hex << ((index.GetWatchMask(root) & IN_ALL_EVENTS) | kTreeKeeping)
         << std::dec << ' ' << root << '\n';
    plain << root << '\n';
  }
  if (!file.flush() || !plain.flush()) return nullptr;
  std::vector<size_t> matches;
  for (const std::string& path : LoadPaths()) {
    for (uint32_t kind : kLoadKinds) {
      index.Match(path, kind, matches);
      for (size_t position : matches) {
        if (position == 0 && &path == &LoadPaths()[0]) ++current.records_per_file;
        if (position != 0) ++current.other_records;
      }
    }
  }
  // The tree, each other configured directory, and two below each d0.
  current.directories = 1 + kTreeDirs + (seen.size() - 1) + 2 * static_cast<size_t>(queues - 1);
  current.queues = queues;
  return &current;
}

// |args| run under the profiler named by $DAEMON_BENCH_PROFILE (words
// split on spaces, e.g. "perf record -g -o /abs/perf.data --"), for the
// start-ups measured; as they are without it.
std::vector<std::string> Profiled(std::vector<std::string> args) {
  const char* profiler = std::getenv("DAEMON_BENCH_PROFILE");
  if (profiler == nullptr) return args;
  std::istringstream words(profiler);
  std::vector<std::string> command(std::istream_iterator<std::string>(words), {});
  command.insert(command.end(), args.begin(), args.end());
  return command;
}

// A child process, its standard output and error read by a thread, which
// also hands each piece read to |output| when one is given.  It runs on the
// reading side's CPU, or with |both_cpus| on the two (a start-up, which no
// writer shares the machine with).
class Child {
 public:
  explicit Child(const std::vector<std::string>& args,
                 std::function<void(const char*, size_t)> output = nullptr,
                 bool both_cpus = false) {
    int out[2];
    int in[2];
    if (pipe2(out, O_CLOEXEC) != 0) return;
    if (pipe2(in, O_CLOEXEC) != 0) {
      close(out[0]);
      close(out[1]);
      return;
    }
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, in[0], 0);
    posix_spawn_file_actions_adddup2(&actions, out[1], 1);
    posix_spawn_file_actions_adddup2(&actions, out[1], 2);
    std::vector<char*> argv;
    for (const std::string& arg : args) argv.push_back(const_cast<char*>(arg.c_str()));
    argv.push_back(nullptr);
    // The child starts on the reading side's CPU (or both).
    RunOn(both_cpus ? g_cpus.both : g_cpus.reader);
    if (posix_spawn(&pid_, argv[0], &actions, nullptr, argv.data(), environ) != 0) pid_ = -1;
    RunOn(g_cpus.writer);
    posix_spawn_file_actions_destroy(&actions);
    close(out[1]);
    close(in[0]);
    input_ = in[1];
    reader_ = std::thread([this, fd = out[0], output = std::move(output)] {
      char buffer[64 * 1024];
      for (ssize_t n; (n = read(fd, buffer, sizeof(buffer))) > 0;) {
        if (output) output(buffer, static_cast<size_t>(n));
        std::lock_guard<std::mutex> lock(mutex_);
        output_.append(buffer, static_cast<size_t>(n));
        changed_.notify_all();
      }
      close(fd);
    });
  }
  Child(const Child&) = delete;
  Child& operator=(const Child&) = delete;
  ~Child() {
    close(input_);
    if (pid_ > 0) {
      kill(pid_, SIGTERM);
      waitpid(pid_, nullptr, 0);
    }
    if (reader_.joinable()) reader_.join();
  }

  pid_t pid() const { return pid_; }

  // Waits up to |timeout| for a line of output holding |marker| (after
  // those found by earlier calls) and returns it; empty when none came.
  std::string WaitFor(const std::string& marker, Clock::duration timeout) {
    std::unique_lock<std::mutex> lock(mutex_);
    size_t at = std::string::npos;
    size_t end = std::string::npos;
    changed_.wait_for(lock, timeout, [&] {
      at = output_.find(marker, seen_);
      end = at == std::string::npos ? at : output_.find('\n', at);
      return end != std::string::npos;
    });
    if (end == std::string::npos) return "";
    const size_t start =
        output_.rfind('\n', at) == std::string::npos ? 0 : output_.rfind('\n', at) + 1;
    seen_ = end + 1;
    return output_.substr(start, seen_ - start);
  }

  // Everything it wrote so far.
  std::string Output() {
    std::lock_guard<std::mutex> lock(mutex_);
    return output_;
  }

  // CPU time (user + system) of the process so far, in nanoseconds.
  int64_t CpuNs() const {
    clockid_t clock;
    struct timespec now;
    if (clock_getcpuclockid(pid_, &clock) != 0 || clock_gettime(clock, &now) != 0) return -1;
    return int64_t(now.tv_sec) * 1000000000 + now.tv_nsec;
  }
  // The same in clock ticks, from /proc, split into user and system time.
  void Ticks(long* user, long* system) const {
    *user = *system = 0;
    std::ifstream stat("/proc/" + std::to_string(pid_) + "/stat");
    std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
    const size_t end = text.rfind(')');
    if (end == std::string::npos) return;
    // Fields 14 and 15, counted from the state (field 3) after the name.
    std::istringstream fields(text.substr(end + 2));
    std::string field;
    for (int i = 3; i < 14 && fields >> field; ++i) {
    }
    fields >> *user >> *system;
  }

 private:
  pid_t pid_ = -1;
  int input_ = -1;
  std::thread reader_;
  std::mutex mutex_;
  std::condition_variable changed_;
  std::string output_;
  size_t seen_ = 0;
};

// The daemon's answer to a status request, or a null value.
Json::Value Status() {
  Json::Value status;
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  kSocket.copy(address.sun_path, sizeof(address.sun_path) - 1);
  const char request[] = "{\"request\":\"status\"}\n";
  std::string line;
  if (fd >= 0 && connect(fd, reinterpret_cast<struct sockaddr*>(&address), sizeof(address)) == 0 &&
      send(fd, request, sizeof(request) - 1, MSG_NOSIGNAL) == sizeof(request) - 1) {
    char c;
    while (read(fd, &c, 1) == 1 && c != '\n') line += c;
  }
  if (fd >= 0) close(fd);
  Json::CharReaderBuilder builder;
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  std::string errors;
  if (!reader->parse(line.data(), line.data() + line.size(), &status, &errors))
    return Json::Value();
  return status;
}

// The load: a burst as fast as one process can, or a paced stream.
enum class Load { kBurst, kPaced };

int Files(Load load) { return load == Load::kBurst ? kFiles : kPacedFiles; }
uint64_t KernelEvents(Load load) { return uint64_t(Files(load)) * std::size(kLoadKinds); }

int64_t NowNs() {
  return std::chrono::duration_cast<std::chrono::nanoseconds>(Clock::now().time_since_epoch())
      .count();
}

// When each file of the load was closed (0: not yet), and how long its
// IN_CLOSE_WRITE took to reach the reader (0: it did not).
std::vector<std::atomic<int64_t>> g_closed(kFiles);
std::vector<std::atomic<int64_t>> g_latency(kFiles);

// Called by a reader on the IN_CLOSE_WRITE of |path|.
void Arrived(std::string_view path) {
  const long n = FileNumber(path);
  if (n < 0) return;
  const int64_t closed = g_closed[size_t(n)].load(std::memory_order_acquire);
  if (closed > 0) g_latency[size_t(n)].store(NowNs() - closed, std::memory_order_relaxed);
}

// Creates, writes, closes and removes every file of |load|; paced, file n
// starts n milliseconds after the first.
void RunLoad(Load load) {
  static const char kData[] = "load\n";
  const int files = Files(load);
  for (int n = 0; n < files; ++n) {
    g_closed[size_t(n)].store(0, std::memory_order_relaxed);
    g_latency[size_t(n)].store(0, std::memory_order_relaxed);
  }
  struct timespec next;
  clock_gettime(CLOCK_MONOTONIC, &next);
  for (int n = 0; n < files; ++n) {
    if (load == Load::kPaced) {
      next.tv_nsec += 1000000000 / kPacedPerSecond;
      if (next.tv_nsec >= 1000000000) {
        next.tv_nsec -= 1000000000;
        ++next.tv_sec;
      }
      while (clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &next, nullptr) == EINTR) {
      }
    }
    const std::string& path = LoadPaths()[size_t(n)];
    const int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd < 0) continue;
    if (write(fd, kData, sizeof(kData) - 1) < 0) perror("daemon_bench: write");
    g_closed[size_t(n)].store(NowNs(), std::memory_order_release);
    close(fd);
    unlink(path.c_str());
  }
}

// The latencies of |load|'s files that arrived, in nanoseconds, sorted.
std::vector<int64_t> Latencies(Load load) {
  std::vector<int64_t> found;
  for (int n = 0; n < Files(load); ++n) {
    const int64_t latency = g_latency[size_t(n)].load(std::memory_order_relaxed);
    if (latency > 0) found.push_back(latency);
  }
  std::sort(found.begin(), found.end());
  return found;
}

// The |q| quantile of sorted |values|, or 0.
double Quantile(const std::vector<int64_t>& values, double q) {
  return values.empty() ? 0 : double(values[size_t(q * double(values.size() - 1))]);
}

// A MonitorQueueSubscription following q0 on its own thread, reading every
// record and counting what comes.
class Follower {
 public:
  std::atomic<uint64_t> events{0}, missed{0}, rescans{0};

  Follower() : subscription_(kSocket) {}
  Follower(const Follower&) = delete;
  Follower& operator=(const Follower&) = delete;
  ~Follower() {
    stop_ = true;
    if (thread_.joinable()) thread_.join();
  }

  // Subscribes (waiting for the daemon's reply) and starts reading; false
  // when the daemon refused or did not answer.
  bool Start() {
    if (!subscription_.Subscribe("q0")) return false;
    thread_ = std::thread([this] {
      RunOn(g_cpus.reader);
      MonitorQueueEvent event;
      while (!stop_) {
        if (!subscription_.Next(event, 50)) continue;
        if (event._kind == MonitorQueueEvent::EVENT) {
          ++events;
          if (event._mask & IN_CLOSE_WRITE) Arrived(event._path);
        } else if (event._kind == MonitorQueueEvent::MISSED) {
          missed += event._missed;
        } else if (event._kind == MonitorQueueEvent::RESCAN ||
                   event._kind == MonitorQueueEvent::LOST) {
          ++rescans;
        }
      }
    });
    return true;
  }

  // CPU time of the reading thread so far, in nanoseconds.
  int64_t CpuNs() {
    clockid_t clock;
    struct timespec now;
    if (pthread_getcpuclockid(thread_.native_handle(), &clock) != 0 ||
        clock_gettime(clock, &now) != 0) {
      return 0;
    }
    return int64_t(now.tv_sec) * 1000000000 + now.tv_nsec;
  }

 private:
  MonitorQueueSubscription subscription_;
  std::atomic<bool> stop_{false};
  std::thread thread_;
};

// Counts inotifywait's event lines ("PATH EVENTS") as its reader thread
// gets them.
class LineTally {
 public:
  std::atomic<uint64_t> events{0};

  void Take(const char* data, size_t size) {
    const char* end = data + size;
    for (const char* start = data;;) {
      const char* nl = static_cast<const char*>(memchr(start, '\n', size_t(end - start)));
      if (nl == nullptr) {
        partial_.append(start, end);
        return;
      }
      if (partial_.empty()) {
        Line(std::string_view(start, size_t(nl - start)));
      } else {
        partial_.append(start, nl);
        Line(partial_);
        partial_.clear();
      }
      start = nl + 1;
    }
  }

 private:
  void Line(std::string_view line) {
    if (line.compare(0, kTree.size(), kTree) != 0) return;  // a set-up message
    ++events;
    const size_t space = line.rfind(' ');
    if (space != std::string_view::npos && line.find("CLOSE_WRITE", space) != line.npos) {
      Arrived(line.substr(0, space));
    }
  }

  std::string partial_;
};

// Waits until |count| reaches |expected| or has not moved for a second.
void WaitCount(const std::atomic<uint64_t>& count, uint64_t expected) {
  uint64_t last = count;
  auto moved = Clock::now();
  while (count < expected && Clock::now() - moved < std::chrono::seconds(1)) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
    if (count != last) {
      last = count;
      moved = Clock::now();
    }
  }
}

std::string LoadLabel(int queues, Load load) {
  std::string label = Thousands(queues) + (queues == 1 ? " queue" : " queues") +
                      ", q0 on 100 directories and followed by one client; ";
  if (load == Load::kBurst) {
    return label + "a burst of 20,000 files created, written, removed (80,000 events)";
  }
  return label + "2,000 files created, written, removed at 1,000 files/s (8,000 events)";
}

// Runs |load| once per iteration, |wait_for_end| returning once the reader
// has every event, and reports the CPU time over the last one of the
// watcher (|watcher_cpu|) and, when given, of the client (|client_cpu|):
// per event, in all, and the wall time; and, paced, the latencies.
template <typename WaitForEnd>
void TimeLoad(benchmark::State& state, Load load, const std::function<int64_t()>& watcher_cpu,
              const std::function<int64_t()>& client_cpu, WaitForEnd wait_for_end) {
  int64_t cpu_ns = 0, client_ns = 0;
  double wall = 0;
  for (auto _ : state) {
    const int64_t cpu0 = watcher_cpu();
    const int64_t client0 = client_cpu ? client_cpu() : 0;
    const auto start = Clock::now();
    RunLoad(load);
    wait_for_end();
    cpu_ns = watcher_cpu() - cpu0;
    client_ns = client_cpu ? client_cpu() - client0 : 0;
    wall = std::chrono::duration<double>(Clock::now() - start).count();
  }
  const double events = double(KernelEvents(load));
  state.counters["cpu_ns_per_event"] = double(cpu_ns) / events;
  if (client_cpu) {
    state.counters["with_client_cpu_ns_per_event"] = double(cpu_ns + client_ns) / events;
  }
  state.counters["cpu_ms"] = double(cpu_ns) / 1e6;
  state.counters["wall_ms"] = wall * 1e3;
  // Readers that see paths (the client, inotifywait) time them.
  const std::vector<int64_t> latencies = Latencies(load);
  if (load == Load::kPaced && !latencies.empty()) {
    state.counters["latency_p50_ns"] = Quantile(latencies, 0.5);
    state.counters["latency_p99_ns"] = Quantile(latencies, 0.99);
  }
}

// The daemon with one client following q0; each queue's records in its
// journal (the default), or, without |journal|, in memory only; with its
// default coalescing window, or, without |coalesce|, --coalesce 0.
void DaemonLoad(benchmark::State& state, int queues, Load load, bool journal, bool coalesce) {
  const Catalogue* catalogue = UseCatalogue(queues);
  if (catalogue == nullptr) {
    state.SkipWithError("cannot write the catalogue");
    return;
  }
  // The periodic look at the trees every 10 minutes, not in the load.
  std::vector<std::string> args = {ZORVNOTIFYD_PATH, "--socket", kSocket, "--retry", "600"};
  if (!journal) args.insert(args.end(), {"--journal-size", "0"});
  if (!coalesce) args.insert(args.end(), {"--coalesce", "0"});
  Child daemon(args);
  const std::string ready = daemon.WaitFor("ready:", std::chrono::seconds(60));
  if (ready.find("watching " + std::to_string(catalogue->directories) + " directories") ==
      std::string::npos) {
    state.SkipWithError(("the daemon did not start as expected: " + daemon.Output()).c_str());
    return;
  }
  Follower client;
  if (!client.Start()) {
    state.SkipWithError("the client could not subscribe");
    return;
  }
  const uint64_t expected = catalogue->records_per_file * uint64_t(Files(load));
  const Json::Value before = Status();
  TimeLoad(
      state, load, [&] { return daemon.CpuNs(); }, [&] { return client.CpuNs(); },
      [&] { WaitCount(client.events, expected); });
  const Json::Value after = Status();
  state.counters["events_lost"] = double(expected) -
                                  double(std::min<uint64_t>(client.events, expected)) +
                                  double(client.missed) + double(client.rescans);
  state.counters["records"] = double(client.events);
  state.counters["expected_records"] = double(expected);
  state.counters["other_queues_records"] = double(catalogue->other_records);
  state.counters["kernel_events"] = after["events"].asDouble() - before["events"].asDouble();
  state.counters["overflows"] = after["overflows"].asDouble() - before["overflows"].asDouble();
  state.SetLabel(LoadLabel(queues, load));
}

// inotifywait -m -r on the same directories, for the load's four kinds,
// one line per event on a pipe that a thread of this program reads.
void PeerLoad(benchmark::State& state, int queues, Load load) {
  if (access(kInotifywait, X_OK) != 0) {
    state.SkipWithError("inotifywait is not installed (package inotify-tools): row skipped");
    return;
  }
  if (UseCatalogue(queues) == nullptr) {
    state.SkipWithError("cannot write the roots file");
    return;
  }
  LineTally lines;
  Child peer({kInotifywait, "-m", "-r", "-e", "create", "-e", "modify", "-e", "close_write", "-e",
              "delete", "--format", "%w%f %e", "--fromfile", kPlainRoots},
             [&lines](const char* data, size_t size) { lines.Take(data, size); });
  if (peer.WaitFor("Watches established", std::chrono::seconds(60)).empty()) {
    state.SkipWithError(("inotifywait did not start as expected: " + peer.Output()).c_str());
    return;
  }
  const uint64_t expected = KernelEvents(load);
  TimeLoad(
      state, load, [&] { return peer.CpuNs(); }, nullptr,
      [&] { WaitCount(lines.events, expected); });
  state.counters["events_lost"] =
      double(expected) - double(std::min<uint64_t>(lines.events, expected));
  state.SetLabel("inotifywait -m -r, the same directories, the four kinds, a line per event");
}

// The bare reader over the same load.
void BareLoad(benchmark::State& state, int queues, Load load) {
  if (UseCatalogue(queues) == nullptr) {
    state.SkipWithError("cannot write the roots file");
    return;
  }
  const uint64_t expected = KernelEvents(load);
  Child bare({BARE_READER_PATH, kRootsFile, std::to_string(expected)});
  if (bare.WaitFor("ready ", std::chrono::seconds(60)).empty()) {
    state.SkipWithError(("the bare reader did not start as expected: " + bare.Output()).c_str());
    return;
  }
  std::string done;
  TimeLoad(
      state, load, [&] { return bare.CpuNs(); }, nullptr,
      [&] {
        done = bare.WaitFor("done ", std::chrono::seconds(1));
        // Not every event came: stop it (SIGUSR1 ends its read).
        for (int tries = 0; done.empty() && tries < 50; ++tries) {
          kill(bare.pid(), SIGUSR1);
          done = bare.WaitFor("done ", std::chrono::milliseconds(100));
        }
      });
  unsigned long count = 0, overflows = 0;
  if (std::sscanf(done.c_str(), "done %lu %lu", &count, &overflows) != 2) {
    state.SkipWithError("the bare reader did not say what it read");
    return;
  }
  state.counters["events_lost"] = double(expected - std::min<uint64_t>(count, expected));
  state.counters["overflows"] = double(overflows);
  state.SetLabel("bare inotify reader process, the same watches and masks: read and count");
}

const std::string kStateDir = kRoot + "/state";

// From exec to the daemon's "ready" line at 1,000 queues, journals on: the
// first start (|first|: no state yet, so it makes every journal and gives
// each tree a rescan record) or a later one (the state of an earlier start);
// with |inotify_only|, --backend inotify, as a daemon without CAP_SYS_ADMIN
// (the default unit's) chooses, asking nothing of each tree.
void DaemonStartup(benchmark::State& state, bool first, bool inotify_only) {
  const Catalogue* catalogue = UseCatalogue(kMaxQueues);
  if (catalogue == nullptr) {
    state.SkipWithError("cannot write the catalogue");
    return;
  }
  std::vector<std::string> args = {ZORVNOTIFYD_PATH, "--socket", kSocket, "--state-dir",
                                   kStateDir,        "--retry",  "600"};
  if (inotify_only) args.insert(args.end(), {"--backend", "inotify"});
  for (auto _ : state) {
    state.PauseTiming();
    std::filesystem::remove_all(kStateDir);
    if (!first) {
      Child earlier(args);  // saves its state as it stops
      earlier.WaitFor("ready:", std::chrono::seconds(60));
    }
    state.ResumeTiming();
    const auto start = Clock::now();
    Child daemon(Profiled(args));
    const std::string ready = daemon.WaitFor("ready:", std::chrono::seconds(60));
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
    if (ready.find("watching " + std::to_string(catalogue->directories) + " directories") ==
        std::string::npos) {
      state.SkipWithError(("the daemon did not start as expected: " + daemon.Output()).c_str());
      return;
    }
  }
  state.SetLabel(Thousands(kMaxQueues) + " queues of 8 configurations, " +
                 Thousands(static_cast<long>(catalogue->directories)) + " directories, " +
                 (first ? "first start (journals made)" : "later start") +
                 (inotify_only ? ", --backend inotify" : ""));
}

// From exec to inotifywait's "Watches established." over the same trees
// (inotifywait -m -r, every tree from a file).
void InotifywaitStartup(benchmark::State& state) {
  const Catalogue* catalogue = UseCatalogue(kMaxQueues);
  const std::string list = kRoot + "/roots-inotifywait";
  std::ifstream roots(kRootsFile);
  std::ofstream paths(list, std::ios::trunc);
  for (std::string mask, path; roots >> mask >> path;) paths << path << '\n';
  if (catalogue == nullptr || !paths.flush()) {
    state.SkipWithError("cannot write the list of trees");
    return;
  }
  for (auto _ : state) {
    const auto start = Clock::now();
    Child watcher({INOTIFYWAIT_PATH, "-m", "-r", "--fromfile", list});
    const std::string ready = watcher.WaitFor("Watches established.", std::chrono::seconds(60));
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
    if (ready.empty()) {
      state.SkipWithError(("inotifywait did not start as expected: " + watcher.Output()).c_str());
      return;
    }
  }
  state.SetLabel("inotifywait -m -r, the same trees");
}

// From exec to the bare reader's "ready" line: every watch added.
void BareStartup(benchmark::State& state) {
  const Catalogue* catalogue = UseCatalogue(kMaxQueues);
  if (catalogue == nullptr) {
    state.SkipWithError("cannot write the roots file");
    return;
  }
  for (auto _ : state) {
    const auto start = Clock::now();
    Child bare({BARE_READER_PATH, kRootsFile});
    const std::string ready = bare.WaitFor("ready ", std::chrono::seconds(60));
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
    if (ready != "ready " + std::to_string(catalogue->directories) + "\n") {
      state.SkipWithError(("the bare reader did not start as expected: " + bare.Output()).c_str());
      return;
    }
  }
  state.SetLabel("bare inotify reader process: walk and inotify_add_watch, the same directories");
}

const std::string kSnapTree = kRoot + "/snap";
const std::string kSnapRoots = kRoot + "/snap-roots";
constexpr int kSnapDirs = 10000, kSnapFilesPerDir = 10;

// Makes the comparison's tree (100 directories of 99 directories each, 10
// files in every one) and a catalogue of one queue on it.  False on failure.
bool UseSnapshotTree() {
  static bool made = false;
  if (made) return InstallQueueFile("snap");
  std::vector<std::string> dirs;
  for (int i = 0; i < 100; ++i) {
    const std::string top = kSnapTree + "/t" + std::to_string(i);
    dirs.push_back(top);
    for (int j = 0; j < kSnapDirs / 100 - 1; ++j) dirs.push_back(top + "/s" + std::to_string(j));
  }
  if (mkdir(kSnapTree.c_str(), 0755) != 0) return false;
  for (const std::string& dir : dirs) {
    if (mkdir(dir.c_str(), 0755) != 0) return false;
    for (int k = 0; k < kSnapFilesPerDir; ++k) {
      const int fd =
          open((dir + "/file" + std::to_string(k)).c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0644);
      if (fd < 0 || write(fd, "x", 1) != 1) return false;
      close(fd);
    }
  }
  Json::Value value(Json::objectValue);
  value["queue"] = "snap";
  value["config"][0]["path"] = kSnapTree;
  value["config"][0]["mask"] = IN_CREATE | IN_CLOSE_WRITE | IN_DELETE;
  if (!MonitorQueue::SaveToFile({MonitorQueue(value)}, kRoot + "/snap.queues") ||
      !InstallQueueFile("snap")) {
    return false;
  }
  std::ofstream roots(kSnapRoots, std::ios::trunc);
  roots << "0x" << std::hex << (IN_CREATE | IN_CLOSE_WRITE | IN_DELETE | kTreeKeeping) << std::dec
        << ' ' << kSnapTree << '\n';
  return made = static_cast<bool>(roots.flush());
}

// The snapshot's bytes on disk per entry (directory or file) of the tree.
double SnapshotBytesPerEntry() {
  uint64_t bytes = 0;
  for (const auto& file : std::filesystem::directory_iterator(kStateDir + "/snapshot"))
    bytes += file.file_size();
  return double(bytes) / double(kSnapDirs - 1 + kSnapDirs * kSnapFilesPerDir);
}

// From exec to "ready" on the comparison's tree (the walk that sets the
// watches), or with |compared| to the end of the comparison that follows,
// with the snapshot of an earlier start (|saved|) or none.
void SnapshotStartup(benchmark::State& state, bool saved, bool compared) {
  if (!UseSnapshotTree()) {
    state.SkipWithError("cannot make the tree");
    return;
  }
  const std::vector<std::string> args = {ZORVNOTIFYD_PATH, "--socket", kSocket, "--state-dir",
                                         kStateDir,        "--retry",  "600"};
  const std::string expected = "watching " + std::to_string(kSnapDirs + 1) + " directories";
  for (auto _ : state) {
    state.PauseTiming();
    std::filesystem::remove_all(kStateDir);
    if (saved) {
      Child first(args, nullptr, true);  // saves its snapshot as it stops
      first.WaitFor("compared ", std::chrono::seconds(60));
    }
    state.ResumeTiming();
    const auto start = Clock::now();
    Child daemon(Profiled(args), nullptr, true);
    const std::string ready = daemon.WaitFor("ready:", std::chrono::seconds(60));
    const bool done = !compared || !daemon.WaitFor("compared ", std::chrono::seconds(60)).empty();
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
    if (ready.find(expected) == std::string::npos || !done) {
      state.SkipWithError(("the daemon did not start as expected: " + daemon.Output()).c_str());
      return;
    }
  }
  state.counters["snapshot_bytes_per_entry"] = SnapshotBytesPerEntry();
  state.SetLabel("1 queue on 10,000 directories of 100,000 files, " +
                 std::string(!compared ? "the walk that sets the watches"
                             : saved   ? "each compared with the saved snapshot"
                                       : "no snapshot yet (first start)"));
}

// From exec to the bare reader's "ready" on the comparison's tree.
void BareSnapshotStartup(benchmark::State& state) {
  if (!UseSnapshotTree()) {
    state.SkipWithError("cannot make the tree");
    return;
  }
  for (auto _ : state) {
    const auto start = Clock::now();
    Child bare({BARE_READER_PATH, kSnapRoots}, nullptr, true);
    const std::string ready = bare.WaitFor("ready ", std::chrono::seconds(60));
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
    if (ready != "ready " + std::to_string(kSnapDirs + 1) + "\n") {
      state.SkipWithError(("the bare reader did not start as expected: " + bare.Output()).c_str());
      return;
    }
  }
  state.SetLabel("bare inotify reader process: walk and inotify_add_watch, the same directories");
}

// Backends: inotify beside fanotify on a loop-mounted ext4 volume of its
// own (mounted in the sandbox at /tmp/bench/vol), one queue.
//  - start-up, exec to ready, over 20,000 directories with each backend
//    (and 1,000,000 with fanotify alone: inotify's watch limit is lower);
//  - CPU per event of a burst (20,000 files created, written, closed,
//    removed) in a tree that is the whole volume;
//  - the cost of events outside the tree: the same burst in a directory
//    beside a small tree of the volume, daemon CPU per outside event.
const std::string kVolume = kRoot + "/vol";
const std::string kVolumeImage = kRoot + "/vol.img";
const std::string kVolumeState = kRoot + "/vol-state";

// Makes the volume with |dirs| directories under kVolume/tree (100 per
// level), an empty kVolume/hot and kVolume/out.  False on failure.
bool UseVolume(int dirs) {
  static int made = -1;
  if (made == dirs) return true;
  [[maybe_unused]] const int unmounted =  // fails when nothing is mounted there yet
      std::system(("umount " + kVolume + " 2>/dev/null").c_str());
  const std::string inodes = std::to_string(dirs + 100000);
  const std::string make =
      "rm -f " + kVolumeImage + " && truncate -s " + std::to_string(128 + dirs / 512) + "M " +
      kVolumeImage + " && mkfs.ext4 -q -b 1024 -N " + inodes + " " + kVolumeImage +
      " && mkdir -p " + kVolume + " && mount -o loop " + kVolumeImage + " " + kVolume;
  if (std::system(make.c_str()) != 0) return false;
  for (const char* dir : {"/tree", "/hot", "/out"}) {
    if (mkdir((kVolume + dir).c_str(), 0755) != 0) return false;
  }
  // Two levels of 100: tree/aI/bJ, then a third level for more.
  int count = 0;
  for (int i = 0; count < dirs; ++i) {
    const std::string a = kVolume + "/tree/a" + std::to_string(i);
    if (mkdir(a.c_str(), 0755) != 0) return false;
    ++count;
    for (int j = 0; j < 100 && count < dirs; ++j) {
      const std::string b = a + "/b" + std::to_string(j);
      if (mkdir(b.c_str(), 0755) != 0) return false;
      ++count;
      for (int k = 0; k < 99 && count < dirs && dirs > 20000; ++k, ++count) {
        if (mkdir((b + "/c" + std::to_string(k)).c_str(), 0755) != 0) return false;
      }
    }
  }
  made = dirs;
  return true;
}

// Makes the catalogue one queue "q0" on |tree|.
bool UseVolumeCatalogue(const std::string& tree) {
  const std::string conf = MonitorQueue::GetConfDir(ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_ETC_DIR);
  std::filesystem::remove(conf + "/bench");
  std::filesystem::remove(conf + "/snap");
  Json::Value value(Json::objectValue);
  value["queue"] = "q0";
  value["config"][0]["path"] = tree;
  value["config"][0]["mask"] = IN_CREATE | IN_MODIFY | IN_CLOSE_WRITE | IN_DELETE;
  return MonitorQueue::SaveToFile({MonitorQueue(value)}, conf + "/vol");
}

// The daemon on the volume with --backend |backend|.
std::vector<std::string> VolumeDaemon(const char* backend) {
  return {ZORVNOTIFYD_PATH, "--socket", kSocket,     "--state-dir", kVolumeState,
          "--retry",        "600",      "--backend", backend};
}

// From exec to "ready" over |dirs| directories.
void BackendStartup(benchmark::State& state, const char* backend, int dirs) {
  if (!UseVolume(dirs) || !UseVolumeCatalogue(kVolume)) {
    state.SkipWithError("cannot make the volume (mkfs.ext4, a loop device)");
    return;
  }
  for (auto _ : state) {
    state.PauseTiming();
    std::filesystem::remove_all(kVolumeState);
    state.ResumeTiming();
    const auto start = Clock::now();
    Child daemon(VolumeDaemon(backend));
    const std::string ready = daemon.WaitFor("ready:", std::chrono::seconds(600));
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
    if (ready.empty() ||
        daemon.Output().find("served by " + std::string(backend)) == std::string::npos) {
      state.SkipWithError(("the daemon did not start as expected: " + daemon.Output()).c_str());
      return;
    }
  }
  state.SetLabel(std::string(backend) + ", 1 queue on a volume of " + Thousands(dirs) +
                 " directories");
}

// Waits until the daemon's CPU time stops growing (100 ms without a tick).
void WaitIdle(const Child& daemon) {
  int64_t last = -1;
  for (int64_t now; (now = daemon.CpuNs()) != last;) {
    last = now;
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
  }
}

// Daemon CPU per event of a burst in |hot| with |tree| watched: inside the
// tree (events reported) or beside it (|outside|: none are).
void BackendEvents(benchmark::State& state, const char* backend, bool outside) {
  const std::string tree = outside ? kVolume + "/tree/a0" : kVolume;
  const std::string hot = outside ? kVolume + "/out" : kVolume + "/hot";
  if (!UseVolume(20000) || !UseVolumeCatalogue(tree)) {
    state.SkipWithError("cannot make the volume (mkfs.ext4, a loop device)");
    return;
  }
  std::filesystem::remove_all(kVolumeState);
  Child daemon(VolumeDaemon(backend));
  if (daemon.WaitFor("ready:", std::chrono::seconds(600)).empty()) {
    state.SkipWithError(("the daemon did not start: " + daemon.Output()).c_str());
    return;
  }
  WaitIdle(daemon);  // the walk after ready
  for (auto _ : state) {
    const Json::Value before = Status();
    const int64_t cpu = daemon.CpuNs();
    static const char kData[] = "burst\n";
    for (int n = 0; n < kFiles; ++n) {
      const std::string path = hot + "/f" + std::to_string(n) + ".dat";
      const int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
      if (fd < 0) continue;
      if (write(fd, kData, sizeof(kData) - 1) < 0) perror("daemon_bench: write");
      close(fd);
      unlink(path.c_str());
    }
    WaitIdle(daemon);
    const Json::Value after = Status();
    // Four events a file: created, modified, closed after writing, deleted.
    state.counters["cpu_ns_per_event"] = double(daemon.CpuNs() - cpu) / (4.0 * kFiles);
    state.counters["events"] = after["events"].asDouble() - before["events"].asDouble();
    state.counters["overflows"] = after["overflows"].asDouble() - before["overflows"].asDouble();
  }
  state.SetLabel(std::string(backend) + (outside ? ", 80,000 events beside a tree of 100 "
                                                   "directories on the same volume (none reported)"
                                                 : ", 80,000 events in a tree that is the volume"));
}

double Max(const std::vector<double>& values) {
  return values.empty() ? 0 : *std::max_element(values.begin(), values.end());
}

}  // namespace

int main(int argc, char** argv) {
  if (!zorv_test::EnterSandbox()) {
    std::fprintf(stderr, "daemon_bench: sandbox unavailable: %s\n", zorv_test::SandboxSkipReason());
    return 1;
  }
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  PlaceThreads();
  // A descriptor per client, here and in the daemon.
  struct rlimit files;
  if (getrlimit(RLIMIT_NOFILE, &files) == 0 && files.rlim_cur < files.rlim_max) {
    files.rlim_cur = files.rlim_max;
    setrlimit(RLIMIT_NOFILE, &files);
  }
  if (!MakeTrees()) {
    std::fprintf(stderr, "daemon_bench: cannot make the trees\n");
    return 1;
  }
  for (int queues : {1, 100, 1000}) {
    for (const Load load : {Load::kBurst, Load::kPaced}) {
      const std::string name = std::string("zorvnotifyd/") +
                               (load == Load::kBurst ? "burst" : "paced 1,000 files/s") + ", " +
                               Thousands(queues) + (queues == 1 ? " queue" : " queues");
      benchmark::RegisterBenchmark(("lib/" + name).c_str(), DaemonLoad, queues, load, true, true)
          ->Iterations(1)
          ->ComputeStatistics("max", Max);
      benchmark::RegisterBenchmark(("lib/" + name + ", no coalescing").c_str(), DaemonLoad, queues,
                                   load, true, false)
          ->Iterations(1)
          ->ComputeStatistics("max", Max);
      if (load == Load::kBurst) {
        benchmark::RegisterBenchmark(("lib/" + name + ", no journal").c_str(), DaemonLoad, queues,
                                     load, false, true)
            ->Iterations(1)
            ->ComputeStatistics("max", Max);
      }
      benchmark::RegisterBenchmark(("peer/" + name).c_str(), PeerLoad, queues, load)
          ->Iterations(1)
          ->ComputeStatistics("max", Max);
      benchmark::RegisterBenchmark(("base/" + name).c_str(), BareLoad, queues, load)
          ->Iterations(1)
          ->ComputeStatistics("max", Max);
    }
  }
  for (const bool first : {false, true}) {
    benchmark::RegisterBenchmark(first ? "lib/zorvnotifyd/first start-up, exec to ready"
                                       : "lib/zorvnotifyd/start-up, exec to ready",
                                 DaemonStartup, first, false)
        ->Iterations(3)
        ->UseManualTime()
        ->Unit(benchmark::kMillisecond);
  }
  benchmark::RegisterBenchmark("lib/zorvnotifyd/start-up without fanotify, exec to ready",
                               DaemonStartup, false, true)
      ->Iterations(3)
      ->UseManualTime()
      ->Unit(benchmark::kMillisecond);
  // inotifywait beside the same baseline: the two ratios compare.
  if (access(INOTIFYWAIT_PATH, X_OK) == 0) {
    benchmark::RegisterBenchmark("lib/inotifywait/start-up, exec to ready", InotifywaitStartup)
        ->Iterations(3)
        ->UseManualTime()
        ->Unit(benchmark::kMillisecond);
  }
  for (const char* name : {"base/zorvnotifyd/start-up, exec to ready",
                           "base/zorvnotifyd/first start-up, exec to ready",
                           "base/zorvnotifyd/start-up without fanotify, exec to ready",
                           "base/inotifywait/start-up, exec to ready"}) {
    benchmark::RegisterBenchmark(name, BareStartup)
        ->Iterations(3)
        ->UseManualTime()
        ->Unit(benchmark::kMillisecond);
  }
  // On a catalogue of their own.  The comparison beside the walk
  // that only sets the watches (exec to "ready"), and that walk beside the
  // bare reader's.
  for (const bool saved : {true, false}) {
    benchmark::RegisterBenchmark(
        saved ? "lib/zorvnotifyd/start-up compared with a snapshot, exec to compared"
              : "lib/zorvnotifyd/start-up without a snapshot, exec to compared",
        SnapshotStartup, saved, true)
        ->Iterations(3)
        ->UseManualTime()
        ->Unit(benchmark::kMillisecond);
  }
  for (const char* name : {"base/zorvnotifyd/start-up compared with a snapshot, exec to compared",
                           "lib/zorvnotifyd/start-up on the snapshot's tree, exec to ready"}) {
    benchmark::RegisterBenchmark(name, SnapshotStartup, true, false)
        ->Iterations(3)
        ->UseManualTime()
        ->Unit(benchmark::kMillisecond);
  }
  benchmark::RegisterBenchmark("base/zorvnotifyd/start-up on the snapshot's tree, exec to ready",
                               BareSnapshotStartup)
      ->Iterations(3)
      ->UseManualTime()
      ->Unit(benchmark::kMillisecond);
  // Last: on a volume of their own, with its own catalogue.
  for (const char* backend : {"inotify", "fanotify"}) {
    benchmark::RegisterBenchmark(
        ("lib/zorvnotifyd/" + std::string(backend) + " start-up, 20,000 directories").c_str(),
        BackendStartup, backend, 20000)
        ->Iterations(3)
        ->UseManualTime()
        ->Unit(benchmark::kMillisecond);
  }
  for (const bool outside : {false, true}) {
    for (const char* backend : {"inotify", "fanotify"}) {
      benchmark::RegisterBenchmark(("lib/zorvnotifyd/" + std::string(backend) +
                                    (outside ? " burst outside the tree" : " burst"))
                                       .c_str(),
                                   BackendEvents, backend, outside)
          ->Iterations(3)
          ->ComputeStatistics("max", Max);
    }
  }
  benchmark::RegisterBenchmark("lib/zorvnotifyd/fanotify start-up, 1,000,000 directories",
                               BackendStartup, "fanotify", 1000000)
      ->Iterations(3)
      ->UseManualTime()
      ->Unit(benchmark::kMillisecond);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
