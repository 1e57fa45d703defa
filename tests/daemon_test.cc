// End-to-end tests of the zorvnotifyd daemon, run in this program's sandbox
// over trees under /tmp with real inotify events.  Where the order of lines
// is fixed, each step compares the exact sequence, so a line that must not
// come shows up in place of one that must.

#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/fanotify.h>
#include <sys/inotify.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <json/json.h>

#include "monitor_queue.h"
#include "support/child_process.h"
#include "support/run_as.h"
#include "support/sandbox.h"

namespace {

using namespace ZORV::ZORVNOTIFYD;  // NOLINT
using Lines = std::vector<std::string>;

// Writes |text| to |path|; false on failure.
bool Put(const std::string& path, const std::string& text) {
  std::ofstream out(path);
  out << text;
  return static_cast<bool>(out.flush());
}

// |text| as JSON (null when it is not).
Json::Value ParseJson(const std::string& text) {
  Json::Value v;
  std::istringstream in(text);
  return Json::parseFromStream(Json::CharReaderBuilder(), in, &v, nullptr) ? v : Json::Value();
}

// In a directory of root's that only root may write, as a socket's must be.
constexpr const char* kSocket = "/tmp/zorvrun/zorvnotifyd.sock";

// The daemon as a child process, listening on |socket| (nullptr: its
// default).
class Daemon : public zorv_test::ChildProcess {
 public:
  explicit Daemon(Lines args = {"--json"}, const std::function<bool()>& in_child = nullptr,
                  const char* socket = kSocket)
      : ChildProcess(WithSocket(std::move(args), socket), in_child) {}
  // The next line of standard output ("" on a timeout or at the end),
  // leaving out the rescan records that come before the first other line:
  // every tree gets one at the first start on a fresh state directory
  // (ReportsWhatChangedWhileItWasStopped checks them).
  std::string Read() {
    for (;;) {
      std::string line = ChildProcess::Read();
      if (started_ || (line.find("\"rescan\":") == std::string::npos &&
                       line.find("]: RESCAN /") == std::string::npos)) {
        started_ = true;
        return line;
      }
    }
  }
  // True once a line of standard error holds |text|.
  bool Logged(const std::string& text) { return !WaitFor(text, true).empty(); }
  // True while the daemon's working directory is this test's: watches are
  // added through it, and a tree must stay free to unmount.
  bool AtHome() const {
    return std::filesystem::read_symlink("/proc/" + std::to_string(pid()) + "/cwd") ==
           std::filesystem::current_path();
  }
  // Reads JSON lines until one equal to |last|, each report as "queue type
  // file path mask" with its exact set of fields checked, "offline" aside ("queue lost" for a
  // lost notice, "queue rescan PATH" for a rescan record, a line that is not
  // a JSON object as it is); every line read, |last| included.  Stops early
  // (the result then lacks |last|) on a timeout.
  Lines ReadUntil(const std::string& last) {
    Lines lines;
    for (std::string text; (lines.empty() || lines.back() != last) && !(text = Read()).empty();) {
      Json::Value v = ParseJson(text);
      const std::string q = v.isObject() ? v["queue"].asString() : "";
      if (v.isObject()) v.removeMember("offline");  // what a tree held when it came back
      if (!v.isObject() || v.isMember("lost") || v.isMember("rescan")) {
        lines.push_back(q.empty()              ? text
                        : v.isMember("rescan") ? q + " rescan " + v["rescan"].asString()
                                               : q + " lost");
        continue;
      }
      EXPECT_EQ(v.getMemberNames(), Lines({"file", "mask", "path", "queue", "type"})) << text;
      lines.push_back(q + " " + v["type"].asString() + " " + v["file"].asString() + " " +
                      v["path"].asString() + " " + std::to_string(v["mask"].asUInt()));
    }
    return lines;
  }
  // True once a line equal to |line| came.
  bool Heard(const std::string& line) {
    const Lines lines = ReadUntil(line);
    return !lines.empty() && lines.back() == line;
  }
  // Reads lines as ReadUntil does up to the last of |expected|, and compares.
  void Expect(const Lines& expected) { EXPECT_EQ(ReadUntil(expected.back()), expected); }

 private:
  bool started_ = false;  // a line other than a rescan record came
  static Lines WithSocket(Lines args, const char* socket) {
    if (socket != nullptr) args.insert(args.begin(), {"--socket", socket});
    args.insert(args.begin(), ZORVNOTIFYD_PATH);
    return args;
  }
};

constexpr unsigned kCreate = IN_CREATE, kModify = IN_MODIFY, kDelete = IN_DELETE;

// The expected line of queue 'a', 'b' or 'c' of the first test for |path|
// below /tmp.
std::string E(char queue, const std::string& path, unsigned mask) {
  const char* id = queue == 'a' ? "a etc fa" : queue == 'b' ? "b share fb" : "c local-etc fc";
  return std::string(id) + " /tmp/" + path + " " + std::to_string(mask);
}

void Register(const char* name, const char* path, unsigned mask, const char* ignore = nullptr,
              const char* file = "f", _tag_monitor_queue_type_ type = MONITOR_QUEUE_TYPE_ETC_DIR) {
  Json::Value json;
  json["queue"] = name;
  json["config"][0]["path"] = path;
  json["config"][0]["mask"] = mask;
  if (ignore != nullptr) json["config"][0]["ignore"][0] = ignore;
  ASSERT_TRUE(MonitorQueue::Upsert(MonitorQueue(json), file, type));
}

// A datagram socket bound at |path| that hears what the daemon tells its
// service manager (NOTIFY_SOCKET).
class NotifySocket {
 public:
  explicit NotifySocket(const char* path) : fd_(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    struct sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    strncpy(address.sun_path, path, sizeof(address.sun_path) - 1);
    unlink(path);
    EXPECT_EQ(bind(fd_, reinterpret_cast<struct sockaddr*>(&address), sizeof(address)), 0);
  }
  ~NotifySocket() { close(fd_); }
  // The messages received until one equal to |last|, |last| included; the
  // result lacks |last| when nothing came for 10 s.
  Lines Until(const std::string& last) {
    Lines messages;
    while (messages.empty() || messages.back() != last) {
      struct pollfd p = {fd_, POLLIN, 0};
      char text[4096];
      ssize_t n = 0;
      if (poll(&p, 1, 10000) <= 0 || (n = recv(fd_, text, sizeof(text), 0)) < 0) break;
      messages.emplace_back(text, size_t(n));
    }
    return messages;
  }

 private:
  int fd_;
};

class DaemonTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ZORV_REQUIRE_SANDBOX();
    zorv_test::ResetStore();
  }
};

// Files are written with std::ofstream: IN_CREATE, then IN_MODIFY when the
// stream is flushed at its end, then IN_CLOSE_WRITE.
TEST_F(DaemonTest, ReportsToEachQueueExactlyItsEventsAndFollowsTheCatalogue) {
  ASSERT_EQ(std::system("rm -rf /tmp/w /tmp/w2 /tmp/d && mkdir -p /tmp/w/b /tmp/w2 /tmp/d/inner && "
                        "echo x >/tmp/d/f && echo x >/tmp/d/inner/g"),
            0);
  Register("a", "/tmp/w", kCreate | kModify | kDelete, "\\.tmp$", "fa");
  Register("b", "/tmp/w/b", IN_CLOSE_WRITE | kDelete, nullptr, "fb", MONITOR_QUEUE_TYPE_SHARE_DIR);
  // The service manager hears of readiness, reloads and the stop.
  NotifySocket manager("/tmp/notify.sock");
  Daemon daemon({"--json"}, [] { return setenv("NOTIFY_SOCKET", "/tmp/notify.sock", 1) == 0; });
  ASSERT_TRUE(daemon.Logged("ready: watching 2 directories"));
  EXPECT_TRUE(daemon.AtHome());
  const std::string ready = "READY=1\nSTATUS=watching 2 directories for 2 queues";
  EXPECT_EQ(manager.Until(ready), Lines({ready}));

  // Two masks on overlapping trees (queues in catalogue order: share
  // first); the ignored file never shows.
  for (const char* path : {"/tmp/w/f1", "/tmp/w/x.tmp", "/tmp/w/b/g"}) Put(path, "x");
  for (const char* path : {"/tmp/w/x.tmp", "/tmp/w/f1", "/tmp/w/b/g"}) unlink(path);
  daemon.Expect({E('a', "w/f1", kCreate), E('a', "w/f1", kModify), E('a', "w/b/g", kCreate),
                 E('a', "w/b/g", kModify), E('b', "w/b/g", IN_CLOSE_WRITE), E('a', "w/f1", kDelete),
                 E('b', "w/b/g", kDelete), E('a', "w/b/g", kDelete)});

  // A directory made while running is watched once reported.  One moved in
  // has its older content reported with the kinds the queue wants of
  // IN_CREATE|IN_MODIFY|IN_CLOSE_WRITE|IN_MOVED_TO, and is watched below.
  ASSERT_EQ(mkdir("/tmp/w/new", 0755), 0);
  daemon.Expect({E('a', "w/new", kCreate | IN_ISDIR)});
  Put("/tmp/w/new/h", "x");
  unlink("/tmp/w/new/h");
  rmdir("/tmp/w/new");
  ASSERT_EQ(rename("/tmp/d", "/tmp/w/d"), 0);
  daemon.Expect({E('a', "w/new/h", kCreate), E('a', "w/new/h", kModify), E('a', "w/new/h", kDelete),
                 E('a', "w/new", kDelete | IN_ISDIR), E('a', "w/d/f", kCreate | kModify),
                 E('a', "w/d/inner", kCreate | IN_ISDIR),
                 E('a', "w/d/inner/g", kCreate | kModify)});
  Put("/tmp/w/d/inner/k", "x");
  daemon.Expect({E('a', "w/d/inner/k", kCreate), E('a', "w/d/inner/k", kModify)});
  EXPECT_TRUE(daemon.AtHome());

  // A directory moved away is no longer watched.
  ASSERT_EQ(rename("/tmp/w/d", "/tmp/d"), 0);
  for (const char* path : {"/tmp/d/inner/z", "/tmp/w/marker"}) Put(path, "x");
  daemon.Expect({E('a', "w/marker", kCreate), E('a', "w/marker", kModify)});

  // A queue registered now is served without a restart (the reload follows
  // the queue file's own inotify event), and the reload loses no event of
  // the unchanged tree.
  Register("c", "/tmp/w2", kCreate, nullptr, "fc", MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR);
  Put("/tmp/w/during", "x");
  ASSERT_TRUE(daemon.Logged("catalogue reloaded: watching 3 directories for 3 queues"));
  const std::string reloaded = "READY=1\nSTATUS=watching 3 directories for 3 queues";
  const Lines told = manager.Until(reloaded);
  ASSERT_GE(told.size(), 2u);
  EXPECT_EQ(told[told.size() - 2], "RELOADING=1");
  EXPECT_EQ(told.back(), reloaded);
  Put("/tmp/w2/p", "x");
  daemon.Expect(
      {E('a', "w/during", kCreate), E('a', "w/during", kModify), E('c', "w2/p", kCreate)});

  // A queue file that turns malformed keeps serving its last good content
  // until it is valid again.
  ASSERT_TRUE(Put("/usr/local/etc/zorvnotifyd/fc", "[{\"queue\": \"c\", "));
  ASSERT_TRUE(daemon.Logged("queue file local-etc/fc cannot be loaded: not valid JSON"));
  Put("/tmp/w2/q", "x");
  daemon.Expect({E('c', "w2/q", kCreate)});
  ASSERT_TRUE(Put("/usr/local/etc/zorvnotifyd/fc",
                  "[{\"queue\": \"c\", \"config\": [{\"path\": \"/tmp/w2\", \"mask\": 256}]}]"));
  ASSERT_TRUE(daemon.Logged("queue file local-etc/fc loads again: 1 queues"));
  // A queue file others can write is refused whole: its queue gets nothing.
  ASSERT_EQ(std::system("cd /usr/local/etc/zorvnotifyd && sed s/'\"c\"'/'\"p\"'/ fc >.fp && "
                        "chmod 666 .fp && mv .fp fp"),
            0);
  ASSERT_TRUE(
      daemon.Logged("queue file /usr/local/etc/zorvnotifyd/fp is refused: it is writable "
                    "by group or others"));
  Put("/tmp/w2/r", "x");
  daemon.Expect({E('c', "w2/r", kCreate)});

  // SIGHUP reloads, as the service manager's reload asks; it never ends the
  // daemon.
  ASSERT_EQ(kill(daemon.pid(), SIGHUP), 0);
  ASSERT_TRUE(daemon.Logged("reloading the catalogue on SIGHUP"));
  ASSERT_TRUE(daemon.Logged("catalogue reloaded: watching 3 directories for 3 queues"));

  EXPECT_EQ(daemon.Stop(SIGTERM), 0);
  EXPECT_EQ(daemon.Read(), "") << "a line after the last expected one";
  const Lines stopping = manager.Until("STOPPING=1");
  EXPECT_TRUE(!stopping.empty() && stopping.back() == "STOPPING=1");
}

// Symbolic links and bind mounts to a watched directory, paths the watcher
// cannot honour, links inside a tree, forged lines, and directory moves.  The
// daemon sees a read-only /usr holding only the etc configuration directory:
// it serves the queues that exist and says which directories it cannot
// have, and which file looks like a backup; a directory made later (here,
// where /usr is writable) is read at the next tick.
TEST_F(DaemonTest, ServesEveryPathOfADirectoryAndNothingItCannotHonour) {
  ASSERT_EQ(std::system("umount /tmp/bind 2>/dev/null; rm -rf /tmp/w /tmp/bind /tmp/link "
                        "/tmp/secret /tmp/d && mkdir /tmp/w /tmp/bind /tmp/secret /tmp/d && "
                        "echo x >/tmp/d/g"),
            0);
  ASSERT_EQ(symlink("/tmp/w", "/tmp/link"), 0);
  ASSERT_EQ(symlink("/tmp/secret", "/tmp/w/lnk"), 0);
  ASSERT_EQ(mount("/tmp/w", "/tmp/bind", nullptr, MS_BIND, nullptr), 0);
  const unsigned mask = IN_CREATE | IN_MOVED_FROM | IN_MOVED_TO | IN_ATTRIB;
  for (const char* path : {"/tmp/w", "/tmp/link", "/tmp/bind"}) Register(path + 5, path, mask);
  // The daemon shares zorvnotifyctl's path check, whose every reason the tool's
  // test goes through; one path shows that the daemon skips on it.
  Register("slash", "/tmp/w/", mask);
  Register("unmount", "/tmp/w", IN_UNMOUNT);
  ASSERT_TRUE(Put("/usr/zorv/etc/zorvnotifyd/f.bak", "[]"));
  Daemon daemon({"--stdout", "--retry", "0.1"}, zorv_test::PrivateReadOnlyUsr);
  for (const char* line :
       {"the configuration directory /usr/zorv/share/zorvnotifyd is missing",
        "queue file etc/f.bak looks like a backup copy, and is loaded like any queue file: remove "
        "it or move it out of the directory",
        "skipping configuration \"/tmp/w/\" of queue \"slash\" (etc/f): it ends in \"/\", which no "
        "reported path can match; write it as \"/tmp/w\"",
        "skipping configuration \"/tmp/w\" of queue \"unmount\" (etc/f): its mask 0x2000 holds no "
        "event kind",
        "ready: watching 1 directories for 5 queues"}) {
    ASSERT_TRUE(daemon.Logged(line)) << line;
  }

  // Each queue hears of every event under its own path; nothing through
  // the link inside the tree; a newline in a name cannot forge a line.
  ASSERT_TRUE(Put("/tmp/secret/s", "x"));
  ASSERT_TRUE(Put("/tmp/w/x\nqueue w: IN_CREATE forged", "x"));
  ASSERT_EQ(rename("/tmp/d", "/tmp/w/d"), 0);
  // Each line three times, under the three paths in their order.
  auto expect = [&daemon](const Lines& what) {
    Lines expected, got;
    for (const std::string& line : what) {
      const size_t blank = line.find(' ');
      for (const std::string queue : {"bind", "link", "w"}) {
        expected.push_back("queue " + queue + " [etc/f]: " + line.substr(0, blank) + " /tmp/" +
                           queue + line.substr(blank + 1));
        got.push_back(daemon.Read());
      }
    }
    EXPECT_EQ(got, expected);
  };
  expect({"IN_CREATE /x\\x0Aqueue w: IN_CREATE forged", "IN_MOVED_TO|IN_ISDIR /d",
          "IN_MOVED_TO|IN_CREATE /d/g"});
  // A move within the trees: the two halves, nothing for what it holds.
  ASSERT_EQ(rename("/tmp/w/d", "/tmp/w/e"), 0);
  ASSERT_TRUE(Put("/tmp/w/e/h", "x"));
  // An event on a watched directory reaches its parent's watch and its
  // own: it is reported once.
  ASSERT_EQ(chmod("/tmp/w/e", 0700), 0);
  expect({"IN_MOVED_FROM|IN_ISDIR /d", "IN_MOVED_TO|IN_ISDIR /e", "IN_CREATE /e/h",
          "IN_ATTRIB|IN_ISDIR /e"});
  // Under one path, queues in catalogue order: share before etc.
  Register("late", "/tmp/w", IN_CREATE, nullptr, "g", MONITOR_QUEUE_TYPE_SHARE_DIR);
  ASSERT_TRUE(daemon.Logged("catalogue reloaded: watching 2 directories for 6 queues"));
  ASSERT_TRUE(Put("/tmp/w/y", "y"));
  EXPECT_EQ(
      Lines({daemon.Read(), daemon.Read(), daemon.Read(), daemon.Read()}),
      Lines({"queue bind [etc/f]: IN_CREATE /tmp/bind/y",
             "queue link [etc/f]: IN_CREATE /tmp/link/y",
             "queue late [share/g]: IN_CREATE /tmp/w/y", "queue w [etc/f]: IN_CREATE /tmp/w/y"}));
  EXPECT_EQ(daemon.Stop(SIGTERM), 0);
  EXPECT_EQ(daemon.Read(), "") << "a line after the last expected one";
  umount2("/tmp/bind", MNT_DETACH);
}

// A tree missing at start, deleted and made again, moved away and back,
// and a file system mounted on it and unmounted: each is watched again
// without a reload, and what it holds when it appears is reported.  Then
// every file written at once in a directory made by mkdir -p, several
// levels deep, reaches both a queue that wants IN_CREATE and one that wants
// only IN_CLOSE_WRITE, with both cores busy.
TEST_F(DaemonTest, WatchesTreesAgainAndHearsOfEveryFileInNewDirectories) {
  ASSERT_EQ(std::system("umount /tmp/r 2>/dev/null; rm -rf /tmp/r /tmp/r.old /tmp/late /tmp/t && "
                        "mkdir /tmp/r /tmp/t"),
            0);
  Register("r", "/tmp/r", kCreate);
  Register("late", "/tmp/late", kCreate);
  Register("create", "/tmp/t", IN_CREATE);
  Register("close", "/tmp/t", IN_CLOSE_WRITE);
  Daemon daemon({"--json", "--retry", "0.05"});
  ASSERT_TRUE(
      daemon.Logged("not watching tree \"/tmp/late\": No such file or directory; looking "
                    "for it again every 0.05 s"));
  ASSERT_EQ(std::system("mkdir /tmp/late && echo x >/tmp/late/a"), 0);
  EXPECT_TRUE(daemon.Heard("late etc f /tmp/late/a 256"));
  ASSERT_EQ(std::system("rm -r /tmp/r && mkdir /tmp/r && echo x > /tmp/r/b"), 0);
  EXPECT_TRUE(daemon.Logged("not watching tree \"/tmp/r\": it was deleted;"));
  EXPECT_TRUE(daemon.Heard("r etc f /tmp/r/b 256"));

  // Nothing done to the tree while it is away reaches the queue under its
  // path; what it holds when it is back does.
  ASSERT_EQ(rename("/tmp/r", "/tmp/r.old"), 0);
  EXPECT_TRUE(daemon.Logged("not watching tree \"/tmp/r\": it was moved away;"));
  ASSERT_TRUE(Put("/tmp/r.old/x", "x") && Put("/tmp/late/marker", "x"));
  EXPECT_EQ(daemon.ReadUntil("late etc f /tmp/late/marker 256"),
            Lines({"late etc f /tmp/late/marker 256"}));
  ASSERT_EQ(rename("/tmp/r.old", "/tmp/r"), 0);
  EXPECT_TRUE(daemon.Logged("watching tree \"/tmp/r\" again"));
  EXPECT_TRUE(daemon.Heard("r etc f /tmp/r/x 256"));

  ASSERT_EQ(mount("zorv-test", "/tmp/r", "tmpfs", 0, "mode=0755"), 0);
  EXPECT_TRUE(daemon.Logged("tree \"/tmp/r\" is another directory now"));
  ASSERT_TRUE(Put("/tmp/r/m", "x"));
  EXPECT_TRUE(daemon.Heard("r etc f /tmp/r/m 256"));
  ASSERT_EQ(umount("/tmp/r"), 0);
  EXPECT_TRUE(daemon.Logged("not watching tree \"/tmp/r\": it was unmounted;"));
  EXPECT_TRUE(daemon.Logged("watching tree \"/tmp/r\" again"));
  ASSERT_TRUE(Put("/tmp/r/u", "x"));
  EXPECT_TRUE(daemon.Heard("r etc f /tmp/r/u 256"));

  constexpr int kFiles = 2000;
  {
    const Lines spin = {"/bin/sh", "-c", "while :; do :; done"};
    const zorv_test::ChildProcess busy1(spin), busy2(spin);  // killed at the end of the block
    for (int i = 0; i < kFiles; ++i) {
      std::string dir = "/tmp/t/" + std::to_string(i);
      for (const char* level : {"", "/a", "/b"}) ASSERT_EQ(mkdir((dir += level).c_str(), 0755), 0);
      ASSERT_TRUE(Put(dir + "/file", "x"));
    }
  }
  ASSERT_TRUE(Put("/tmp/t/end", "x"));
  std::map<std::string, std::set<std::string>> heard;
  for (const std::string& line : daemon.ReadUntil("close etc f /tmp/t/end 8")) {
    const std::string queue = line.substr(0, line.find(' '));
    const unsigned mask = std::stoul(line.substr(line.rfind(' ') + 1));
    if (line.find("/file ") != std::string::npos &&
        (mask & (queue == "close" ? IN_CLOSE_WRITE : IN_CREATE)) != 0) {
      heard[queue].insert(line.substr(0, line.rfind(' ')));
    }
  }
  EXPECT_EQ(heard["create"].size(), size_t(kFiles));
  EXPECT_EQ(heard["close"].size(), size_t(kFiles));
  EXPECT_EQ(daemon.Stop(SIGTERM), 0);
}

constexpr const char* kWatchLimit = "/proc/sys/user/max_inotify_watches";

// In a user namespace of its own the daemon has a watch limit of its own:
// max_inotify_watches there leaves the machine's settings alone.
bool EnterUserNamespace() {
  return unshare(CLONE_NEWUSER) == 0 && Put("/proc/self/setgroups", "deny") &&
         Put("/proc/self/uid_map", "0 0 1") && Put("/proc/self/gid_map", "0 0 1");
}

TEST_F(DaemonTest, ServesWhatFitsUnderTheWatchLimitAndSaysWhenEventsWereLost) {
  if (zorv_test::ChildProcess({"/bin/true"}, EnterUserNamespace).Stop(0) != 0) {
    GTEST_SKIP() << "no user namespaces here: the watch limit cannot be set apart";
  }
  ASSERT_EQ(std::system("rm -rf /tmp/big && mkdir -p /tmp/big/0/1/2 /tmp/big/3/4/5/6 "
                        "/tmp/big/7/8/9 /tmp/big/10 /tmp/big/11 /tmp/big/12/13"),
            0);
  Register("big", "/tmp/big", kCreate);
  // 10 watches: 3 for the configuration directories, 7 of the 15 of the tree.
  Daemon daemon({"--json", "--retry", "0.05"},
                [] { return EnterUserNamespace() && Put(kWatchLimit, "10"); });
  ASSERT_TRUE(
      daemon.Logged("cannot watch 8 of 15 directories of tree \"/tmp/big\": inotify "
                    "watch limit reached (raise fs.inotify.max_user_watches); trying "
                    "again every 0.05 s"));
  ASSERT_TRUE(daemon.Logged("ready: watching 7 directories for 1 queues"));
  ASSERT_TRUE(Put("/tmp/big/f", "x"));
  EXPECT_EQ(daemon.ReadUntil("big etc f /tmp/big/f 256"), Lines({"big etc f /tmp/big/f 256"}));

  // The watch limit of the daemon's user namespace, set from a process there.
  const std::string ns = "/proc/" + std::to_string(daemon.pid()) + "/ns/user";
  const auto raise = [&ns] {
    const int fd = open(ns.c_str(), O_RDONLY);
    return fd >= 0 && setns(fd, CLONE_NEWUSER) == 0 && Put(kWatchLimit, "100");
  };
  ASSERT_EQ(zorv_test::ChildProcess({"/bin/true"}, raise).Stop(0), 0);
  ASSERT_TRUE(daemon.Logged("all 15 directories of tree \"/tmp/big\" are watched now"));
  ASSERT_EQ(std::system("cd /tmp/big && for d in 0/1/2 3/4/5/6 7/8/9 10 11 12/13; do "
                        "touch $d/g; done"),
            0);
  EXPECT_EQ(daemon.ReadUntil("big etc f /tmp/big/12/13/g 256"),
            Lines({"big rescan /tmp/big/12/13", "big rescan /tmp/big/3", "big rescan /tmp/big/7",
                   "big etc f /tmp/big/0/1/2/g 256", "big etc f /tmp/big/3/4/5/6/g 256",
                   "big etc f /tmp/big/7/8/9/g 256", "big etc f /tmp/big/10/g 256",
                   "big etc f /tmp/big/11/g 256", "big etc f /tmp/big/12/13/g 256"}));

  // More events than the kernel queues while the daemon is stopped.
  std::ifstream max_file("/proc/sys/fs/inotify/max_queued_events");
  int max_queued = 0;
  if (!(max_file >> max_queued) || max_queued > 200000) return;
  ASSERT_EQ(kill(daemon.pid(), SIGSTOP), 0);
  for (int i = 0; i <= max_queued; ++i) {
    close(open(("/tmp/big/10/n" + std::to_string(i)).c_str(), O_CREAT | O_WRONLY, 0644));
  }
  ASSERT_EQ(kill(daemon.pid(), SIGCONT), 0);
  // The queue is told which tree to rescan, in place of a bare "lost".
  EXPECT_TRUE(daemon.Heard("big rescan /tmp/big"));
  EXPECT_TRUE(daemon.Logged("inotify event queue overflowed, events were lost"));
  ASSERT_TRUE(Put("/tmp/big/10/after", "x"));
  EXPECT_TRUE(daemon.Heard("big etc f /tmp/big/10/after 256"));
  EXPECT_EQ(daemon.Stop(SIGTERM), 0);
}

// A client of the daemon's socket.
class Client {
 public:
  // Connects to the default socket; a failure shows in the first Send or
  // Next.
  Client() : fd_(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    struct sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    strcpy(address.sun_path, kSocket);
    connect(fd_, reinterpret_cast<struct sockaddr*>(&address), sizeof(address));
  }
  ~Client() { close(fd_); }
  // Shuts the sending side: the daemon must still send.
  void Shut() { shutdown(fd_, SHUT_WR); }
  bool Send(const std::string& line) {
    const std::string text = line + "\n";
    return write(fd_, text.data(), text.size()) == ssize_t(text.size());
  }
  // The next line, a JSON object (null after 10 s or at the end).
  Json::Value Next() {
    std::string line;
    if (!zorv_test::ReadLine(fd_, buffer_, &line)) return {};
    const Json::Value v = ParseJson(line);
    EXPECT_TRUE(v.isObject()) << line;
    return v;
  }
  // The next line as "queue seq path" ("queue seq KEY" for a notice,
  // "queue seq rescan PATH", "queue missed N"), "" when none came; a
  // path's base64 form follows as " b64:B64" when the line has one.  With
  // |record|, "seq path mask" without the queue, " offline" after it for a
  // change made while the daemon was stopped.
  std::string Line(bool record = false) {
    const Json::Value v = Next();
    if (!v.isObject()) return "";
    std::string line = record ? "" : v["queue"].asString() + " ";
    if (v.isMember("missed")) return line + "missed " + std::to_string(v["missed"].asUInt64());
    line += std::to_string(v["seq"].asUInt64());
    for (const char* notice : {"lost", "removed", "registered"}) {
      if (v.isMember(notice)) return line + " " + notice;
    }
    if (v.isMember("rescan")) return line + " rescan " + v["rescan"].asString();
    line += " " + v["path"].asString();
    if (record)
      line += " " + std::to_string(v["mask"].asUInt()) + (v["offline"].asBool() ? " offline" : "");
    return v.isMember("path_b64") ? line + " b64:" + v["path_b64"].asString() : line;
  }

 private:
  int fd_;
  std::string buffer_;
};

// Subscribes |client| to |queue| (with "since" when |since| >= 0) and
// returns the reply.
Json::Value Subscribe(Client& client, const std::string& queue, long since = -1) {
  std::string request = "{\"request\":\"subscribe\",\"queue\":\"" + queue + "\"";
  if (since >= 0) request += ",\"since\":" + std::to_string(since);
  EXPECT_TRUE(client.Send(request + "}"));
  return client.Next();
}

// The status reply of the daemon on the default socket.
Json::Value Status() {
  Client client;
  EXPECT_TRUE(client.Send("{\"request\":\"status\"}"));
  return client.Next();
}

// Clients on two queues, one that never reads, one that comes back, one
// that may not connect, and a queue that goes and comes back; the socket
// file removed or replaced while the daemon runs.
TEST_F(DaemonTest, DeliversEachQueueItsEventsToItsSubscribers) {
  ASSERT_EQ(std::system("rm -rf /tmp/s && mkdir -p /tmp/s/a /tmp/s/b"), 0);
  Register("a", "/tmp/s/a", kCreate);
  Register("b", "/tmp/s/b", kCreate);
  // Each event read as it comes (the other tests wait the default window).
  Daemon daemon({"--keep", "5", "--client-buffer", "1024", "--journal-size", "65536", "--coalesce",
                 "0", "--retry", "0.05"});
  EXPECT_TRUE(daemon.Logged("made the state directory \"/var/lib/zorvnotifyd\""));
  ASSERT_TRUE(daemon.Logged("ready: watching 2 directories for 2 queues"));
  Client b, sleeper;
  Client* a = new Client;
  const Json::Value reply = Subscribe(*a, "a");
  EXPECT_EQ(reply["reply"], "subscribe");
  EXPECT_EQ(reply["run"].asString().size(), 32u);
  EXPECT_EQ(reply["queues"].size(), 1u);
  EXPECT_EQ(Subscribe(b, "b")["run"], reply["run"]);
  b.Shut();  // b only listens from now on
  Subscribe(sleeper, "a");

  // Each client exactly its queue's events, in order, after the rescan
  // record of the first start.
  for (int i = 1; i <= 20; ++i) ASSERT_TRUE(Put("/tmp/s/a/" + std::to_string(i), "x"));
  for (int i = 1; i <= 20; ++i)
    EXPECT_EQ(a->Line(), "a " + std::to_string(i + 1) + " /tmp/s/a/" + std::to_string(i));
  delete a;

  // A client that never reads delays nobody: more than its socket and
  // buffer hold, then the other queue's event reaches its client.
  constexpr int kFiles = 3000;
  const std::string name = "/tmp/s/a/" + std::string(200, 'n');
  for (int i = 21; i <= kFiles; ++i) ASSERT_TRUE(Put(name + std::to_string(i), "x"));
  ASSERT_TRUE(Put("/tmp/s/b/x", "x"));
  EXPECT_EQ(b.Line(), "b 2 /tmp/s/b/x");
  // What the sleeper's buffer could not hold, nor the journal, is counted.
  std::string line;
  for (int i = 0; i <= kFiles && (line = sleeper.Line()).find("missed") == std::string::npos;) ++i;
  EXPECT_EQ(line.find("a missed "), 0u) << line;

  // Back with "since": the 5 records before those in memory from the
  // journal, then those in memory.
  const auto resume = [&name](Client& client) {
    Subscribe(client, "a", kFiles - 10);
    for (int seq = kFiles - 9; seq <= kFiles + 1; ++seq) {
      EXPECT_EQ(client.Line(), "a " + std::to_string(seq) + " " + name + std::to_string(seq - 1));
    }
  };
  Client again;
  resume(again);

  // A queue removed and registered again, on the same connection.
  ASSERT_TRUE(MonitorQueue::Delete("b", "f", MONITOR_QUEUE_TYPE_ETC_DIR));
  EXPECT_EQ(b.Line(), "b 3 removed");
  Register("b", "/tmp/s/b", kCreate);
  EXPECT_EQ(b.Line(), "b 4 registered");
  ASSERT_TRUE(Put("/tmp/s/b/y", "x"));
  EXPECT_EQ(b.Line(), "b 5 /tmp/s/b/y");  // UTF-8: no base64 beside it
  ASSERT_TRUE(Put("/tmp/s/b/caf\xe9", "x"));
  line = b.Line();  // a name that is not UTF-8 comes with its exact bytes
  EXPECT_EQ(line.substr(line.find(" b64:") + 1), "b64:L3RtcC9zL2IvY2Fm6Q==") << line;

  // Root only: by the socket's mode, and by the peer's credentials should
  // the mode be opened up.
  struct stat st;
  ASSERT_EQ(stat(kSocket, &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  ASSERT_EQ(chmod(kSocket, 0666), 0);
  const zorv_test::ChildResult refused =
      zorv_test::RunAs({65534, 65534, 65534, 65534, 65534, 65534}, [] {
        Client stranger;
        const Json::Value v = stranger.Next();
        return v["error"].asString().find("permission denied") == 0;
      });
  EXPECT_TRUE(refused.exited && refused.result == 1) << refused.error;

  const Json::Value v = Status();
  EXPECT_EQ(std::vector<Json::Value>({v["queues"], v["clients"], v["directories"]}),
            std::vector<Json::Value>({2, 4, 2}));

  // The socket file removed: a new one, which new clients reach, and the
  // old clients are still served.
  const std::string replaced =
      "the socket file \"/tmp/zorvrun/zorvnotifyd.sock\" was removed or replaced";
  ASSERT_EQ(unlink(kSocket), 0);
  ASSERT_TRUE(daemon.Logged(replaced + ": listening on a new one"));
  Client after;
  Subscribe(after, "b");
  ASSERT_TRUE(Put("/tmp/s/b/z", "x"));
  EXPECT_EQ(b.Line(), "b 7 /tmp/s/b/z");
  EXPECT_EQ(after.Line(), "b 7 /tmp/s/b/z");
  // Another daemon's live socket in its place is never taken, nor removed
  // when this daemon stops; once it is stale, it is replaced.
  const std::string taken = replaced + ", and a new one cannot be made: another daemon listens";
  constexpr const char* kOther = "/tmp/zorvrun/other.sock";
  {
    const zorv_test::ScriptedServer other(kOther, 0, {});
    ASSERT_EQ(rename(kOther, kSocket), 0);
    ASSERT_TRUE(daemon.Logged(taken));
  }
  ASSERT_TRUE(daemon.Logged(replaced + ": listening on a new one"));
  {
    const zorv_test::ScriptedServer other(kOther, 0, {});
    ASSERT_EQ(rename(kOther, kSocket), 0);
    ASSERT_TRUE(daemon.Logged(taken));
    struct stat planted, left;
    ASSERT_EQ(lstat(kSocket, &planted), 0);
    EXPECT_EQ(daemon.Stop(SIGTERM), 0);
    ASSERT_EQ(lstat(kSocket, &left), 0);
    EXPECT_EQ(left.st_ino, planted.st_ino);
  }

  // Started again, with nothing in memory and the other daemon gone: the
  // same records from the journal's files, which took turns many times,
  // then new ones.
  Daemon restarted({"--keep", "5", "--journal-size", "65536"});
  ASSERT_TRUE(restarted.Logged("ready:"));
  Client back;
  resume(back);
  ASSERT_TRUE(Put("/tmp/s/a/last", "x"));
  EXPECT_EQ(back.Line(), "a " + std::to_string(kFiles + 2) + " /tmp/s/a/last");
  EXPECT_EQ(restarted.Stop(SIGTERM), 0);
}

// The CPU time of process |pid| so far, in clock ticks (-1 when unknown).
long CpuTicks(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
  std::string text, field;
  std::getline(in, text);
  std::istringstream fields(text.substr(text.rfind(')') + 1));
  for (int i = 3; i < 14; ++i) fields >> field;  // state to cmajflt
  long user = 0, system = 0;
  return fields >> user >> system ? user + system : -1;
}

// Clients that nest a request deeper than a parser's stack, hold ever more
// subscriptions, or come in greater numbers than the descriptor limit
// allows: each is refused with an error line, and the daemon goes on
// serving, watching new directories, and waiting without spinning.
TEST_F(DaemonTest, OutlivesHostileClients) {
  ASSERT_EQ(std::system("rm -rf /tmp/h /tmp/deep && mkdir /tmp/h"), 0);
  Register("h", "/tmp/h", kCreate);
  // 160 descriptors leave room for 32 clients besides the daemon's reserve.
  constexpr size_t kCap = 32;
  Daemon daemon({"--max-clients", "100"}, [] {
    const struct rlimit limit = {160, 160};
    return setrlimit(RLIMIT_NOFILE, &limit) == 0;
  });
  EXPECT_TRUE(daemon.Logged("the descriptor limit (160) leaves room for 32 clients"));
  ASSERT_TRUE(daemon.Logged("ready: watching 1 directories"));
  Client subscriber;
  EXPECT_EQ(Subscribe(subscriber, "h")["reply"], "subscribe");

  // Nested far deeper than a request needs: refused, and the connection
  // still answers.
  Client nested;
  ASSERT_TRUE(nested.Send(std::string(1001, '[') + std::string(1001, ']')));
  ASSERT_EQ(nested.Next()["error"], "a request is one JSON object on one line");
  ASSERT_TRUE(nested.Send("{\"request\":\"status\",\"x\":[[[[[[[[[[[[[[[[[[[]]]]]]]]]]]]]]]]]]]}"));
  EXPECT_EQ(nested.Next()["error"], "a request is one JSON object on one line");
  ASSERT_TRUE(nested.Send("{\"request\":\"status\"}"));
  const Json::Value status = nested.Next();
  EXPECT_EQ(status["reply"], "status");
  EXPECT_EQ(status["max_clients"].asUInt64(), kCap);

  // At most 1024 subscriptions (the same one again counts once) and 1 MiB
  // of names: those held go on, and the connection answers.
  Client many, big;
  EXPECT_EQ(Subscribe(many, "h")["reply"], "subscribe");
  for (int i = 1; i < 1024; ++i) {
    ASSERT_EQ(Subscribe(many, "s" + std::to_string(i))["reply"], "subscribe") << i;
  }
  EXPECT_EQ(Subscribe(many, "s1024")["error"],
            "a client may hold at most 1024 subscriptions and 1048576 bytes of names");
  EXPECT_EQ(Subscribe(many, "h")["reply"], "subscribe");
  const std::string name(60 * 1024, 'n');
  for (int i = 0; i < 17; ++i) {
    ASSERT_EQ(Subscribe(big, name + std::to_string(i))["reply"], "subscribe") << i;
  }
  EXPECT_EQ(Subscribe(big, name + "17")["error"],
            "a client may hold at most 1024 subscriptions and 1048576 bytes of names");
  EXPECT_EQ(Subscribe(big, name + "0")["reply"], "subscribe");

  // Idle clients up to the cap, then more than the descriptors allow.
  std::vector<Client> idle(kCap - 4), beyond(150);
  // A directory made now is watched, and the daemon waits without spinning.
  ASSERT_EQ(mkdir("/tmp/h/new", 0755), 0);
  ASSERT_TRUE(Put("/tmp/h/new/f", "x"));
  EXPECT_EQ(subscriber.Line(), "h 2 /tmp/h/new");  // after the first start's rescan
  EXPECT_EQ(subscriber.Line(), "h 3 /tmp/h/new/f");
  EXPECT_EQ(many.Line(), "h 2 /tmp/h/new");
  const long before = CpuTicks(daemon.pid());
  usleep(1000 * 1000);
  EXPECT_LT(CpuTicks(daemon.pid()) - before, sysconf(_SC_CLK_TCK) / 4);
  for (Client& client : beyond) {
    const Json::Value refusal = client.Next();
    ASSERT_EQ(refusal["error"],
              "too many clients: the daemon serves at most 32 at once; try again later");
    EXPECT_EQ(client.Next(), Json::Value()) << "not closed";
  }
  EXPECT_TRUE(daemon.Logged("at the client limit"));
  // A tree deeper than the reserve lets a walk go, moved in at the cap:
  // what the walk cannot open is said, not silently left unwatched.
  std::string deep = "/tmp/deep";
  for (int i = 0; i < 150; ++i) deep += "/d";
  ASSERT_TRUE(std::filesystem::create_directories(deep));
  ASSERT_EQ(rename("/tmp/deep", "/tmp/h/deep"), 0);
  EXPECT_TRUE(daemon.Logged("to watch it and the directories below it: Too many open files"));
  idle.clear();
  beyond.clear();
  EXPECT_TRUE(daemon.Logged("accepting clients again: 150 were refused at the client limit"));
  EXPECT_EQ(Status()["reply"], "status");
  EXPECT_EQ(daemon.Stop(SIGTERM), 0);
}

// In a mount namespace of its own, a fresh tmpfs mounted with |options| on
// |path|; the host's stays as it is.  For a pre-exec hook.
std::function<bool()> PrivateTmpfs(const char* path, const char* options) {
  return [=] {
    return unshare(CLONE_NEWNS) == 0 &&
           mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
           mount("zorv-test", path, "tmpfs", 0, options) == 0;
  };
}

// A socket directory or a state directory that others may write, and the
// default runtime directory missing, as when the daemon is started by hand.
TEST_F(DaemonTest, ListensOnItsOwnSocketInARootOnlyDirectory) {
  // A directory anyone may write, or one that is not root's, would let a
  // user block the start or serve a socket of their own.
  ASSERT_EQ(std::system("mkdir -m 1777 /tmp/open && mkdir /tmp/theirs /tmp/good && "
                        "chown 65534 /tmp/theirs && ln -s /tmp/good /tmp/state-link"),
            0);
  for (const std::string dir : {"/tmp/open", "/tmp/theirs"}) {
    Daemon refused({}, nullptr, (dir + "/zorvnotifyd.sock").c_str());
    EXPECT_TRUE(refused.Logged("its directory \"" + dir + "\" is owned by uid " +
                               (dir == "/tmp/open" ? "0 with mode 1777" : "65534 with mode 0755") +
                               "; it must be root's and writable by root alone"));
    EXPECT_EQ(refused.Stop(0), 1);
    EXPECT_NE(access((dir + "/zorvnotifyd.sock").c_str(), F_OK), 0);
  }
  // So would a root-only directory in one of theirs, which they may swap.
  {
    ASSERT_EQ(mkdir("/tmp/theirs/sub", 0755), 0);
    Daemon refused({}, nullptr, "/tmp/theirs/sub/zorvnotifyd.sock");
    EXPECT_TRUE(refused.Logged("its directory /tmp/theirs belongs to uid 65534"));
    EXPECT_EQ(refused.Stop(0), 1);
  }
  // So would a state directory: refused too, and so is a link to a good one.
  for (const std::string dir : {"/tmp/open", "/tmp/theirs", "/tmp/state-link"}) {
    Daemon refused({"--state-dir", dir});
    EXPECT_TRUE(refused.Logged(
        "cannot use the state directory: \"" + dir +
        (dir == "/tmp/open"     ? "\" is owned by uid 0 with mode 1777; it must be root's"
         : dir == "/tmp/theirs" ? "\" is owned by uid 65534 with mode 0755; it must be root's"
                                : "\" cannot be used: it is not a directory (a link is not "
                                  "followed)")));
    EXPECT_EQ(refused.Stop(0), 1);
  }

  // Started by hand, without the runtime directory its service makes: the
  // daemon makes it.  Of 23 trees' watchers, 20 are logged, then a count.
  for (int i = 0; i < 23; ++i) {
    const std::string name = "t" + std::to_string(i);
    Register(name.c_str(), ("/tmp/" + name).c_str(), IN_CREATE);
  }
  Daemon by_hand({}, PrivateTmpfs("/run", "mode=0755"), nullptr);
  EXPECT_TRUE(by_hand.Logged("made the socket's directory \"/run/zorvnotifyd\""));
  ASSERT_TRUE(by_hand.Logged("ready:"));
  EXPECT_TRUE(by_hand.Logged("tree \"/tmp/t6\" is served by inotify: "));  // the 20th by name
  EXPECT_TRUE(by_hand.Logged("and 3 trees more, as the status reply lists"));
  const std::string run = "/proc/" + std::to_string(by_hand.pid()) + "/root/run/zorvnotifyd";
  struct stat st;
  ASSERT_EQ(lstat(run.c_str(), &st), 0);
  EXPECT_TRUE(S_ISDIR(st.st_mode) && st.st_uid == 0 && (st.st_mode & 07777) == 0755)
      << std::oct << st.st_mode;
  ASSERT_EQ(lstat((run + "/zorvnotifyd.sock").c_str(), &st), 0);
  EXPECT_TRUE(S_ISSOCK(st.st_mode));
  // And its state directory, which it made, root's alone.
  ASSERT_EQ(lstat("/var/lib/zorvnotifyd", &st), 0);
  EXPECT_TRUE(S_ISDIR(st.st_mode) && st.st_uid == 0 && (st.st_mode & 07777) == 0700)
      << std::oct << st.st_mode;
  EXPECT_EQ(by_hand.Stop(SIGTERM), 0);
}

// What is done to a tree while the daemon is stopped (cleanly, or killed)
// reaches a client that resumes with "since" once, as offline records
// numbered after its last one, under the same journal id; a snapshot that
// cannot be trusted gives a rescan record instead.
TEST_F(DaemonTest, ReportsWhatChangedWhileItWasStopped) {
  ASSERT_EQ(std::system("rm -rf /tmp/o && mkdir -p /tmp/o/d /tmp/o/d2/inner /tmp/o/gone && "
                        "cd /tmp/o && touch del f mv same gone/x"),
            0);
  constexpr unsigned kAll =
      IN_CREATE | IN_MODIFY | IN_CLOSE_WRITE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO;
  Register("o", "/tmp/o", kAll);
  // Each run: the records after |seq| until one holding |last|, |seq|
  // moved to the last one; |log| is a line the daemon must log after "ready";
  // with |out| the daemon is left running there.
  std::string journal;
  int seq = 0;
  auto run = [&journal, &seq](const std::string& last, const std::string& log = "",
                              std::unique_ptr<Daemon>* out = nullptr) {
    // Marked directories listed at every group sync (default: every second).
    auto daemon = std::make_unique<Daemon>(Lines{"--retry", "0.05", "--snapshot-interval", "100"});
    // Ready once the watches are in place: the comparison comes after.
    EXPECT_TRUE(daemon->Logged("ready: watching"));
    EXPECT_TRUE(log.empty() || daemon->Logged(log)) << log;
    Client client;
    const std::string id = Subscribe(client, "o", seq)["journal"].asString();
    EXPECT_EQ(id, journal.empty() ? id : journal);
    journal = id;
    Lines got;
    do {
      got.push_back(client.Line(true));
    } while (!got.back().empty() && got.back().find(last) == std::string::npos);
    seq = std::atoi(got.back().c_str());
    if (out != nullptr) {
      *out = std::move(daemon);
    } else {
      EXPECT_EQ(daemon->Stop(SIGTERM), 0);
    }
    return got;
  };
  // No saved view at the first start: the whole tree to rescan.
  EXPECT_EQ(run("1 rescan /tmp/o"), Lines({"1 rescan /tmp/o"}));

  // Every kind of change, in the walk's order, a move told where its
  // first half is met.
  ASSERT_EQ(std::system("cd /tmp/o && touch new && echo x >> f && rm del gone/x && rmdir gone && "
                        "mv mv d/moved && mv d2 d3 && mkdir newdir"),
            0);
  const auto line = [](int number, const std::string& path, unsigned mask) {
    return std::to_string(number) + " /tmp/o/" + path + " " + std::to_string(mask) + " offline";
  };
  std::unique_ptr<Daemon> daemon;
  EXPECT_EQ(run("/tmp/o/gone/x 512 offline", "", &daemon),
            Lines({line(2, "d2", IN_MOVED_FROM | IN_ISDIR), line(3, "d3", IN_MOVED_TO | IN_ISDIR),
                   line(4, "del", IN_DELETE), line(5, "f", IN_MODIFY | IN_CLOSE_WRITE),
                   line(6, "gone", IN_DELETE | IN_ISDIR), line(7, "mv", IN_MOVED_FROM),
                   line(8, "d/moved", IN_MOVED_TO), line(9, "new", IN_CREATE),
                   line(10, "newdir", IN_CREATE | IN_ISDIR), line(11, "gone/x", IN_DELETE)}));

  // Killed right after an event, before its directory is saved (the view
  // taken at start is, after the group sync): the event is in the
  // journal, the comparison finds it again (perhaps twice), and what came
  // after.  Files made before, in directories of different parents, were
  // saved by the group sync: no comparison tells them again.
  ASSERT_EQ(std::system("touch /tmp/o/d/x /tmp/o/d3/inner/y"), 0);
  seq += 4;  // their records, 12 to 15
  usleep(300 * 1000);
  Client live;
  Subscribe(live, "o");
  ASSERT_EQ(std::system("touch /tmp/o/k1"), 0);
  EXPECT_EQ(live.Line(true), "16 /tmp/o/k1 256");
  EXPECT_EQ(daemon->Stop(SIGKILL), -1);
  ASSERT_EQ(std::system("touch /tmp/o/k2"), 0);
  const Lines after_kill = run("/tmp/o/k2 256 offline");
  for (size_t i = 0; i < after_kill.size(); ++i) {
    const bool end = i + 1 == after_kill.size();
    EXPECT_EQ(after_kill[i].rfind(
                  std::to_string(16 + i) + (end ? " /tmp/o/k2 256 offline" : " /tmp/o/k1 "), 0),
              0u)
        << after_kill[i];
  }
  ASSERT_EQ(std::system("rm /tmp/o/d/x /tmp/o/d3/inner/y"), 0);  // the rest as it was

  // A snapshot that cannot be trusted is logged, answered with a rescan
  // of its tree, and written afresh.
  std::string file;
  for (const auto& entry : std::filesystem::directory_iterator("/var/lib/zorvnotifyd/snapshot"))
    file = entry.path();
  const std::string unusable = "the snapshot of tree \"/tmp/o\" is unusable (";
  for (const auto& [spoil, why] : std::vector<std::pair<std::string, std::string>>{
           {"printf garbage | dd of=$F bs=1 seek=40 conv=notrunc status=none",
            "a record does not match its checksum"},
           {"dd if=/dev/null of=$F bs=1 seek=$(($(wc -c <$F) - 3)) status=none", "cut short"},
           {"mv $F $F.real && ln -s $F.real $F", "a symbolic link"},
           {"rm $F && mkfifo $F", "not a regular file"},
           {"truncate -s 300M $F", "too large"},
           {"chown 65534 $F", "not root's alone"}}) {
    std::string command = "set -e; F=" + file + "; " + spoil;
    ASSERT_EQ(std::system(command.c_str()), 0) << spoil;
    const std::string rescan = std::to_string(seq + 1) + " rescan /tmp/o";
    EXPECT_EQ(run(rescan, unusable + why + "): starting it afresh"), Lines({rescan})) << why;
  }

  // A tree removed and made again while stopped: all it held is gone.  A
  // large tree, compared first from now on, is saved by this run.
  ASSERT_EQ(std::system("rm -r /tmp/o && mkdir /tmp/o && touch /tmp/o/again && mkdir /tmp/n && "
                        "cd /tmp/n && seq 20000 | xargs touch"),
            0);
  Register("slow", "/tmp/n", IN_DELETE_SELF);
  const int n = seq;
  EXPECT_EQ(run("/tmp/o/d3/inner 1073742336 offline", "compared 2 trees with their snapshot"),
            Lines({line(n + 1, "again", IN_CREATE), line(n + 2, "d", IN_DELETE | IN_ISDIR),
                   line(n + 3, "d3", IN_DELETE | IN_ISDIR), line(n + 4, "f", IN_DELETE),
                   line(n + 5, "k1", IN_DELETE), line(n + 6, "k2", IN_DELETE),
                   line(n + 7, "new", IN_DELETE), line(n + 8, "newdir", IN_DELETE | IN_ISDIR),
                   line(n + 9, "same", IN_DELETE), line(n + 10, "d/moved", IN_DELETE),
                   line(n + 11, "d3/inner", IN_DELETE | IN_ISDIR)}));

  // A file made after "ready", while a large tree compared first keeps the
  // comparison from /tmp/o, is told once, by its events: the comparison
  // that then lists it leaves it out.
  // No periodic look: only the events themselves wake the daemon.
  Daemon daemon2(Lines{"--retry", "600"});
  ASSERT_TRUE(daemon2.Logged("ready: watching"));
  ASSERT_TRUE(Put("/tmp/o/late", "x"));
  ASSERT_TRUE(daemon2.Logged("compared 2 trees with their snapshot"));
  Client client;
  Subscribe(client, "o", seq);
  Lines got;  // the end written once the late file's last event came
  for (std::string record; got.size() < 10 && !(record = client.Line(true)).empty();) {
    got.push_back(record.substr(record.find(' ') + 1));
    if (got.back() == "/tmp/o/late 8") Put("/tmp/o/end", "");
    if (got.back() == "/tmp/o/end 256") break;
  }
  EXPECT_EQ(got, Lines({"/tmp/o/late 256", "/tmp/o/late 2", "/tmp/o/late 8", "/tmp/o/end 256"}));
}

// Each queue's records outlive the daemon: stopped, killed in the middle
// of a burst, restarted, the numbering goes on under the same journal id,
// and a client that comes back with "since" gets each record once, in
// order.  A journal cut short, garbage, a FIFO or a link in its place, or
// its id removed, is told: rescan records, a new id, never a crash, a hang
// or a silent gap.
TEST_F(DaemonTest, KeepsEachQueuesRecordsAcrossRestarts) {
  ASSERT_EQ(std::system("rm -rf /tmp/j && mkdir /tmp/j && printf x >/tmp/j/0"), 0);
  Register("j", "/tmp/j", kCreate);
  // 20,000 records while a client reads none, and kill -9 once the daemon
  // has read them all, in the middle of its delivery.
  constexpr int kAway = 20000;
  std::string journal;
  {
    Daemon daemon(Lines{});
    ASSERT_TRUE(daemon.Logged("ready:"));
    Client sleeper;
    journal = Subscribe(sleeper, "j")["journal"].asString();
    // File i is record i, after the first start's rescan record.
    for (int i = 2; i < kAway + 2; ++i) {
      ASSERT_EQ(close(open(("/tmp/j/" + std::to_string(i)).c_str(), O_CREAT | O_WRONLY, 0644)), 0);
    }
    for (int tries = 0; tries < 1000 && Status()["events"].asInt() < kAway; ++tries) usleep(10000);
    EXPECT_EQ(daemon.Stop(SIGKILL), -1);
  }
  int last = kAway + 2;  // the number of the record of /tmp/j/after
  {
    Daemon daemon(Lines{});
    ASSERT_TRUE(daemon.Logged("ready:"));
    Client client;
    const Json::Value reply = Subscribe(client, "j", 1);
    EXPECT_EQ(reply["journal"], journal);
    EXPECT_GE(reply["queues"][0]["seq"], kAway + 1);
    for (int seq = 2; seq < kAway + 2; ++seq) {
      const std::string line = client.Line();
      if (line != "j " + std::to_string(seq) + " /tmp/j/" + std::to_string(seq)) {
        FAIL() << "record " << seq << ": " << line;
      }
    }
    // Files of the burst not yet in the snapshot at the kill are found
    // again by the start-up comparison.
    ASSERT_TRUE(Put("/tmp/j/after", "x"));
    std::string line;
    while (!(line = client.Line()).empty() && line.find("/tmp/j/after") == std::string::npos) {
      EXPECT_EQ(line.rfind("j " + std::to_string(last++) + " /tmp/j/", 0), 0u) << line;
    }
    EXPECT_EQ(line, "j " + std::to_string(last) + " /tmp/j/after");
    const Json::Value status = Status(), kept = status["journals"][0];
    EXPECT_EQ(
        std::vector<Json::Value>({status["journal"], status["state"], kept["first"], kept["last"]}),
        std::vector<Json::Value>({journal, "ok", 1, last}));
    EXPECT_GT(kept["bytes"].asUInt64(), uint64_t(kAway) * 50);
    EXPECT_EQ(daemon.Stop(SIGTERM), 0);
  }

  // Cut short in the middle of a record: the records before are kept, and
  // the queue rescans its tree, numbered after every record a client may
  // have seen.
  const std::string dir = "/var/lib/zorvnotifyd/journal/";
  std::string segment;
  for (const auto& entry : std::filesystem::directory_iterator(dir)) {
    if (entry.path().extension() == ".0") segment = entry.path();
  }
  ASSERT_FALSE(segment.empty());
  ASSERT_EQ(truncate(segment.c_str(), std::filesystem::file_size(segment) - 10), 0);
  uint64_t rescan_seq = 0;
  {
    Daemon daemon(Lines{});
    // Journals are opened once the watches are in place.
    ASSERT_TRUE(daemon.Logged("ready:"));
    ASSERT_TRUE(daemon.Logged("the journal of queue \"j\" (etc/f) is damaged or cut short"));
    Client client;
    EXPECT_EQ(Subscribe(client, "j", last - 2)["journal"], journal);
    EXPECT_EQ(client.Line().rfind("j " + std::to_string(last - 1) + " /tmp/j/", 0), 0u);
    EXPECT_EQ(client.Line(), "j " + std::to_string(last) + " /tmp/j/after");
    const Json::Value rescan = client.Next();
    EXPECT_EQ(rescan["rescan"], "/tmp/j");
    rescan_seq = rescan["seq"].asUInt64();
    EXPECT_GT(rescan_seq, uint64_t(last));
    EXPECT_EQ(daemon.Stop(SIGTERM), 0);
  }
  // Garbage, a FIFO and a link in place of the journal's files: replaced,
  // the link's target untouched.
  ASSERT_TRUE(Put(segment, std::string(5000, 'g')));
  const std::string other = segment.substr(0, segment.size() - 1) + "1";
  unlink(other.c_str());  // the second file, if the comparison's records filled the first
  ASSERT_EQ(mkfifo(other.c_str(), 0600), 0);
  {
    Daemon daemon(Lines{});
    ASSERT_TRUE(daemon.Logged("ready:"));
    ASSERT_TRUE(daemon.Logged("cannot be used: it is not a journal, or its start is damaged"));
    ASSERT_TRUE(daemon.Logged("cannot be used: it is not a regular file; replacing it"));
    // Its numbering is lost with it: a new journal id says so.
    Client client;
    const Json::Value reply = Subscribe(client, "j", rescan_seq);
    EXPECT_NE(reply["journal"], journal);
    journal = reply["journal"].asString();
    EXPECT_EQ(client.Line(), "j 1 rescan /tmp/j");
    EXPECT_EQ(daemon.Stop(SIGTERM), 0);
  }
  unlink(other.c_str());  // replaced by nothing, or by a new segment
  ASSERT_EQ(symlink("/tmp/j/0", other.c_str()), 0);
  {
    Daemon daemon(Lines{});
    ASSERT_TRUE(daemon.Logged("ready:"));
    ASSERT_TRUE(daemon.Logged("cannot be used: it is a symbolic link; replacing it"));
    EXPECT_EQ(Status()["journal"], journal);
    EXPECT_EQ(daemon.Stop(SIGTERM), 0);
  }
  EXPECT_EQ(std::filesystem::file_size("/tmp/j/0"), 1u);
  // The id removed: the journals are reset under a new one.
  ASSERT_EQ(unlink((dir + "id").c_str()), 0);
  Daemon daemon(Lines{});
  ASSERT_TRUE(daemon.Logged("starting a new journal"));
  ASSERT_TRUE(daemon.Logged("ready:"));
  const Json::Value status = Status();
  EXPECT_EQ(status["journal"].asString().size(), 32u);
  EXPECT_NE(status["journal"], journal);
  EXPECT_EQ(daemon.Stop(SIGTERM), 0);
}

// A full state directory (a tiny tmpfs on it, in the daemon's own mount
// namespace): live delivery goes on, one log line, the status says
// degraded, and once writing works again the queue rescans its tree.
TEST_F(DaemonTest, DeliversLiveWhenTheJournalCannotBeWritten) {
  ASSERT_EQ(std::system("rm -rf /tmp/full /tmp/fs && mkdir /tmp/full /tmp/fs"), 0);
  Register("full", "/tmp/full", kCreate);
  Daemon daemon({"--state-dir", "/tmp/fs"}, PrivateTmpfs("/tmp/fs", "mode=0700,size=64k"));
  ASSERT_TRUE(daemon.Logged("ready:"));
  Client client;
  Subscribe(client, "full");
  // Fills what the daemon sees at /tmp/fs.
  const std::string filler = "/proc/" + std::to_string(daemon.pid()) + "/root/tmp/fs/filler";
  // A byte count busybox's head reads too (it knows "1m", not "1M").  It
  // fails once the file system is full, as meant; the size says the rest.
  [[maybe_unused]] const int full =
      std::system(("head -c 1048576 /dev/zero >" + filler + " 2>/dev/null").c_str());
  struct stat filled;
  ASSERT_TRUE(stat(filler.c_str(), &filled) == 0 && filled.st_size > 0);
  for (int i = 1; i <= 300; ++i) {
    ASSERT_TRUE(Put("/tmp/full/" + std::to_string(i), "x"));
    ASSERT_EQ(client.Line(), "full " + std::to_string(i + 1) + " /tmp/full/" + std::to_string(i));
  }
  EXPECT_TRUE(daemon.Logged("the journal of queue \"full\" (etc/f) is degraded: cannot write"));
  EXPECT_EQ(Status()["state"], "degraded");
  ASSERT_EQ(unlink(filler.c_str()), 0);
  ASSERT_TRUE(Put("/tmp/full/again", "x"));
  EXPECT_EQ(client.Line(), "full 302 /tmp/full/again");
  EXPECT_EQ(client.Line(), "full 303 rescan /tmp/full");
  EXPECT_TRUE(daemon.Logged("the journal of queue \"full\" (etc/f) is written again"));
  EXPECT_TRUE(daemon.Logged("the snapshot of tree \"/tmp/full\" is saved again"));
  EXPECT_EQ(Status()["state"], "ok");
  EXPECT_EQ(daemon.Stop(SIGTERM), 0);
}

// Trees on a loop-mounted ext4 file system served by fanotify: files in
// new directories, moves in, within and out, a tree deleted and made
// again, the overflow record, and nothing from outside the trees.  Then
// --backend auto: fanotify for a whole file system, inotify for a part of
// one and for a ramfs, which gives no file handles.
TEST_F(DaemonTest, ServesWholeFileSystemsWithFanotify) {
  // Linux 5.17 reports a move as one event; older kernels, apart.
  const int probe = fanotify_init(
      FAN_CLASS_NOTIF | FAN_REPORT_DFID_NAME | FAN_REPORT_FID | FAN_REPORT_TARGET_FID, O_RDONLY);
  if (probe < 0) {
    GTEST_SKIP() << "no fanotify with directory handles, names and moves in one event here "
                    "(Linux 5.17, CAP_SYS_ADMIN): "
                 << strerror(errno);
  }
  close(probe);
  ASSERT_EQ(
      std::system("umount /tmp/all /tmp/ram 2>/dev/null; rm -rf /tmp/all /tmp/ram /tmp/img && "
                  "mkdir /tmp/all /tmp/ram && truncate -s 64M /tmp/img"),
      0);
  if (std::system("mkfs.ext4 -q -N 40000 /tmp/img && mount -o loop /tmp/img /tmp/all") != 0) {
    GTEST_SKIP() << "no ext4 file system in a loop device here (mkfs.ext4, /dev/loop*)";
  }
  // 3,000 directories more make the comparison at start take many turns.
  ASSERT_EQ(std::system("mkdir -p /tmp/all/t/w /tmp/all/r /tmp/all/out/sub && "
                        "echo x >/tmp/all/out/sub/f && mount -t ramfs ramfs /tmp/ram && "
                        "cd /tmp/all/t/w && seq 3000 | xargs mkdir"),
            0);
  constexpr unsigned kAll = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_CLOSE_WRITE;
  Register("t", "/tmp/all/t", kAll);
  Register("r", "/tmp/all/r", IN_CREATE);
  Register("ram", "/tmp/ram", IN_CREATE);
  auto daemon =
      std::make_unique<Daemon>(Lines{"--json", "--retry", "0.05", "--backend", "fanotify"});
  // Each tree's backend is logged once the daemon is ready.
  ASSERT_TRUE(daemon->Logged("ready:"));
  ASSERT_TRUE(daemon->Logged("tree \"/tmp/all/r\" is served by fanotify: --backend fanotify"));
  ASSERT_TRUE(daemon->Logged("tree \"/tmp/all/t\" is served by fanotify: --backend fanotify"));
  ASSERT_TRUE(daemon->Logged(
      "tree \"/tmp/ram\" is served by inotify: its file system gives no file handles"));

  // Every file written at once in new directories ten deep, and nothing
  // from outside the trees.
  ASSERT_EQ(std::system("cd /tmp/all/t && for i in $(seq 20); do d=c$i/1/2/3/4/5/6/7/8/9; "
                        "mkdir -p $d; while echo x >$d/f && [ $d != c$i ]; do d=${d%/*}; done; "
                        "echo x >/tmp/all/out/o$i; done; echo x >/tmp/all/t/end"),
            0);
  std::set<std::string> files;
  for (const std::string& line : daemon->ReadUntil("t etc f /tmp/all/t/end 8")) {
    EXPECT_EQ(line.find("/out"), std::string::npos) << line;
    if (line.size() > 6 && line.compare(line.size() - 6, 6, "/f 256") == 0) files.insert(line);
  }
  EXPECT_EQ(files.size(), 200u);
  ASSERT_TRUE(Put("/tmp/ram/a", ""));
  EXPECT_TRUE(daemon->Heard("ram etc f /tmp/ram/a 256"));

  // Moves in (what came is found), within (the pair; the directory's new
  // path serves at once) and out (nothing more from there).
  const auto t = [](const std::string& path, unsigned mask) {
    return "t etc f /tmp/all/t/" + path + " " + std::to_string(mask);
  };
  // The lines up to |last| but the first start's rescan record of the
  // tree, which comes when the walk after ready has been through it.
  const auto events_until = [&daemon](const std::string& last) {
    Lines lines = daemon->ReadUntil(last);
    lines.erase(std::remove(lines.begin(), lines.end(), "t rescan /tmp/all/t"), lines.end());
    return lines;
  };
  ASSERT_EQ(rename("/tmp/all/out/sub", "/tmp/all/t/sub"), 0);
  EXPECT_EQ(events_until(t("sub/f", IN_CREATE | IN_CLOSE_WRITE | IN_MOVED_TO)),
            Lines({t("sub", IN_MOVED_TO | IN_ISDIR),
                   t("sub/f", IN_CREATE | IN_CLOSE_WRITE | IN_MOVED_TO)}));
  ASSERT_EQ(rename("/tmp/all/t/sub", "/tmp/all/t/c1/sub2"), 0);
  ASSERT_TRUE(Put("/tmp/all/t/c1/sub2/g", ""));
  ASSERT_EQ(rename("/tmp/all/t/c1/sub2", "/tmp/all/out/sub3"), 0);
  ASSERT_TRUE(Put("/tmp/all/out/sub3/h", "") && Put("/tmp/all/t/end2", ""));
  EXPECT_EQ(events_until(t("end2", IN_CLOSE_WRITE)),
            Lines({t("sub", IN_MOVED_FROM | IN_ISDIR), t("c1/sub2", IN_MOVED_TO | IN_ISDIR),
                   t("c1/sub2/g", IN_CREATE), t("c1/sub2/g", IN_CLOSE_WRITE),
                   t("c1/sub2", IN_MOVED_FROM | IN_ISDIR), t("end2", IN_CREATE),
                   t("end2", IN_CLOSE_WRITE)}));

  // A tree deleted and made again is served at its path.  The deletion is
  // told by its event ("it was deleted;") or, when the retry tick looks
  // first, by the tick ("it was deleted or moved away;").
  ASSERT_EQ(std::system("rm -r /tmp/all/r && mkdir /tmp/all/r && echo x >/tmp/all/r/b"), 0);
  EXPECT_TRUE(daemon->Logged("not watching tree \"/tmp/all/r\": it was deleted"));
  EXPECT_TRUE(daemon->Logged("watching tree \"/tmp/all/r\" again"));
  EXPECT_TRUE(daemon->Heard("r etc f /tmp/all/r/b 256"));

  // More events than the kernel queues while the daemon is stopped: a
  // rescan record, and events again after.
  std::ifstream max_file("/proc/sys/fs/fanotify/max_queued_events");
  int max_queued = 0;
  if (max_file >> max_queued && max_queued <= 100000) {
    ASSERT_EQ(mkdir("/tmp/all/t/many", 0755), 0);
    ASSERT_EQ(kill(daemon->pid(), SIGSTOP), 0);
    // Stopped for sure (the signal takes effect later), and a margin over
    // the queue's size: it reads nothing while they are made.
    const std::string stat = "/proc/" + std::to_string(daemon->pid()) + "/stat";
    for (std::string state; state.find(") T ") == std::string::npos;) {
      std::getline(std::ifstream(stat), state);
    }
    for (int i = 0; i <= 2 * max_queued; ++i) {
      close(open(("/tmp/all/t/many/" + std::to_string(i)).c_str(), O_CREAT | O_WRONLY, 0644));
    }
    ASSERT_EQ(kill(daemon->pid(), SIGCONT), 0);
    // Every queue is told to rescan, "ram" last; what was read before is
    // read too, so the daemon never waits on its output for the log below.
    const Lines got = daemon->ReadUntil("ram rescan /tmp/ram");
    EXPECT_NE(std::find(got.begin(), got.end(), "t rescan /tmp/all/t"), got.end());
    EXPECT_TRUE(daemon->Logged("fanotify event queue overflowed, events were lost"));
    ASSERT_TRUE(Put("/tmp/all/t/c2/after", "x"));
    EXPECT_TRUE(daemon->Heard("t etc f /tmp/all/t/c2/after 256"));
  }
  EXPECT_EQ(daemon->Stop(SIGTERM), 0);

  // The default: fanotify only where no event outside the tree is paid for.
  // What changed while the daemon was stopped comes from the comparison
  // with the snapshot, after ready.
  ASSERT_TRUE(Put("/tmp/all/t/c3/offline", ""));
  Register("all", "/tmp/all", IN_CREATE, nullptr, "fall");
  // Mount points as the mount table spells them ("\040" for a space); a
  // link to one is not a mount point.
  ASSERT_EQ(std::system("mkdir '/tmp/sp ace' && mount -t tmpfs tmpfs '/tmp/sp ace' && "
                        "ln -s '/tmp/sp ace' /tmp/lnk"),
            0);
  Register("sp", "/tmp/sp ace", IN_CREATE);
  Register("lnk", "/tmp/lnk", IN_CREATE);
  daemon = std::make_unique<Daemon>(Lines{"--json"});
  ASSERT_TRUE(daemon->Logged("ready:"));
  ASSERT_TRUE(
      daemon->Logged("tree \"/tmp/all\" is served by fanotify: it is a whole file system, with "
                     "file handles"));
  ASSERT_TRUE(daemon->Logged(
      "tree \"/tmp/all/r\" is served by fanotify: it lies in tree \"/tmp/all\", which fanotify "
      "serves"));
  ASSERT_TRUE(daemon->Logged("tree \"/tmp/lnk\" is served by inotify: it is not a mount point"));
  ASSERT_TRUE(daemon->Logged(
      "tree \"/tmp/ram\" is served by inotify: its file system gives no file handles"));
  ASSERT_TRUE(daemon->Logged(
      "tree \"/tmp/sp ace\" is served by fanotify: it is a whole file system, with file handles"));
  // The file made while no daemon ran comes as an offline record, or its
  // tree is named for a rescan when the first daemon stopped before it
  // could save its view of the tree (its walk after the overflow was not
  // done); changes it had delivered may come again, never fewer.
  const Lines offline = daemon->ReadUntil("t etc f /tmp/all/t/c3/offline 256");
  EXPECT_TRUE((!offline.empty() && offline.back() == "t etc f /tmp/all/t/c3/offline 256") ||
              std::count(offline.begin(), offline.end(), "t rescan /tmp/all/t") > 0)
      << ::testing::PrintToString(offline);
  const Json::Value trees = Status()["trees"];
  ASSERT_EQ(trees.size(), 6u);
  EXPECT_EQ(trees[0]["path"].asString() + " " + trees[0]["backend"].asString(),
            "/tmp/all fanotify");
  EXPECT_EQ(trees[4]["path"].asString() + " " + trees[4]["backend"].asString(), "/tmp/ram inotify");
  ASSERT_TRUE(Put("/tmp/all/out/x", ""));
  EXPECT_TRUE(daemon->Heard("all etc fall /tmp/all/out/x 256"));
  EXPECT_EQ(daemon->Stop(SIGTERM), 0);
  EXPECT_EQ(std::system("umount /tmp/all /tmp/ram '/tmp/sp ace' && rm /tmp/img"), 0);
}

// The Python module and its example against this daemon, which
// tests/python/test_subscription.py starts and stops itself (a restart is
// part of what it checks).  Its unittest report comes out on a failure.
TEST_F(DaemonTest, PythonModuleFollowsQueues) {
  if (access(PYTHON3_PATH, X_OK) != 0) GTEST_SKIP() << "no Python 3 at " PYTHON3_PATH;
  zorv_test::ChildProcess python(
      {PYTHON3_PATH, ZORVNOTIFYD_SOURCE_DIR "/tests/python/test_subscription.py"},
      [] {
        return setenv("PYTHONPATH", ZORVNOTIFYD_SOURCE_DIR "/python", 1) == 0 &&
               setenv("PYTHONDONTWRITEBYTECODE", "1", 1) == 0 &&
               setenv("ZORVNOTIFYD_PATH", ZORVNOTIFYD_PATH, 1) == 0 &&
               setenv("ZORVNOTIFYCTL_PATH", ZORVNOTIFYCTL_PATH, 1) == 0 &&
               setenv("ZORVNOTIFYD_SOCKET", kSocket, 1) == 0;
      },
      true);
  // unittest's last line is "OK" or "FAILED (...)"; two empty reads in a
  // row mean a time-out (its report has no two blank lines together).
  std::string report, line;
  for (int empty = 0; empty < 2 && line.rfind("OK", 0) != 0 && line.rfind("FAILED", 0) != 0;) {
    line = python.Read();
    empty = line.empty() ? empty + 1 : 0;
    report += line + "\n";
  }
  EXPECT_EQ(line, "OK") << report;
  EXPECT_EQ(python.Stop(0), 0);
}

}  // namespace
