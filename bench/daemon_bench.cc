// The daemon zorvnotifyd beside a bare inotify reader process
// (bare_inotify_reader) that watches the same directories with the same
// masks and only reads the events.
//
// The catalogue: N queues (10, 100, 1,000) of 8 configurations each, with
// 2-3 ignore patterns.  Queue i watches /tmp/bench/share/q<i>/d<j>, except
// that 8 queues spread over the catalogue have their last configuration on
// the hot directory /tmp/bench/share/hot, with masks of which some take the
// burst's event kinds and some do not, and patterns of which some ignore
// the burst's files.  The trees hold 10 directories per queue (10,000 at
// 1,000 queues): the configured ones, two below each queue's first, seven
// below the hot one.  Every queue has a client subscribed on the daemon's
// socket, read by a thread of this program.
//
// Burst: one process creates, writes and removes 20,000 files in the hot
// directory as fast as it can (80,000 inotify events).  The row is the CPU
// time (user + system) of the daemon's process, or of the bare reader's,
// from just before the burst until the last event has reached the clients
// (or has been read), per inotify event.  The events lost are the event
// lines the clients did not get (of those the catalogue wants, worked out
// with MonitorQueueIndex), or the events the bare reader did not read.
// The daemon runs with each queue's journal (its default) and, in the rows
// "no journal", with --journal-size 0: the difference is what journaling
// costs per event.  Its state is in the sandbox's /var/lib, a tmpfs: the
// rows count the CPU of the writes and syncs, not the disk's latency.
//
// Start-up: wall time from exec to the daemon's "ready" log line at 1,000
// queues, beside the bare reader's time to walk the same 10,000 directories
// and add their watches.
//
// Start-up comparison (run last: it replaces the catalogue): one queue on a
// tree of 10,000 directories holding 100,000 files, the daemon started with
// the snapshot a first start saved (every directory compared, nothing
// changed) and with none (the first start, which lists the tree for its
// first snapshot), beside the bare reader's walk of the same directories;
// and the size of the saved snapshot per entry.
//
// With two CPUs or more, the writer has one to itself and the reading side
// (the daemon and its clients' thread, or the bare reader) another, so that
// where the scheduler puts them does not change the batches the readers
// find (each wake-up costs the same whatever it brings).
//
// Runs in the test sandbox (root): the catalogue is in /usr/zorv, the trees
// in /tmp.

#include <errno.h>
#include <fcntl.h>
#include <sched.h>
#include <signal.h>
#include <spawn.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
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
#include "support/sandbox.h"

extern char** environ;

namespace {

using ZORV::ZORVNOTIFYD::MonitorQueue;
using ZORV::ZORVNOTIFYD::MonitorQueueIndex;
using Clock = std::chrono::steady_clock;

constexpr int kConfigs = 8;
constexpr int kHotQueues = 8;
constexpr int kMaxQueues = 1000;
constexpr int kFiles = 20000;
// Created, modified, closed after writing, deleted.
constexpr uint32_t kBurstKinds[] = {IN_CREATE, IN_MODIFY, IN_CLOSE_WRITE, IN_DELETE};
constexpr uint64_t kKernelEvents = uint64_t(kFiles) * std::size(kBurstKinds);
// The kinds the daemon watches on every directory to keep its tree.
constexpr uint32_t kTreeKeeping =
    IN_CREATE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE | IN_MOVE_SELF | IN_DELETE_SELF;

const std::string kRoot = "/tmp/bench";
const std::string kShare = kRoot + "/share";
const std::string kHotDir = kShare + "/hot";
// A socket's directory must be root's and writable by root alone.
const std::string kSocketDir = "/tmp/zorvrun";
const std::string kSocket = kSocketDir + "/zorvnotifyd.sock";
const std::string kRootsFile = kRoot + "/roots";

// The configurations on the hot directory, one per hot queue.
struct HotConfig {
  uint32_t mask;
  std::vector<const char*> ignore;
};
const std::vector<const char*> kIgnore = {"\\.tmp$", "/\\.#[^/]*$", "~$"};
const HotConfig kHot[kHotQueues] = {
    {IN_CLOSE_WRITE, kIgnore},                           // every file, closed
    {IN_CREATE | IN_DELETE, kIgnore},                    // every file, twice
    {IN_MOVED_FROM | IN_MOVED_TO, kIgnore},              // no kind of the burst
    {IN_ATTRIB, kIgnore},                                // no kind of the burst
    {IN_MODIFY | IN_CLOSE_WRITE, {"\\.dat$", "~$"}},     // ignores every file
    {IN_MODIFY, kIgnore},                                // every file, written
    {IN_DELETE_SELF | IN_MOVE_SELF, kIgnore},            // no kind of the burst
    {IN_CREATE, {"/f[0-9]*[13579]\\.dat$", "\\.tmp$"}},  // half the files
};
// The masks of the other configurations, by position.
constexpr uint32_t kMasks[4] = {IN_CLOSE_WRITE | IN_MOVED_TO,
                                IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO,
                                IN_MODIFY | IN_ATTRIB, IN_CLOSE_WRITE | IN_DELETE};

// The writer's CPU and the reading side's; |pinned| false with one CPU.
struct Placement {
  bool pinned = false;
  cpu_set_t writer, reader;
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
  int found = 0;
  for (int cpu = 0; cpu < CPU_SETSIZE && found < 2; ++cpu) {
    if (!CPU_ISSET(cpu, &allowed)) continue;
    CPU_SET(cpu, found++ == 0 ? &g_cpus.writer : &g_cpus.reader);
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

// The position of hot queue |k| in a catalogue of |queues|.
int HotQueue(int queues, int k) { return k * queues / kHotQueues; }

// Creates every directory of the largest catalogue: q<i>/d0..d7, two
// subdirectories of each d0, and seven of the hot directory; and the
// socket's directory.
bool MakeTrees() {
  std::error_code error;
  for (int i = 0; i < kMaxQueues && !error; ++i) {
    for (int j = 0; j < kConfigs; ++j) {
      std::filesystem::create_directories(QueueDir(i) + "/d" + std::to_string(j), error);
    }
    for (const char* sub : {"/d0/s0", "/d0/s1"}) {
      std::filesystem::create_directories(QueueDir(i) + sub, error);
    }
  }
  for (int h = 0; h < 7; ++h) {
    std::filesystem::create_directories(kHotDir + "/h" + std::to_string(h), error);
  }
  mkdir(kSocketDir.c_str(), 0755);
  return !error && chmod(kSocketDir.c_str(), 0755) == 0;
}

// The burst's files.
const std::vector<std::string>& BurstPaths() {
  static const std::vector<std::string> paths = [] {
    std::vector<std::string> list;
    for (int n = 0; n < kFiles; ++n) list.push_back(kHotDir + "/f" + std::to_string(n) + ".dat");
    return list;
  }();
  return paths;
}

// Creates, writes, closes and removes every file of the burst.
void Burst() {
  static const char kData[] = "burst\n";
  for (const std::string& path : BurstPaths()) {
    const int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd < 0) continue;
    if (write(fd, kData, sizeof(kData) - 1) < 0) perror("daemon_bench: write");
    close(fd);
    unlink(path.c_str());
  }
}

// The catalogue in use: its queue file, the bare reader's roots file, and
// what the clients should get from a burst.
struct Catalogue {
  int queues = 0;
  size_t directories = 0;       // watched, as the daemon should say when ready
  uint64_t expected_lines = 0;  // event lines for the clients, over all queues
};

const Catalogue* UseCatalogue(int queues) {
  static Catalogue current;
  if (current.queues == queues) return &current;
  current = Catalogue();
  std::vector<MonitorQueue> catalogue;
  std::vector<std::string> roots;
  std::set<std::string> seen;
  for (int i = 0; i < queues; ++i) {
    int hot = -1;
    for (int k = 0; k < kHotQueues; ++k) {
      if (HotQueue(queues, k) == i) hot = k;
    }
    Json::Value value(Json::objectValue);
    value["queue"] = "q" + std::to_string(i);
    for (int j = 0; j < kConfigs; ++j) {
      Json::Value config(Json::objectValue);
      const bool on_hot = hot >= 0 && j == kConfigs - 1;
      config["path"] = on_hot ? kHotDir : QueueDir(i) + "/d" + std::to_string(j);
      config["mask"] = on_hot ? kHot[hot].mask : kMasks[j % 4];
      for (const char* pattern : on_hot ? kHot[hot].ignore : kIgnore) {
        config["ignore"].append(pattern);
      }
      value["config"].append(config);
      if (seen.insert(config["path"].asString()).second) roots.push_back(config["path"].asString());
    }
    catalogue.emplace_back(value);
  }
  const std::string dir = MonitorQueue::GetConfDir(ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_ETC_DIR);
  if (!MonitorQueue::SaveToFile(catalogue, dir + "/bench")) return nullptr;
  // The bare reader watches each tree with the mask the daemon gives it.
  const MonitorQueueIndex index(catalogue);
  std::ofstream file(kRootsFile, std::ios::trunc);
  for (const std::string& root : roots) {
    file << "0x" << std::hex << ((index.GetWatchMask(root) & IN_ALL_EVENTS) | kTreeKeeping)
         << std::dec << ' ' << root << '\n';
  }
  if (!file.flush()) return nullptr;
  std::vector<size_t> matches;
  for (const std::string& path : BurstPaths()) {
    for (uint32_t kind : kBurstKinds) {
      index.Match(path, kind, matches);
      current.expected_lines += matches.size();
    }
  }
  current.directories = roots.size() + 2 * static_cast<size_t>(queues) + 7;
  current.queues = queues;
  return &current;
}

// A child process, its standard output and error read by a thread.
class Child {
 public:
  explicit Child(const std::vector<std::string>& args) {
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
    // The child starts on the reading side's CPU.
    RunOn(g_cpus.reader);
    if (posix_spawn(&pid_, argv[0], &actions, nullptr, argv.data(), environ) != 0) pid_ = -1;
    RunOn(g_cpus.writer);
    posix_spawn_file_actions_destroy(&actions);
    close(out[1]);
    close(in[0]);
    input_ = in[1];
    reader_ = std::thread([this, fd = out[0]] {
      char buffer[4096];
      for (ssize_t n; (n = read(fd, buffer, sizeof(buffer))) > 0;) {
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

// One client per queue, each subscribed to its queue, read by one thread
// that counts what arrives.
class Subscribers {
 public:
  std::atomic<uint64_t> replies{0}, events{0}, missed{0}, rescans{0}, other{0};

  Subscribers() {
    epoll_ = epoll_create1(EPOLL_CLOEXEC);
    stop_ = eventfd(0, EFD_CLOEXEC);
    struct epoll_event event = {};
    event.events = EPOLLIN;
    event.data.u64 = ~uint64_t(0);
    epoll_ctl(epoll_, EPOLL_CTL_ADD, stop_, &event);
  }
  Subscribers(const Subscribers&) = delete;
  Subscribers& operator=(const Subscribers&) = delete;
  ~Subscribers() {
    if (thread_.joinable()) {
      const uint64_t one = 1;
      if (write(stop_, &one, sizeof(one)) < 0) perror("daemon_bench: eventfd");
      thread_.join();
    }
    for (const Client& client : clients_) close(client.fd);
    close(stop_);
    close(epoll_);
  }

  // Connects |queues| clients, client i subscribing to queue "q<i>".
  bool Connect(int queues) {
    clients_.resize(static_cast<size_t>(queues));
    thread_ = std::thread([this] {
      RunOn(g_cpus.reader);
      Run();
    });
    for (int i = 0; i < queues; ++i) {
      const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
      struct sockaddr_un address = {};
      address.sun_family = AF_UNIX;
      kSocket.copy(address.sun_path, sizeof(address.sun_path) - 1);
      const std::string request =
          "{\"request\":\"subscribe\",\"queue\":\"q" + std::to_string(i) + "\"}\n";
      if (fd < 0 || connect(fd, reinterpret_cast<struct sockaddr*>(&address), sizeof(address)) ||
          send(fd, request.data(), request.size(), MSG_NOSIGNAL) !=
              static_cast<ssize_t>(request.size()) ||
          fcntl(fd, F_SETFL, O_NONBLOCK) != 0) {
        if (fd >= 0) close(fd);
        return false;
      }
      clients_[static_cast<size_t>(i)].fd = fd;
      struct epoll_event event = {};
      event.events = EPOLLIN;
      event.data.u64 = static_cast<uint64_t>(i);
      if (epoll_ctl(epoll_, EPOLL_CTL_ADD, fd, &event) != 0) return false;
    }
    return true;
  }

 private:
  struct Client {
    int fd = -1;
    std::string partial;  // the start of a line not complete yet
  };

  void Run() {
    struct epoll_event ready[64];
    std::vector<char> buffer(256 * 1024);
    for (;;) {
      const int n = epoll_wait(epoll_, ready, 64, -1);
      for (int e = 0; e < n; ++e) {
        if (ready[e].data.u64 == ~uint64_t(0)) return;
        Client& client = clients_[ready[e].data.u64];
        for (;;) {
          const ssize_t got = read(client.fd, buffer.data(), buffer.size());
          if (got <= 0) {
            if (got == 0) epoll_ctl(epoll_, EPOLL_CTL_DEL, client.fd, nullptr);
            break;
          }
          Take(client, buffer.data(), static_cast<size_t>(got));
        }
      }
    }
  }

  // Counts the complete lines of |data| (after what |client| kept).
  void Take(Client& client, const char* data, size_t size) {
    const char* end = data + size;
    const char* start = data;
    for (const char* nl; (nl = static_cast<const char*>(memchr(start, '\n', end - start)));
         start = nl + 1) {
      if (client.partial.empty()) {
        Count(start, nl);
      } else {
        client.partial.append(start, nl);
        Count(client.partial.data(), client.partial.data() + client.partial.size());
        client.partial.clear();
      }
    }
    client.partial.append(start, end);
  }

  void Count(const char* begin, const char* end) {
    const std::string_view line(begin, static_cast<size_t>(end - begin));
    if (line.rfind("{\"reply\":", 0) == 0) {
      ++replies;
    } else if (const size_t at = line.find("\"missed\":"); at != std::string_view::npos) {
      missed += std::strtoull(begin + at + 9, nullptr, 10);
    } else if (line.find("\"rescan\":") != std::string_view::npos) {
      ++rescans;
    } else if (line.find("\"path\":") != std::string_view::npos) {
      ++events;
    } else {
      ++other;
    }
  }

  int epoll_ = -1;
  int stop_ = -1;
  std::vector<Client> clients_;
  std::thread thread_;
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

std::string BurstLabel(int queues) {
  return Thousands(queues) + " queues of 8 configurations, 8 of them on the burst's directory; " +
         Thousands(static_cast<long>(queues) * 10) +
         " directories; a client per queue; 20,000 files created, written, removed (80,000 "
         "events)";
}

// Runs the burst once per iteration, |wait_for_end| returning once |child|
// has every event, and reports |child|'s CPU time over the last one: per
// event, in all, the user share, and the wall time.
template <typename WaitForEnd>
void TimeBurst(benchmark::State& state, const Child& child, WaitForEnd wait_for_end) {
  int64_t cpu_ns = 0;
  long user0 = 0, system0 = 0, user1 = 0, system1 = 0;
  double wall = 0;
  for (auto _ : state) {
    child.Ticks(&user0, &system0);
    const int64_t cpu0 = child.CpuNs();
    const auto start = Clock::now();
    Burst();
    wait_for_end();
    cpu_ns = child.CpuNs() - cpu0;
    wall = std::chrono::duration<double>(Clock::now() - start).count();
    child.Ticks(&user1, &system1);
  }
  const long user = user1 - user0, system = system1 - system0;
  state.counters["cpu_ns_per_event"] = double(cpu_ns) / double(kKernelEvents);
  state.counters["cpu_ms"] = double(cpu_ns) / 1e6;
  state.counters["user_share"] = user + system > 0 ? double(user) / double(user + system) : 0;
  state.counters["wall_ms"] = wall * 1e3;
}

// The daemon's CPU time over a burst, its clients subscribed; each queue's
// records in its journal (the default), or, without |journal|, in memory
// only.
void DaemonBurst(benchmark::State& state, int queues, bool journal) {
  const Catalogue* catalogue = UseCatalogue(queues);
  if (catalogue == nullptr) {
    state.SkipWithError("cannot write the catalogue");
    return;
  }
  // The periodic look at the trees every 10 minutes, not in the burst.
  std::vector<std::string> args = {ZORVNOTIFYD_PATH, "--socket", kSocket, "--retry", "600"};
  if (!journal) args.insert(args.end(), {"--journal-size", "0"});
  Child daemon(args);
  const std::string ready = daemon.WaitFor("ready:", std::chrono::seconds(60));
  if (ready.find("watching " + std::to_string(catalogue->directories) + " directories") ==
      std::string::npos) {
    state.SkipWithError(("the daemon did not start as expected: " + daemon.Output()).c_str());
    return;
  }
  Subscribers clients;
  const bool connected = clients.Connect(queues);
  WaitCount(clients.replies, static_cast<uint64_t>(queues));
  if (!connected || clients.replies != static_cast<uint64_t>(queues)) {
    state.SkipWithError("the clients could not subscribe");
    return;
  }
  const Json::Value before = Status();
  TimeBurst(state, daemon, [&] { WaitCount(clients.events, catalogue->expected_lines); });
  const Json::Value after = Status();
  state.counters["events_lost"] =
      double(catalogue->expected_lines) -
      double(std::min<uint64_t>(clients.events, catalogue->expected_lines));
  state.counters["lines"] = double(clients.events);
  state.counters["expected_lines"] = double(catalogue->expected_lines);
  state.counters["missed"] = double(clients.missed);
  state.counters["rescan_records"] = double(clients.rescans);
  state.counters["kernel_events"] = after["events"].asDouble() - before["events"].asDouble();
  state.counters["overflows"] = after["overflows"].asDouble() - before["overflows"].asDouble();
  state.SetLabel(BurstLabel(queues));
}

// The bare reader's CPU time over the same burst.
void BareBurst(benchmark::State& state, int queues) {
  const Catalogue* catalogue = UseCatalogue(queues);
  if (catalogue == nullptr) {
    state.SkipWithError("cannot write the roots file");
    return;
  }
  Child bare({BARE_READER_PATH, kRootsFile, std::to_string(kKernelEvents)});
  if (bare.WaitFor("ready " + std::to_string(catalogue->directories) + "\n",
                   std::chrono::seconds(60))
          .empty()) {
    state.SkipWithError(("the bare reader did not start as expected: " + bare.Output()).c_str());
    return;
  }
  std::string done;
  TimeBurst(state, bare, [&] {
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
  state.counters["events_lost"] = double(kKernelEvents - std::min<uint64_t>(count, kKernelEvents));
  state.counters["kernel_events"] = double(count);
  state.counters["overflows"] = double(overflows);
  state.SetLabel("bare inotify reader process, the same watches and masks: read and count");
}

// From exec to the daemon's "ready" line.
void DaemonStartup(benchmark::State& state) {
  const Catalogue* catalogue = UseCatalogue(kMaxQueues);
  if (catalogue == nullptr) {
    state.SkipWithError("cannot write the catalogue");
    return;
  }
  for (auto _ : state) {
    const auto start = Clock::now();
    Child daemon({ZORVNOTIFYD_PATH, "--socket", kSocket});
    const std::string ready = daemon.WaitFor("ready:", std::chrono::seconds(60));
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
    if (ready.find("watching " + std::to_string(catalogue->directories) + " directories") ==
        std::string::npos) {
      state.SkipWithError(("the daemon did not start as expected: " + daemon.Output()).c_str());
      return;
    }
  }
  state.SetLabel(Thousands(kMaxQueues) + " queues of 8 configurations, " +
                 Thousands(static_cast<long>(catalogue->directories)) + " directories");
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
const std::string kStateDir = kRoot + "/state";
const std::string kSnapRoots = kRoot + "/snap-roots";
constexpr int kSnapDirs = 10000, kSnapFilesPerDir = 10;

// Makes the comparison's tree (100 directories of 99 directories each, 10
// files in every one) and a catalogue of one queue on it.  False on failure.
bool UseSnapshotTree() {
  static bool made = false;
  if (made) return true;
  const std::string conf = MonitorQueue::GetConfDir(ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_ETC_DIR);
  std::filesystem::remove(conf + "/bench");
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
  if (!MonitorQueue::SaveToFile({MonitorQueue(value)}, conf + "/snap")) return false;
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

// From exec to "ready" on the comparison's tree, with the snapshot of an
// earlier start (|saved|) or none.
void SnapshotStartup(benchmark::State& state, bool saved) {
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
      Child first(args);  // saves its snapshot as it stops
      first.WaitFor("ready:", std::chrono::seconds(60));
    }
    state.ResumeTiming();
    const auto start = Clock::now();
    Child daemon(args);
    const std::string ready = daemon.WaitFor("ready:", std::chrono::seconds(60));
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
    if (ready.find(expected) == std::string::npos) {
      state.SkipWithError(("the daemon did not start as expected: " + daemon.Output()).c_str());
      return;
    }
  }
  state.counters["snapshot_bytes_per_entry"] = SnapshotBytesPerEntry();
  state.SetLabel("1 queue on 10,000 directories of 100,000 files, " +
                 std::string(saved ? "each compared with the saved snapshot"
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
    Child bare({BARE_READER_PATH, kSnapRoots});
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
    state.counters["cpu_ns_per_event"] = double(daemon.CpuNs() - cpu) / double(kKernelEvents);
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
  for (int queues : {10, 100, 1000}) {
    const std::string name = "zorvnotifyd/burst, " + Thousands(queues) + " queues";
    benchmark::RegisterBenchmark(("lib/" + name).c_str(), DaemonBurst, queues, true)
        ->Iterations(1)
        ->ComputeStatistics("max", Max);
    benchmark::RegisterBenchmark(("lib/" + name + ", no journal").c_str(), DaemonBurst, queues,
                                 false)
        ->Iterations(1)
        ->ComputeStatistics("max", Max);
    benchmark::RegisterBenchmark(("base/" + name).c_str(), BareBurst, queues)
        ->Iterations(1)
        ->ComputeStatistics("max", Max);
  }
  benchmark::RegisterBenchmark("lib/zorvnotifyd/start-up, exec to ready", DaemonStartup)
      ->Iterations(1)
      ->UseManualTime()
      ->Unit(benchmark::kMillisecond);
  benchmark::RegisterBenchmark("base/zorvnotifyd/start-up, exec to ready", BareStartup)
      ->Iterations(1)
      ->UseManualTime()
      ->Unit(benchmark::kMillisecond);
  // Last: these replace the catalogue.
  for (const bool saved : {true, false}) {
    benchmark::RegisterBenchmark(
        saved ? "lib/zorvnotifyd/start-up compared with a snapshot, exec to ready"
              : "lib/zorvnotifyd/start-up without a snapshot, exec to ready",
        SnapshotStartup, saved)
        ->Iterations(3)
        ->UseManualTime()
        ->Unit(benchmark::kMillisecond);
  }
  benchmark::RegisterBenchmark("base/zorvnotifyd/start-up compared with a snapshot, exec to ready",
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
