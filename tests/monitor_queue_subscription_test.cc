// MonitorQueueSubscription against the real daemon (events in order, a
// restart resumed without a repeat or a gap) and against scripted servers
// (what the daemon may say, a reset journal, an overlong line, a peer that
// is not root).

#include <poll.h>
#include <signal.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <json/json.h>

#include "monitor_queue.h"
#include "monitor_queue_subscription.h"
#include "support/allocation_count.h"
#include "support/child_process.h"
#include "support/sandbox.h"

namespace {

using namespace ZORV::ZORVNOTIFYD;  // NOLINT
using Lines = std::vector<std::string>;

constexpr const char* kSocket = "/tmp/zorvrun/zorvnotifyd.sock";

// |event| as "KIND seq path" ("MISSED n" for a missed notice), with the
// queue's identity when it is not queue "q" of etc file "f".
std::string Text(const MonitorQueueEvent& e) {
  static const char* const kKinds[] = {"EVENT",      "LOST",   "REMOVED",
                                       "REGISTERED", "MISSED", "RESCAN"};
  std::string text = kKinds[e._kind];
  if (e._queue != "q" || e._type != MONITOR_QUEUE_TYPE_ETC_DIR || e._file != "f") {
    text += " [" + e._queue + " " + std::to_string(e._type) + " " + e._file + "]";
  }
  if (e._kind == MonitorQueueEvent::MISSED) return text + " " + std::to_string(e._missed);
  text += " " + std::to_string(e._seq) + " " + e._path;
  if (e._kind == MonitorQueueEvent::EVENT) text += " " + std::to_string(e._mask);
  if (e._offline) text += " offline";
  return text;
}

// The next event as Text, or "none: LastError" when none came within 10 s.
std::string Next(MonitorQueueSubscription& sub, int timeout_ms = 10000) {
  MonitorQueueEvent event;
  return sub.Next(event, timeout_ms) ? Text(event) : "none: " + sub.LastError();
}

bool Readable(int fd, int timeout_ms) {
  struct pollfd p = {fd, POLLIN, 0};
  return poll(&p, 1, timeout_ms) == 1;
}

bool Touch(const std::string& path) { return static_cast<bool>(std::ofstream(path).flush()); }

TEST(SubscriptionTest, FollowsItsQueueInOrderAcrossADaemonRestart) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  ASSERT_EQ(std::system("rm -rf /tmp/sub && mkdir -p /tmp/sub/q /tmp/sub/o"), 0);
  for (const char* name : {"q", "o"}) {
    Json::Value json;
    json["queue"] = name;
    json["config"][0]["path"] = std::string("/tmp/sub/") + name;
    json["config"][0]["mask"] = IN_CREATE;
    ASSERT_TRUE(MonitorQueue::Upsert(MonitorQueue(json), "f", MONITOR_QUEUE_TYPE_ETC_DIR));
  }
  const Lines args = {ZORVNOTIFYD_PATH, "--socket", kSocket};
  auto daemon = std::make_unique<zorv_test::ChildProcess>(args, nullptr, true);
  ASSERT_FALSE(daemon->WaitFor("ready:").empty());

  MonitorQueueSubscription sub(kSocket);
  ASSERT_TRUE(sub.Subscribe("q")) << sub.LastError();
  EXPECT_TRUE(sub.Connected());
  const std::string journal = sub.Journal();
  EXPECT_EQ(journal.size(), 32u);
  EXPECT_FALSE(Readable(sub.Fd(), 0));
  const std::string create = " " + std::to_string(IN_CREATE);
  // Record 1 is the first start's rescan of the tree, made before this
  // subscription.
  for (const char* name : {"1", "2", "3"}) ASSERT_TRUE(Touch(std::string("/tmp/sub/q/") + name));
  ASSERT_TRUE(Touch("/tmp/sub/o/x"));  // another queue's
  ASSERT_TRUE(Readable(sub.Fd(), 10000));
  usleep(100000);  // all three lines arrive, and are read at once
  EXPECT_EQ(Next(sub), "EVENT 2 /tmp/sub/q/1" + create);
  // Lines already read keep the descriptor readable.
  EXPECT_TRUE(Readable(sub.Fd(), 0));
  EXPECT_EQ(Next(sub), "EVENT 3 /tmp/sub/q/2" + create);
  EXPECT_EQ(Next(sub), "EVENT 4 /tmp/sub/q/3" + create);
  EXPECT_FALSE(Readable(sub.Fd(), 0));
  EXPECT_EQ(Next(sub, 0), "none: timed out");

  // Stopped: Next waits for it; restarted: the numbering goes on, nothing
  // comes twice, the journal stays.
  EXPECT_EQ(daemon->Stop(SIGTERM), 0);
  EXPECT_EQ(Next(sub, 300).find("none: timed out while reconnecting: "), 0u);
  EXPECT_FALSE(sub.Connected());
  daemon = std::make_unique<zorv_test::ChildProcess>(args, nullptr, true);
  ASSERT_FALSE(daemon->WaitFor("ready:").empty());
  EXPECT_TRUE(Readable(sub.Fd(), 10000));  // a reconnection is due
  EXPECT_EQ(Next(sub, 0), "none: timed out");
  EXPECT_TRUE(sub.Connected());
  for (const char* name : {"4", "5"}) ASSERT_TRUE(Touch(std::string("/tmp/sub/q/") + name));
  EXPECT_EQ(Next(sub), "EVENT 5 /tmp/sub/q/4" + create);
  EXPECT_EQ(Next(sub), "EVENT 6 /tmp/sub/q/5" + create);
  EXPECT_EQ(sub.Journal(), journal);
  // Kept records after a number, which come with the reply: read with it,
  // and the descriptor says so.
  MonitorQueueSubscription back(kSocket);
  ASSERT_TRUE(back.Subscribe("q", 4)) << back.LastError();
  EXPECT_TRUE(Readable(back.Fd(), 0));
  EXPECT_EQ(Next(back, 0), "EVENT 5 /tmp/sub/q/4" + create);
  EXPECT_EQ(Next(back, 0), "EVENT 6 /tmp/sub/q/5" + create);
  EXPECT_FALSE(Readable(back.Fd(), 0));

  sub.Close();
  EXPECT_EQ(sub.Fd(), -1);
  EXPECT_EQ(Next(sub, 0), "none: closed");
  EXPECT_FALSE(sub.Subscribe("q"));
  EXPECT_EQ(daemon->Stop(SIGTERM), 0);
}

Lines ReadLines(const char* path) {
  Lines lines;
  std::ifstream in(path);
  for (std::string line; std::getline(in, line);) lines.push_back(line);
  return lines;
}

// |lines|, each ended by a newline.
std::string Join(const Lines& lines) {
  std::string text;
  for (const std::string& line : lines) text += line + "\n";
  return text;
}

// Every kind of line the daemon writes, strictly read; members it may add
// ignored; a repeat dropped; resumption after the last record delivered; a
// new journal told with RESCAN; an overlong line ends the connection; and
// a peer that is not root is never trusted.
TEST(SubscriptionTest, ReadsWhatTheDaemonSaysAndResumesOrRescans) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  const std::string head = R"({"queue":"q","type":"etc","file":"f",)";
  const std::string j1(32, 'a'), j2(32, 'b');
  std::string events;
  for (int seq = 3; seq < 203; ++seq) {
    events += head + "\"seq\":" + std::to_string(seq) + R"(,"path":"/p/)" +
              std::to_string(seq % 10) + R"(","mask":256})" + "\n";
  }
  const std::vector<Lines> script = {
      {R"({"reply":"subscribe","run":"r","journal":")" + j1 +
       R"(","queue":"q","queues":[{"type":"etc","file":"f","seq":2,"new":[1,{}]}]})"
       "\n" +
       events +
       Join({head + R"("seq":150,"path":"/again","mask":256})", head + R"("missed":7})",
             head + R"("x":{"y":[1,-2.5e3,null,"\u00e9"]},"seq":203,"lost":true})",
             head + R"("seq":204,"path":"/caf\udce9 \ud83d\ude00\n","mask":2,"offline":true})",
             head + R"("seq":"205","path":"/b","mask":1})",
             head + R"("seq":205,"path":"/b","mask":4294967296})",
             head + R"("seq":205,"path":"/b","seq":206,"mask":1})",
             head + R"("seq":205,"path":"/\udc41","mask":1})",
             head + R"("seq":205,"path":"/b","path_b64":"L3X=","mask":1})",
             R"({"error":"too many"})",
             R"({"queue":"r","type":"share","file":"g","seq":1,"removed":true})",
             R"({"queue":"r","type":"local-etc","file":"g","seq":1,)"
             R"("rescan":"/t","rescan_b64":"L3Xp"})",
             std::string((1 << 20) + 1, 'x'), head + R"("seq":300,"path":"/lost","mask":1})"})},
      {R"({"reply":"status","journal":")" + j1 + "\"}\n",
       Join({R"({"reply":"subscribe","queues":[]})", head + R"("seq":204,"path":"/x","mask":1})",
             head + R"("seq":205,"path":"/y","mask":1})"}),
       Join({R"({"reply":"subscribe","queues":[]})"})},
      {R"({"reply":"status","journal":")" + j2 + "\"}\n",
       Join({R"({"reply":"subscribe","queues":[{"type":"etc","file":"f","seq":9}]})",
             head + R"("seq":10,"path":"/z","mask":1})"})},
  };
  const char* fake = "/tmp/zorvrun/fake.sock";
  const char* log = "/tmp/zorvrun/fake.log";
  zorv_test::ScriptedServer server(fake, 0, script, log);
  ASSERT_GT(server.pid(), 0);
  MonitorQueueSubscription sub(fake);
  ASSERT_TRUE(sub.Subscribe("q")) << sub.LastError();
  EXPECT_EQ(sub.Journal(), j1);
  for (int seq = 3; seq < 13; ++seq) {
    EXPECT_EQ(Next(sub),
              "EVENT " + std::to_string(seq) + " /p/" + std::to_string(seq % 10) + " 256");
  }
  // Warmed up: no allocation per event.
  MonitorQueueEvent event;
  const long before = zorv_test::Allocations();
  int count = 0;
  for (int seq = 13; seq < 203; ++seq)
    count += sub.Next(event, 10000) && event._seq == uint64_t(seq);
  EXPECT_EQ(zorv_test::Allocations() - before, 0);
  EXPECT_EQ(count, 190);
  EXPECT_EQ(Next(sub), "MISSED 7");  // after the repeat of 150, dropped
  EXPECT_EQ(Next(sub), "LOST 203 ");
  EXPECT_EQ(Next(sub), "EVENT 204 /caf\xe9 \xf0\x9f\x98\x80\n 2 offline");
  // Each malformed line skipped (a string number, a mask beyond 32 bits, a
  // repeated member, a lone surrogate that is no byte, base64 with bits
  // beyond its bytes), the error line told.
  EXPECT_EQ(Next(sub), "REMOVED [r 0 g] 1 ");
  EXPECT_EQ(sub.LastError(), "the daemon says: too many");
  EXPECT_EQ(Next(sub), "RESCAN [r 2 g] 1 /u\xe9");  // the base64 bytes win
  // The overlong line ends the connection; the next resumes after 204 and
  // drops it; then a new journal: RESCAN for each followed queue, and the
  // new numbering.
  EXPECT_EQ(Next(sub), "EVENT 205 /y 1");
  EXPECT_EQ(Next(sub), "RESCAN 0 ");
  EXPECT_EQ(Next(sub), "RESCAN [r 0 g] 0 ");
  EXPECT_EQ(Next(sub), "RESCAN [r 2 g] 0 ");
  EXPECT_EQ(Next(sub), "EVENT 10 /z 1");
  EXPECT_EQ(sub.Journal(), j2);
  EXPECT_EQ(ReadLines(log),
            Lines({R"(0 {"request":"subscribe","queue":"q"})", R"(1 {"request":"status"})",
                   R"(1 {"request":"subscribe","queue":"q","type":"etc","file":"f","since":204})",
                   R"(1 {"request":"subscribe","queue":"q"})", R"(2 {"request":"status"})",
                   R"(2 {"request":"subscribe","queue":"q"})"}));
  server.Stop();

  // Served by nobody: refused before a byte is read.
  zorv_test::ScriptedServer impostor(fake, 65534, {{"{\"reply\":\"subscribe\",\"queues\":[]}\n"}});
  ASSERT_GT(impostor.pid(), 0);
  MonitorQueueSubscription refused(fake);
  EXPECT_FALSE(refused.Subscribe("q"));
  EXPECT_EQ(refused.LastError(), std::string(fake) + " is served by uid 65534 (pid " +
                                     std::to_string(impostor.pid()) + "), not by root");
  EXPECT_FALSE(refused.Connected());
}

}  // namespace
