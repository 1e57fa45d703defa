// End-to-end test of the zorvnotifyd daemon, run with --json in this program's
// sandbox over trees under /tmp.  Each step compares the exact sequence of
// lines, so a line that must not come shows up in place of one that must.

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <json/json.h>

#include "monitor_queue.h"
#include "support/sandbox.h"

namespace {

using namespace ZORV::ZORVNOTIFYD;  // NOLINT
using Lines = std::vector<std::string>;

// The daemon as a child process with --json.
class Daemon {
 public:
  Daemon() {
    EXPECT_TRUE(pipe2(out_, O_CLOEXEC) == 0 && pipe2(err_, O_CLOEXEC) == 0);
    if ((pid_ = fork()) == 0) {
      if (dup2(out_[1], 1) < 0 || dup2(err_[1], 2) < 0) _exit(125);
      execl(ZORVNOTIFYD_PATH, ZORVNOTIFYD_PATH, "--json", nullptr);
      _exit(127);
    }
    for (int fd : {out_[1], err_[1]}) close(fd);
  }
  ~Daemon() {
    if (pid_ > 0 && kill(pid_, SIGKILL) == 0) waitpid(pid_, nullptr, 0);
    for (int fd : {out_[0], err_[0]}) close(fd);
  }
  // The next line of standard output (standard error when |err|), waiting
  // up to 5 s; "" on timeout or at the end.  Lines come whole.
  std::string Read(bool err = false) {
    struct pollfd p = {err ? err_[0] : out_[0], POLLIN, 0};
    std::string text;
    char c;
    if (poll(&p, 1, 5000) <= 0) return "";
    while (read(p.fd, &c, 1) == 1 && c != '\n') text += c;
    return text;
  }
  // True once a line of standard error holds |text|.
  bool Logged(const std::string& text) {
    for (std::string line = Read(true); !line.empty(); line = Read(true)) {
      if (line.find(text) != std::string::npos) return true;
    }
    return false;
  }
  // Sends SIGTERM and returns the exit status, -1 when it did not exit.
  int Stop() {
    int status = 0;
    if (kill(pid_, SIGTERM) != 0 || waitpid(pid_, &status, 0) != pid_) return -1;
    pid_ = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

 private:
  pid_t pid_ = -1;
  int out_[2] = {-1, -1}, err_[2] = {-1, -1};
};

constexpr unsigned kCreate = IN_CREATE, kModify = IN_MODIFY, kDelete = IN_DELETE;

// The expected line of queue 'a', 'b' or 'c' of the test for |path| below
// /tmp.
std::string E(char queue, const std::string& path, unsigned mask) {
  const char* id = queue == 'a' ? "a etc fa" : queue == 'b' ? "b share fb" : "c local-etc fc";
  return std::string(id) + " /tmp/" + path + " " + std::to_string(mask);
}

void Register(const char* name, const char* file, _tag_monitor_queue_type_ type, const char* path,
              unsigned mask, const char* ignore = nullptr) {
  Json::Value json;
  json["queue"] = name;
  json["config"][0]["path"] = path;
  json["config"][0]["mask"] = mask;
  if (ignore != nullptr) json["config"][0]["ignore"][0] = ignore;
  ASSERT_TRUE(MonitorQueue::Upsert(MonitorQueue(json), file, type));
}

// Reads as many reports as |expected| holds, each as "queue type file path
// mask" (a line that is not JSON as it is), and compares.
void Expect(Daemon& daemon, const Lines& expected) {
  Lines got;
  for (size_t i = 0; i < expected.size(); ++i) {
    const std::string text = daemon.Read();
    Json::Value v;
    std::istringstream in(text);
    got.push_back(text);
    if (!Json::parseFromStream(Json::CharReaderBuilder(), in, &v, nullptr)) continue;
    EXPECT_EQ(v.getMemberNames(), Lines({"file", "mask", "path", "queue", "type"})) << text;
    EXPECT_TRUE(v["mask"].isUInt()) << text;
    got.back() = v["queue"].asString() + " " + v["type"].asString() + " " + v["file"].asString() +
                 " " + v["path"].asString() + " " + std::to_string(v["mask"].asUInt());
  }
  EXPECT_EQ(got, expected);
}

// Files are written with std::ofstream: IN_CREATE, then IN_MODIFY when the
// stream is flushed at its end, then IN_CLOSE_WRITE.
TEST(DaemonTest, ReportsToEachQueueExactlyItsEventsAndFollowsTheCatalogue) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  ASSERT_EQ(std::system("rm -rf /tmp/w /tmp/w2 /tmp/d"), 0);
  for (const char* dir : {"/tmp/w", "/tmp/w/b", "/tmp/w2", "/tmp/d", "/tmp/d/inner"}) {
    ASSERT_EQ(mkdir(dir, 0755), 0) << dir;
  }
  for (const char* path : {"/tmp/d/f", "/tmp/d/inner/g"}) std::ofstream(path) << "x";
  Register("a", "fa", MONITOR_QUEUE_TYPE_ETC_DIR, "/tmp/w", kCreate | kModify | kDelete, "\\.tmp$");
  Register("b", "fb", MONITOR_QUEUE_TYPE_SHARE_DIR, "/tmp/w/b", IN_CLOSE_WRITE | kDelete);
  Daemon daemon;
  ASSERT_TRUE(daemon.Logged("ready: watching 2 directories"));

  // Two masks on overlapping trees (queues in catalogue order: share
  // first); the ignored file never shows.
  for (const char* path : {"/tmp/w/f1", "/tmp/w/x.tmp", "/tmp/w/b/g"}) std::ofstream(path) << "x";
  for (const char* path : {"/tmp/w/x.tmp", "/tmp/w/f1", "/tmp/w/b/g"}) unlink(path);
  Expect(daemon, {E('a', "w/f1", kCreate), E('a', "w/f1", kModify), E('a', "w/b/g", kCreate),
                  E('a', "w/b/g", kModify), E('b', "w/b/g", IN_CLOSE_WRITE),
                  E('a', "w/f1", kDelete), E('b', "w/b/g", kDelete), E('a', "w/b/g", kDelete)});

  // A directory made while running is watched once reported.  One moved in
  // has its older content reported, and is watched below once that is.
  ASSERT_EQ(mkdir("/tmp/w/new", 0755), 0);
  Expect(daemon, {E('a', "w/new", kCreate | IN_ISDIR)});
  std::ofstream("/tmp/w/new/h") << "x";
  unlink("/tmp/w/new/h");
  rmdir("/tmp/w/new");
  ASSERT_EQ(rename("/tmp/d", "/tmp/w/d"), 0);
  Expect(daemon,
         {E('a', "w/new/h", kCreate), E('a', "w/new/h", kModify), E('a', "w/new/h", kDelete),
          E('a', "w/new", kDelete | IN_ISDIR), E('a', "w/d/f", kCreate | kModify),
          E('a', "w/d/inner", kCreate | IN_ISDIR), E('a', "w/d/inner/g", kCreate | kModify)});
  std::ofstream("/tmp/w/d/inner/k") << "x";
  Expect(daemon, {E('a', "w/d/inner/k", kCreate), E('a', "w/d/inner/k", kModify)});

  // A directory moved away is no longer watched.
  ASSERT_EQ(rename("/tmp/w/d", "/tmp/d"), 0);
  for (const char* path : {"/tmp/d/inner/z", "/tmp/w/marker"}) std::ofstream(path) << "x";
  Expect(daemon, {E('a', "w/marker", kCreate), E('a', "w/marker", kModify)});

  // A queue registered now is served without a restart (the reload follows
  // the queue file's own inotify event), and the reload loses no event of
  // the unchanged tree.
  Register("c", "fc", MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR, "/tmp/w2", kCreate);
  std::ofstream("/tmp/w/during") << "x";
  ASSERT_TRUE(daemon.Logged("catalogue reloaded: watching 3 directories for 3 queues"));
  std::ofstream("/tmp/w2/p") << "x";
  Expect(daemon,
         {E('a', "w/during", kCreate), E('a', "w/during", kModify), E('c', "w2/p", kCreate)});

  EXPECT_EQ(daemon.Stop(), 0);
  EXPECT_EQ(daemon.Read(), "") << "a line after the last expected one";
}

}  // namespace
