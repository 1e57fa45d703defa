// Tests of the zorvnotifyctl tool, run as a child process inside this
// program's sandbox: what it refuses (exit status 2, nothing touched), what
// the library refuses (exit status 1, with the library's line on stderr),
// its --json output, parsed back, and its commands on a real daemon.

#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/file.h>
#include <sys/inotify.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <fstream>
#include <sstream>
#include <thread>

#include <gmock/gmock.h>
#include <json/json.h>

#include "monitor_queue.h"
#include "support/sandbox.h"

namespace {

struct Case {
  std::string args;      // shell words after the tool's name
  std::string input;     // standard input
  int status;            // expected exit status
  std::string expected;  // status 0: the whole of stdout as JSON, if given; else a part of stderr
};

Json::Value Parse(const std::string& text) {
  Json::Value value;
  std::istringstream in(text);
  EXPECT_TRUE(Json::parseFromStream(Json::CharReaderBuilder(), in, &value, nullptr)) << text;
  return value;
}

// Runs the tool with |args| and |input| on standard input; returns its exit
// status (-1 when it did not exit) and sets |out| and |err|.
int RunTool(const std::string& args, const std::string& input, std::string* out, std::string* err) {
  std::ofstream("/tmp/in") << input;
  const int status =
      system(("'" ZORVNOTIFYCTL_PATH "' " + args + " </tmp/in >/tmp/out 2>/tmp/err").c_str());
  std::ostringstream out_text, err_text;
  out_text << std::ifstream("/tmp/out").rdbuf();
  err_text << std::ifstream("/tmp/err").rdbuf();
  *out = out_text.str();
  *err = err_text.str();
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// Runs the tool for each case in turn and checks what it gave.
void Check(const std::vector<Case>& cases) {
  for (const Case& c : cases) {
    std::string out, err;
    EXPECT_EQ(RunTool(c.args, c.input, &out, &err), c.status) << c.args << err;
    if (c.status != 0) {
      EXPECT_THAT(err, ::testing::HasSubstr(c.expected)) << c.args;
    } else if (!c.expected.empty()) {
      EXPECT_EQ(Parse(out), Parse(c.expected)) << c.args;
    }
  }
}

// A queue "q" whose one configuration watches |path| (JSON string content).
std::string WatchingPath(const std::string& path) {
  return R"({"queue": "q", "config": [{"path": ")" + path + R"(", "mask": 1, "ignore": []}]})";
}

TEST(ZorvnotifyctlTest, RefusalsExitStatusesAndJsonOutput) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  const std::string obj = R"({"queue": "q", "config": [{"path": "/a", )";
  const std::string ok = obj + R"("mask": 1}]})";
  Check({
      {"upsert q", R"({"queue": "q", "config": [], "x": 1})", 2, R"(unknown key "x")"},
      {"upsert q", obj + R"("mask": 1, "masks": 2}]})", 2, R"(config[0]: unknown key "masks")"},
      {"upsert q", R"({"queue": 7})", 2, R"("queue" must be a string, not an integer)"},
      {"upsert q", R"({"queue": "q", "config": {}})", 2, R"("config" must be an array, not an)"},
      {"upsert q", obj + R"("mask": "1"}]})", 2, "config[0].mask must be an unsigned 32-bit"},
      {"upsert q", obj + R"("mask": -1}]})", 2, "config[0].mask must not be negative (-1)"},
      {"upsert q", obj + R"("mask": 4294967296}]})", 2, "mask 4294967296 does not fit"},
      {"upsert q", obj + R"("mask": 1, "ignore": ["x", 3]}]})", 2, "ignore[1] must be a string"},
      {"upsert q", obj + R"("mask": 1, "ignore": ["("]}]})", 2, "not a valid extended regular"},
      {"upsert q", "[" + ok + "]", 2, "the queue must be a JSON object, not an array"},
      {"upsert q", ok + "{}", 2, "invalid JSON"},
      {"upsert q", obj + R"("mask": 1 /* c */}]})", 2, "line 1: comments are not allowed"},
      {"upsert q",
       R"({"queue": "q", // c)"
       "\n}",
       2, "line 1: comments are not allowed"},
      {"upsert q", std::string(5000, '['), 2, "invalid JSON: nested too deeply"},
      {"upsert q", obj + R"("mask": 1, "ignore": ["a\u0000|b"]}]})", 2,
       R"(ignore[0] "a\x00|b" holds a NUL)"},
      {"upsert ''", ok, 2, "the queue file name is empty"},
      {"list .", "", 2, R"(name "." names a directory)"},
      {"get a ..", "", 2, R"(name ".." names a directory)"},
      {"delete a a/b", "", 2, R"("a/b" contains "/")"},
      {"list .q", "", 2, R"(".q" begins with ".")"},
      {"upsert " + std::string(244, 'f'), ok, 2,
       "is 244 bytes long; a queue file name has at most 243"},
      // Paths the daemon could never match, each with the spelling to use.
      {"upsert q", WatchingPath(""), 2, R"(config[0].path "" cannot be watched: it is empty)"},
      {"upsert q", WatchingPath("rel/dir"), 2,
       R"("rel/dir" cannot be watched: it is relative, )"
       R"(and events carry absolute paths; write it as an absolute path such as "/rel/dir")"},
      {"upsert q", WatchingPath("/"), 2, R"("/" cannot be watched: it is the root directory)"},
      {"upsert q", WatchingPath("/a/"), 2,
       R"("/a/" cannot be watched: it ends in "/", which no reported path can match; )"
       R"(write it as "/a")"},
      {"upsert q", WatchingPath("/a//b"), 2, R"("/a//b" cannot be watched: it holds "//", )"},
      {"upsert q", WatchingPath("/a/./b"), 2,
       R"("/a/./b" cannot be watched: it holds a "." or ".." component, which no reported )"
       R"(path can match; write it as "/a/b")"},
      {"upsert q", WatchingPath(R"(/a\n//b)"), 2,
       R"("/a\x0A//b" cannot be watched: it holds "//", which no reported path can match; )"
       R"(write it as "/a\x0A/b")"},
      {"upsert q", WatchingPath(R"(/a\u0000b)"), 2,
       R"("/a\x00b" cannot be watched: it holds a NUL)"},
  });
  ASSERT_NE(access("/usr/zorv", F_OK), 0) << "a refused command reached the library";
  std::string out, err;
  EXPECT_EQ(RunTool("--version upsert q", "", &out, &err), 0) << err;
  EXPECT_EQ(out, "zorvnotifyctl 6.0.0\n");

  const std::string a =
      R"({"queue": "a", "config": [{"path": "/s/t", "mask": 4294967295, "ignore": ["p$"]}])";
  const std::string b = R"({"queue": "b", "config": [{"path": "/s/t/u", "mask": 6, "ignore": []}])";
  const std::string a_row = R"({"queue": "a", "type": "share")";
  const std::string b_row = R"({"queue": "b", "type": "etc")";
  Check({
      {"-t share upsert q", a + "}", 0, ""},
      {"upsert e", b + "}", 0, ""},
      {"get --json b e", "", 0, b + "}"},
      {"--json -t share list q", "", 0, "[" + a + "}]"},
      {"catalogue --json", "", 0, "[" + a + R"(, "type": "share"},)" + b + R"(, "type": "etc"}])"},
      {"--json match /s/t/u/f 0x4", "", 0,
       R"({"mask": 4, "path": "/s/t/u/f", "queues": [)" + a_row + "}," + b_row + "}]}"},
      {"--json dirs /s", "", 0,
       R"({"dir": "/s", "mask": 4294967295, "queues": [)" + a_row + R"(, "mask": 4294967295},)" +
           b_row + R"(, "mask": 6}]})"},
      {"--json shares", "", 0, R"(["/s/t"])"},
      {"get nope e", "", 1, "No such monitor queue: nope"},  // the library's line
  });
  std::ofstream("/usr/zorv/etc/zorvnotifyd/bad") << "not json";
  const std::string removed = R"({"file": "e", "path": "/usr/zorv/etc/zorvnotifyd/e",
                                  "queue": "b", "type": "etc", "removed": )";
  const std::string dotted = WatchingPath("/a/.b/..c/d.");  // dotted names, not components
  Check({
      {"upsert g", dotted, 0, ""},
      {"--json get q g", "", 0, dotted},
      {"delete a bad", "", 1, "LoadFromFile failed, path=/usr/zorv/etc/zorvnotifyd/bad"},
      {"--json delete b e", "", 0, removed + "true}"},
      {"--json delete b e", "", 0, removed + "false}"},
  });

  // Bytes that are not UTF-8 come out as \udcXY, which strict JSON readers
  // accept, and go back in as the same bytes.
  Json::Value raw;
  raw["queue"] = "caf\xe9-q";
  raw["config"][0]["path"] = "/d\xff";
  raw["config"][0]["mask"] = 1;
  ASSERT_TRUE(ZORV::ZORVNOTIFYD::MonitorQueue::Upsert(
      ZORV::ZORVNOTIFYD::MonitorQueue(raw), "r", ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_ETC_DIR));
  EXPECT_EQ(RunTool("get --json $(printf 'caf\\351-q') r", "", &out, &err), 0) << err;
  EXPECT_THAT(out, ::testing::HasSubstr(R"("caf\udce9-q")"));
  EXPECT_EQ(system("python3 -c 'import json,sys; json.loads(sys.stdin.read())' </tmp/out"), 0);
  EXPECT_EQ(RunTool("upsert r", out, &out, &err), 0) << err;
  std::vector<ZORV::ZORVNOTIFYD::MonitorQueue> stored;
  ASSERT_TRUE(ZORV::ZORVNOTIFYD::MonitorQueue::List(stored, "r",
                                                    ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_ETC_DIR));
  ASSERT_EQ(stored.size(), 1u);
  EXPECT_EQ(stored[0]._name, "caf\xe9-q");
  ASSERT_EQ(stored[0]._configs.size(), 1u);
  EXPECT_EQ(stored[0]._configs[0]._path, "/d\xff");
}

// Runs the tool with |args| and /tmp/in on standard input as real user 1000
// with effective and saved user id 0, as when installed set-user-ID root;
// returns its exit status (-1 when it did not exit) and sets |err|.
int RunSetUserId(std::vector<std::string> args, std::string* err) {
  args.insert(args.begin(), ZORVNOTIFYCTL_PATH);
  const pid_t pid = fork();
  if (pid == 0) {
    const int in = open("/tmp/in", O_RDONLY);
    const int out = open("/tmp/err", O_WRONLY | O_CREAT | O_TRUNC, 0644);
    if (in < 0 || out < 0 || dup2(in, 0) < 0 || dup2(out, 1) < 0 || dup2(out, 2) < 0 ||
        setresuid(1000, 0, 0) != 0) {
      _exit(125);
    }
    std::vector<char*> argv;
    for (std::string& arg : args) argv.push_back(&arg[0]);
    argv.push_back(nullptr);
    execv(argv[0], argv.data());
    _exit(127);
  }
  int status = 0;
  waitpid(pid, &status, 0);
  std::ostringstream text;
  text << std::ifstream("/tmp/err").rdbuf();
  *err = text.str();
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

TEST(ZorvnotifyctlTest, RefusesSetUserIdAndReportsABusyStore) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  const std::string queue = WatchingPath("/a");
  std::ofstream("/tmp/in") << queue;
  std::string out, err;
  EXPECT_EQ(RunSetUserId({"upsert", "q"}, &err), 77);
  // Under an emulator the wrapper shell drops the effective id first: the
  // tool then sees a plain non-root caller, refused the same way.
  EXPECT_THAT(err, ::testing::HasSubstr("must be run as root (real user id 1000)"));
  EXPECT_NE(access("/usr/zorv", F_OK), 0) << "the set-user-ID tool reached the library";
  EXPECT_EQ(RunSetUserId({"--version"}, &err), 0) << err;

  // Another writer holds the store lock: no wait gives up at once and
  // names it; a wait outlasting it stores.
  int lock = open("/tmp/zorvnotifyd_monitor_q.lock", O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  ASSERT_EQ(flock(lock, LOCK_EX), 0);
  EXPECT_EQ(RunTool("--wait 0 upsert q", queue, &out, &err), 75);
  EXPECT_THAT(err, ::testing::HasSubstr("held by pid " + std::to_string(getpid()) + " (user root"));
  std::thread release([lock] {
    usleep(500000);
    close(lock);
  });
  EXPECT_EQ(RunTool("--wait 2 upsert q", queue, &out, &err), 0) << err;
  release.join();
  // A stored change whose report cannot be written is still a success.
  const int status = system("'" ZORVNOTIFYCTL_PATH "' delete q q </dev/null >/dev/full 2>/tmp/err");
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
  std::ostringstream text;
  text << std::ifstream("/tmp/err").rdbuf();
  EXPECT_THAT(text.str(), ::testing::HasSubstr("the change is stored, but its report could not"));
  // A service manager that fails is said in words; the change stays.
  zorv_test::SetSystemctlExitStatus(1);
  EXPECT_EQ(RunTool("upsert q", queue, &out, &err), 0) << err;
  EXPECT_THAT(err, ::testing::HasSubstr("the change is stored, but the service manager could not "
                                        "be asked to start or stop zorvnotifyd"));
}

// A program run in the background, its standard output and error on one
// pipe; killed at the end when it still runs.
class Background {
 public:
  explicit Background(std::vector<std::string> args) {
    int fds[2];
    EXPECT_EQ(pipe2(fds, O_CLOEXEC), 0);
    if ((pid_ = fork()) == 0) {
      if (dup2(fds[1], 1) < 0 || dup2(fds[1], 2) < 0) _exit(125);
      std::vector<char*> argv;
      for (std::string& arg : args) argv.push_back(&arg[0]);
      argv.push_back(nullptr);
      execv(argv[0], argv.data());
      _exit(127);
    }
    close(fds[1]);
    out_ = fds[0];
  }
  ~Background() {
    if (pid_ > 0 && kill(pid_, SIGKILL) == 0) waitpid(pid_, nullptr, 0);
    close(out_);
  }
  // The next line of output holding |text|, waiting up to 10 s; "" when
  // none came.
  std::string Line(const std::string& text = "") {
    for (;;) {
      for (size_t end; (end = buffered_.find('\n')) != std::string::npos;) {
        const std::string line = buffered_.substr(0, end);
        buffered_.erase(0, end + 1);
        if (line.find(text) != std::string::npos) return line;
      }
      struct pollfd p = {out_, POLLIN, 0};
      char chunk[4096];
      ssize_t n = 0;
      if (poll(&p, 1, 10000) <= 0 || (n = read(out_, chunk, sizeof(chunk))) <= 0) return "";
      buffered_.append(chunk, size_t(n));
    }
  }
  // Sends |signal| (0: none) and returns the exit status; -1 when the
  // program did not exit within 10 s or was killed.
  int Stop(int signal) {
    int status = 0;
    if (kill(pid_, signal) != 0) return -1;
    for (int i = 0; i < 1000; ++i, usleep(10000)) {
      if (waitpid(pid_, &status, WNOHANG) != pid_) continue;
      pid_ = -1;
      return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }
    return -1;
  }

 private:
  pid_t pid_ = -1;
  int out_ = -1;
  std::string buffered_;
};

TEST(ZorvnotifyctlTest, WatchAndStatusAskTheDaemon) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  const std::string socket = "/tmp/ctl.sock";
  std::string out, err;
  EXPECT_EQ(RunTool("--socket " + socket + " watch backup", "", &out, &err), 1);
  EXPECT_THAT(err, ::testing::HasSubstr("zorvnotifyd is not running (no socket at /tmp/ctl.sock)"));

  ASSERT_TRUE(mkdir("/tmp/wd", 0755) == 0 || errno == EEXIST);
  Json::Value queue;
  queue["queue"] = "backup";
  queue["config"][0]["path"] = "/tmp/wd";
  queue["config"][0]["mask"] = IN_CREATE;
  ASSERT_TRUE(
      ZORV::ZORVNOTIFYD::MonitorQueue::Upsert(ZORV::ZORVNOTIFYD::MonitorQueue(queue), "nas",
                                              ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_ETC_DIR));
  Background daemon({ZORVNOTIFYD_PATH, "--socket", socket});
  ASSERT_THAT(daemon.Line("ready:"), ::testing::HasSubstr("for 1 queues"));
  EXPECT_EQ(RunTool("--socket " + socket + " status", "", &out, &err), 0) << err;
  EXPECT_THAT(out, ::testing::ContainsRegex("\nqueues +1\n"));

  // Its first line comes once the subscription is in place.
  Background watch({ZORVNOTIFYCTL_PATH, "--socket", socket, "watch", "backup"});
  EXPECT_EQ(watch.Line(), "watching backup: etc/nas (last #0)");
  std::ofstream("/tmp/wd/new").flush();
  EXPECT_EQ(watch.Line(), "backup [etc/nas] #1 IN_CREATE /tmp/wd/new");
  EXPECT_EQ(watch.Stop(SIGINT), 0);
  std::ofstream("/tmp/wd/b\xff").flush();

  // Kept records come first with --since; the daemon's going away ends
  // the watch with status 1.
  Background json(
      {ZORVNOTIFYCTL_PATH, "--json", "--since", "0", "--socket", socket, "watch", "backup", "nas"});
  EXPECT_EQ(Parse(json.Line())["reply"], "subscribe");
  const Json::Value event = Parse(json.Line());
  EXPECT_EQ(event["seq"], 1);
  EXPECT_EQ(event["path"], "/tmp/wd/new");
  EXPECT_THAT(json.Line(), ::testing::HasSubstr(R"("path":"/tmp/wd/b\udcff")"));
  EXPECT_EQ(daemon.Stop(SIGTERM), 0);
  EXPECT_THAT(json.Line(), ::testing::HasSubstr("zorvnotifyd closed the connection"));
  EXPECT_EQ(json.Stop(0), 1);
}

// Runs the tool with |args| in a mount namespace of its own where /usr is
// read-only; returns its exit status (-1 when it did not exit) and sets
// |out| and |err|.
int RunOnReadOnlyUsr(const std::string& args, std::string* out, std::string* err) {
  const pid_t pid = fork();
  if (pid == 0) {
    if (unshare(CLONE_NEWNS) != 0 ||
        mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
        mount(nullptr, "/usr", nullptr, MS_REMOUNT | MS_BIND | MS_RDONLY, nullptr) != 0) {
      _exit(125);
    }
    _exit(RunTool(args, "", out, err));
  }
  int status = 0;
  waitpid(pid, &status, 0);
  std::ostringstream out_text, err_text;
  out_text << std::ifstream("/tmp/out").rdbuf();
  err_text << std::ifstream("/tmp/err").rdbuf();
  *out = out_text.str();
  *err = err_text.str();
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// Files created in an order other than their names' (tmpfs lists the
// newest first), one named like a backup copy, and the other two
// configuration directories missing on a read-only /usr.
TEST(ZorvnotifyctlTest, ReadsFilesInNameOrderAndAReadOnlyUsrWithWarnings) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  ASSERT_EQ(std::system("mkdir -p -m 0700 /usr/zorv/etc/zorvnotifyd"), 0);
  const std::vector<std::string> names = {"a", "m", "nas.bak", "z"};
  for (const char* file : {"m", "z", "a", "nas.bak"}) {
    std::ofstream(std::string("/usr/zorv/etc/zorvnotifyd/") + file)
        << R"([{"queue": ")" << file << R"(", "config": [{"path": "/s/t", "mask": 1}]}])";
  }
  std::string out, err;
  for (const char* args : {"catalogue --json", "shares", "dirs /s", "match /s/t 1"}) {
    EXPECT_EQ(RunOnReadOnlyUsr(args, &out, &err), 0) << args << err;
    EXPECT_THAT(err, ::testing::HasSubstr(
                         "warning: the configuration directory /usr/local/etc/zorvnotifyd is "
                         "missing and could not be created; the local-etc type counts as empty"));
    EXPECT_THAT(err, ::testing::HasSubstr(
                         "warning: queue file etc/nas.bak looks like a backup copy, and is loaded "
                         "like any queue file: remove it or move it out of the directory"));
    if (std::string(args) == "catalogue --json") {
      std::vector<std::string> listed;
      for (const Json::Value& queue : Parse(out)) listed.push_back(queue["queue"].asString());
      EXPECT_EQ(listed, names);
    }
  }
  EXPECT_NE(access("/usr/zorv/share", F_OK), 0);
  // A save that cannot be written says why.
  std::ofstream("/tmp/q.json") << R"({"queue": "q", "config": []})";
  EXPECT_EQ(RunOnReadOnlyUsr("upsert a /tmp/q.json", &out, &err), 1);
  EXPECT_THAT(
      err, ::testing::HasSubstr("the file system holding /usr/zorv/etc/zorvnotifyd is read-only"));
}

}  // namespace
