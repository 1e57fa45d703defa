// Tests of the zorvnotifyctl tool, run as a child process inside this
// program's sandbox: what it refuses (exit status 2, nothing touched), what
// the library refuses (exit status 1, with the library's line on stderr),
// its --json output, parsed back, and its commands on a real daemon.

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/file.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <functional>
#include <sstream>
#include <thread>

#include <gmock/gmock.h>
#include <json/json.h>

#include "monitor_queue.h"
#include "support/child_process.h"
#include "support/sandbox.h"

namespace {

using namespace ZORV::ZORVNOTIFYD;  // NOLINT

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

// The content of the file at |path|.
std::string Slurp(const char* path) {
  std::ostringstream text;
  text << std::ifstream(path).rdbuf();
  return text.str();
}

// Runs the tool with |args| (shell words, which may redirect its streams
// again) and |input| on standard input, after |in_child|; returns its exit
// status (-1 when it did not exit) and sets |out| and |err| to what it wrote.
int RunTool(const std::string& args, const std::string& input, std::string* out, std::string* err,
            const std::function<bool()>& in_child = nullptr) {
  std::ofstream("/tmp/in") << input;
  const std::string tool = "exec </tmp/in >/tmp/out 2>/tmp/err; exec '" ZORVNOTIFYCTL_PATH "' ";
  const int status = zorv_test::ChildProcess({"/bin/sh", "-c", tool + args}, in_child).Stop(0);
  *out = Slurp("/tmp/out");
  *err = Slurp("/tmp/err");
  return status;
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
      {"upsert q /dev/zero", "", 2, "cannot read /dev/zero: it holds more than 16 MiB"},
      {"upsert q - </dev/zero", "", 2, "cannot read standard input: it holds more than 16 MiB"},
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
  EXPECT_EQ(out, "zorvnotifyctl " ZORVNOTIFYD_VERSION "\n");

  const std::string a =
      R"({"queue": "a", "config": [{"path": "/s/t", "mask": 4294967295, "ignore": ["p$"]}])";
  const std::string b = R"({"queue": "b", "config": [{"path": "/s/t/u", "mask": 6, "ignore": []}])";
  const std::string a_row = R"({"queue": "a", "type": "share")";
  const std::string b_row = R"({"queue": "b", "type": "etc")";
  const std::string removed = R"({"file": "e", "path": "/usr/zorv/etc/zorvnotifyd/e",
                                  "queue": "b", "type": "etc", "removed": )";
  const std::string dotted = WatchingPath("/a/.b/..c/d.");  // dotted names, not components
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
      {"upsert g", dotted, 0, ""},
      {"--json get q g", "", 0, dotted},
      {"--json delete b e", "", 0, removed + "true}"},
      {"--json delete b e", "", 0, removed + "false}"},
  });

  // Bytes that are not UTF-8 come out as \udcXY, which strict JSON readers
  // accept, and go back in as the same bytes.
  Json::Value raw;
  raw["queue"] = "caf\xe9-q";
  raw["config"][0]["path"] = "/d\xff";
  raw["config"][0]["mask"] = 1;
  ASSERT_TRUE(MonitorQueue::Upsert(MonitorQueue(raw), "r", MONITOR_QUEUE_TYPE_ETC_DIR));
  EXPECT_EQ(RunTool("get --json $(printf 'caf\\351-q') r", "", &out, &err), 0) << err;
  EXPECT_THAT(out, ::testing::HasSubstr(R"("caf\udce9-q")"));
  if (access("/usr/bin/python3", X_OK) == 0) {  // a strict reader, where there is one
    EXPECT_EQ(system("python3 -c 'import json,sys; json.loads(sys.stdin.read())' </tmp/out"), 0);
  }
  EXPECT_EQ(RunTool("upsert r", out, &out, &err), 0) << err;
  std::vector<MonitorQueue> stored;
  ASSERT_TRUE(MonitorQueue::List(stored, "r", MONITOR_QUEUE_TYPE_ETC_DIR));
  ASSERT_EQ(stored.size(), 1u);
  EXPECT_EQ(stored[0]._name, "caf\xe9-q");
  ASSERT_EQ(stored[0]._configs.size(), 1u);
  EXPECT_EQ(stored[0]._configs[0]._path, "/d\xff");
}

TEST(ZorvnotifyctlTest, RefusesSetUserIdAndReportsABusyStore) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  const std::string queue = WatchingPath("/a");
  // Installed set-user-ID root: run as real user 1000 with effective and
  // saved user id 0, a queue to store on standard input.
  std::ofstream("/tmp/in") << queue;
  const auto set_user_id = [] {
    const int in = open("/tmp/in", O_RDONLY | O_CLOEXEC);
    return in >= 0 && dup2(in, 0) == 0 && setresuid(1000, 0, 0) == 0;
  };
  zorv_test::ChildProcess refused({ZORVNOTIFYCTL_PATH, "upsert", "q"}, set_user_id, true);
  // Under an emulator the wrapper shell drops the effective id first: the
  // tool then sees a plain non-root caller, refused the same way.
  EXPECT_THAT(refused.Read(), ::testing::HasSubstr("must be run as root (real user id 1000)"));
  EXPECT_EQ(refused.Stop(0), 77);
  EXPECT_NE(access("/usr/zorv", F_OK), 0) << "the set-user-ID tool reached the library";
  EXPECT_EQ(zorv_test::ChildProcess({ZORVNOTIFYCTL_PATH, "--version"}, set_user_id).Stop(0), 0);
  std::string out, err;

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
  EXPECT_EQ(RunTool("delete q q </dev/null >/dev/full", "", &out, &err), 0) << err;
  EXPECT_THAT(err, ::testing::HasSubstr("the change is stored, but its report could not"));
  // A service manager that fails is said in words; the change stays.
  zorv_test::SetSystemctlExitStatus(1);
  EXPECT_EQ(RunTool("upsert q", queue, &out, &err), 0) << err;
  EXPECT_THAT(err, ::testing::HasSubstr("the change is stored, but the service manager could not "
                                        "be asked to start or stop zorvnotifyd"));

  // Something other than a file planted at the lock's fixed path: nobody
  // holds the lock, so the writer says what is there at once, without retrying.
  const char* lock_path = "/tmp/zorvnotifyd_monitor_q.lock";
  ASSERT_EQ(unlink(lock_path), 0);
  ASSERT_EQ(symlink("/nowhere", lock_path), 0);
  ASSERT_EQ(lchown(lock_path, 1000, 1000), 0);
  EXPECT_EQ(RunTool("upsert q", queue, &out, &err), 1);
  EXPECT_THAT(err, ::testing::HasSubstr("/tmp/zorvnotifyd_monitor_q.lock is a symbolic link "
                                        "(owner uid 1000"));
  EXPECT_THAT(err, ::testing::HasSubstr("nobody holds the store lock; root should remove it"));
  ASSERT_EQ(unlink(lock_path), 0);
  ASSERT_EQ(mkdir(lock_path, 0755), 0);
  EXPECT_EQ(RunTool("delete q q", "", &out, &err), 1);
  EXPECT_THAT(err, ::testing::HasSubstr("lock is a directory (owner uid 0, user root)"));
  ASSERT_EQ(rmdir(lock_path), 0);
}

TEST(ZorvnotifyctlTest, WatchAndStatusAskTheDaemon) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  // A socket's directory must be root's and writable by root alone.
  const std::string socket = "/tmp/zorvrun/ctl.sock";
  std::string out, err;
  EXPECT_EQ(RunTool("--socket " + socket + " watch backup", "", &out, &err), 1);
  EXPECT_THAT(err, ::testing::HasSubstr("zorvnotifyd is not running (no socket at " + socket));

  // A socket whose listener is not root is not the daemon's, whatever it
  // answers: bound by root, then listened on by uid 65534.
  const char* fake = "/tmp/zorvrun/fake.sock";
  zorv_test::ScriptedServer impostor(fake, 65534, {{"{\"reply\":\"status\",\"queues\":4242}\n"}});
  ASSERT_GT(impostor.pid(), 0);
  EXPECT_EQ(RunTool(std::string("--socket ") + fake + " status", "", &out, &err), 1);
  EXPECT_THAT(err, ::testing::HasSubstr("is served by uid 65534 (pid " +
                                        std::to_string(impostor.pid()) + "), not by root"));
  EXPECT_EQ(out.find("4242"), std::string::npos) << out;

  ASSERT_EQ(std::system("rm -rf /tmp/wd && mkdir /tmp/wd"), 0);
  const Json::Value queue = Parse(R"({"queue": "backup", "config": [{"path": "/tmp/wd", "mask": )" +
                                  std::to_string(IN_CREATE) + "}]}");
  ASSERT_TRUE(MonitorQueue::Upsert(MonitorQueue(queue), "nas", MONITOR_QUEUE_TYPE_ETC_DIR));
  zorv_test::ChildProcess daemon({ZORVNOTIFYD_PATH, "--socket", socket}, nullptr, true);
  ASSERT_THAT(daemon.WaitFor("ready:"), ::testing::HasSubstr("for 1 queues"));

  // Its first line comes once the subscription is in place; the record of
  // the daemon's first start asks for a rescan of the tree.
  zorv_test::ChildProcess watch(
      {ZORVNOTIFYCTL_PATH, "--since", "0", "--socket", socket, "watch", "backup"}, nullptr, true);
  EXPECT_THAT(watch.Read(), ::testing::MatchesRegex(
                                "watching backup: etc/nas \\(last #1\\); journal [0-9a-f]{32}"));
  EXPECT_EQ(watch.Read(), "backup [etc/nas] #1 RESCAN /tmp/wd (what changed there is not known)");
  std::ofstream("/tmp/wd/new").flush();
  EXPECT_EQ(watch.Read(), "backup [etc/nas] #2 IN_CREATE /tmp/wd/new");
  std::ofstream("/tmp/wd/b\xff").flush();  // named by its escape, as valid UTF-8
  EXPECT_EQ(watch.Read(), "backup [etc/nas] #3 IN_CREATE /tmp/wd/b\\udcff");
  EXPECT_EQ(watch.Stop(SIGINT), 0);

  // Kept records come first with --since; the watch outlives the daemon
  // and follows it again across a restart.
  zorv_test::ChildProcess json(
      {ZORVNOTIFYCTL_PATH, "--json", "--since", "0", "--socket", socket, "watch", "backup", "nas"},
      nullptr, true);
  EXPECT_EQ(Parse(json.Read())["reply"], "subscribe");
  EXPECT_EQ(Parse(json.Read())["rescan"], "/tmp/wd");
  const Json::Value event = Parse(json.Read());
  EXPECT_EQ(event["seq"], 2);
  EXPECT_EQ(event["path"], "/tmp/wd/new");
  EXPECT_THAT(json.Read(), ::testing::HasSubstr(R"("path":"/tmp/wd/b\udcff")"));
  EXPECT_EQ(RunTool("--socket " + socket + " status", "", &out, &err), 0) << err;
  EXPECT_THAT(out, ::testing::ContainsRegex("\nqueues +1\n(.*\n)*state +ok\n"));
  // A tree that is not a mount point stays with inotify by default
  // (under qemu-user there is no fanotify at all), and the table says why.
  EXPECT_THAT(
      out, ::testing::ContainsRegex("\n/tmp/wd  inotify  (it is not a mount point \\(|the kernel "
                                    "has no fanotify\n)"));
  EXPECT_THAT(out, ::testing::ContainsRegex("\nbackup \\[etc/nas\\] +1 +3 +[0-9]+ +ok\n"));
  EXPECT_EQ(daemon.Stop(SIGTERM), 0);
  EXPECT_EQ(json.Read(),
            "zorvnotifyctl: zorvnotifyd went away (the daemon closed the connection); "
            "following again once it is back");

  // Across a restart --since resumes where the watch stopped.
  zorv_test::ChildProcess again({ZORVNOTIFYD_PATH, "--socket", socket}, nullptr, true);
  ASSERT_THAT(again.WaitFor("ready:"), ::testing::HasSubstr("for 1 queues"));
  zorv_test::ChildProcess resumed(
      {ZORVNOTIFYCTL_PATH, "--since", "2", "--socket", socket, "watch", "backup"}, nullptr, true);
  EXPECT_THAT(resumed.Read(), ::testing::HasSubstr("watching backup"));
  EXPECT_EQ(resumed.Read(), "backup [etc/nas] #3 IN_CREATE /tmp/wd/b\\udcff");
  EXPECT_EQ(resumed.Stop(SIGINT), 0);
  EXPECT_EQ(json.Read(), "zorvnotifyctl: zorvnotifyd is back; following again");
  EXPECT_EQ(json.Stop(SIGINT), 0);
  EXPECT_EQ(again.Stop(SIGTERM), 0);
}

// Files created in an order other than their names' (tmpfs lists the
// newest first), one named like a backup copy, and the other two
// configuration directories missing on a read-only /usr.
TEST(ZorvnotifyctlTest, ReadsFilesInNameOrderAndAReadOnlyUsrWithWarnings) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  ASSERT_EQ(std::system("mkdir -p -m 0700 /usr/zorv/etc/zorvnotifyd"), 0);
  const std::vector<std::string> names = {"a", "m", "nas.bak", "p", "z"};
  for (const char* file : {"m", "z", "a", "nas.bak", "w"}) {
    std::ofstream(std::string("/usr/zorv/etc/zorvnotifyd/") + file)
        << R"([{"queue": ")" << file << R"(", "config": [{"path": "/s/t", "mask": 1}]}])";
  }
  // Files read in part or not at all are named, and the status says so;
  // a file others can write is refused whole.
  std::ofstream("/usr/zorv/etc/zorvnotifyd/p") << R"([{"queue": "p"}, {"queue": ["x"]}])";
  std::ofstream("/usr/zorv/etc/zorvnotifyd/t") << R"([{"queue": "t"}, )";
  std::ofstream("/usr/zorv/etc/zorvnotifyd/o") << "[" << std::string(16 << 20, ' ') << "]";
  ASSERT_EQ(chmod("/usr/zorv/etc/zorvnotifyd/w", 0666), 0);
  Check({{"list w", "", 1,
          "queue file /usr/zorv/etc/zorvnotifyd/w is refused: it is writable by group or others"},
         {"get w w", "", 1, "/usr/zorv/etc/zorvnotifyd/w is refused"},
         // A write would keep the others' queues in a file of root's alone.
         {"upsert w", WatchingPath("/s/t"), 1, "/usr/zorv/etc/zorvnotifyd/w is refused"},
         {"delete w w", "", 1, "/usr/zorv/etc/zorvnotifyd/w is refused"},
         {"list a", "", 0, ""}});
  ASSERT_EQ(chown("/usr/zorv/etc/zorvnotifyd/a", 1000, 0), 0);
  ASSERT_EQ(chmod("/usr/zorv", 0775), 0);
  Check(
      {{"list a", "", 1, "zorvnotifyd/a is refused: it belongs to uid 1000"},
       {"list m", "", 1, "m is refused: its directory /usr/zorv is writable by group or others"}});
  ASSERT_EQ(chown("/usr/zorv/etc/zorvnotifyd/a", 0, 0), 0);
  ASSERT_EQ(chmod("/usr/zorv", 0755), 0);
  // Every catalogue command loads through the same reader; one stands for all.
  std::string out, err;
  EXPECT_EQ(RunTool("catalogue --json", "", &out, &err, zorv_test::PrivateReadOnlyUsr), 1) << err;
  for (const char* line :
       {"queue file etc/p could not be read completely: a queue in it has a value of the wrong "
        "type",
        "queue file etc/t could not be read completely: not valid JSON",
        "etc/o could not be read completely: too large (16777218 bytes, more than the 16 MiB a "
        "queue file may hold)",
        "queue file /usr/zorv/etc/zorvnotifyd/w is refused: it is writable by group or others",
        "warning: the configuration directory /usr/local/etc/zorvnotifyd is missing and could "
        "not be created; the local-etc type counts as empty",
        "warning: queue file etc/nas.bak looks like a backup copy, and is loaded like any queue "
        "file: remove it or move it out of the directory"}) {
    EXPECT_THAT(err, ::testing::HasSubstr(line));
  }
  std::vector<std::string> listed;
  for (const Json::Value& queue : Parse(out)) listed.push_back(queue["queue"].asString());
  EXPECT_EQ(listed, names);
  EXPECT_NE(access("/usr/zorv/share", F_OK), 0);
  // A save that cannot be written says why.
  std::ofstream("/tmp/q.json") << R"({"queue": "q", "config": []})";
  EXPECT_EQ(RunTool("upsert a /tmp/q.json", "", &out, &err, zorv_test::PrivateReadOnlyUsr), 1);
  EXPECT_THAT(
      err, ::testing::HasSubstr("the file system holding /usr/zorv/etc/zorvnotifyd is read-only"));
}

}  // namespace
