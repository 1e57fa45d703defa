// Worker thread: start/stop and their log lines, refusals without a signal,
// delivery of actions and their text, one request in flight at a time.

#include "thread.h"

#include <dlfcn.h>
#include <sched.h>
#include <signal.h>
#include <syslog.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <string>
#include <thread>

#include <gtest/gtest.h>

#include "support/syslog_capture.h"

using ZORV::ZORVNOTIFYD::Thread;

namespace {

// The library's pthread_kill and pthread_create calls land in the
// definitions below (the test exports its symbols): requests are counted and
// failures injected, then the call is forwarded.
std::atomic<int> g_kills{0};
std::atomic<int> g_fail_kill{0};
std::atomic<int> g_fail_create{0};

template <typename Fn>
Fn Next(const char* name) {
  return reinterpret_cast<Fn>(dlsym(RTLD_NEXT, name));
}

}  // namespace

extern "C" int pthread_kill(pthread_t tid, int sig) noexcept {
  static const auto real = Next<int (*)(pthread_t, int)>("pthread_kill");
  if (sig != SIGRTMAX - 1) return real(tid, sig);
  ++g_kills;
  const int err = g_fail_kill.exchange(0);
  return err != 0 ? err : real(tid, sig);
}

extern "C" int pthread_create(pthread_t* tid, const pthread_attr_t* attr, void* (*fn)(void*),
                              void* arg) noexcept {
  static const auto real =
      Next<int (*)(pthread_t*, const pthread_attr_t*, void* (*)(void*), void*)>("pthread_create");
  const int err = g_fail_create.exchange(0);
  return err != 0 ? err : real(tid, attr, fn, arg);
}

namespace {

// What the last action saw; written in signal context, so plain stores only.
struct Seen {
  std::atomic<int> calls{0};
  pthread_t thread{};
  Thread* target = nullptr;
  const char* ptr = nullptr;
  char text[64] = {};
} g_seen;

void Record(Thread* target, char* text) {
  g_seen.thread = pthread_self();
  g_seen.target = target;
  g_seen.ptr = text;
  strncpy(g_seen.text, text != nullptr ? text : "", sizeof(g_seen.text) - 1);
  ++g_seen.calls;
}

// Run yields instead of sleeping: ThreadSanitizer's runtime can drop a signal
// that arrives while its thread sleeps in an intercepted call.
class Looper : public Thread {
 public:
  ~Looper() override { Stop(); }
  int Run() override {
    while (!_stop) sched_yield();
    return 0;
  }
};

class OneShot : public Thread {
 public:
  int Run() override { return 0; }
};

// Stops itself from Run: the join of its own thread fails.
class SelfStopper : public Thread {
 public:
  int Run() override {
    stopped = Stop();
    return 0;
  }
  bool stopped = true;
};

class ThreadTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { ASSERT_TRUE(Thread::InitThreadLock()); }
  static void TearDownTestSuite() { Thread::DestroyThreadLock(); }
  void SetUp() override {
    zorv_test::ClearLogs();
    g_seen.calls = 0;
  }
  void TearDown() override { ZORV::ZORVNOTIFYD::LOG_LEVEL = 3; }
};

// Checks |line| is "thread:<line> <message><arg>" logged with |format|.
void ExpectLine(const zorv_test::LogLine& line, const char* format, const std::string& message) {
  EXPECT_EQ(LOG_ERR, line.priority);
  EXPECT_EQ(format, line.format);
  EXPECT_EQ(0u, line.text.rfind("thread:", 0)) << line.text;
  const std::string tail = " " + message;
  EXPECT_EQ(line.text.size() - tail.size(), line.text.rfind(tail)) << line.text;
}

TEST_F(ThreadTest, StartStopLogTheSameIdAtLevel7AndASecondStopSendsNothing) {
  ZORV::ZORVNOTIFYD::LOG_LEVEL = 7;
  Looper t;
  ASSERT_TRUE(t.Start());
  const std::string id = std::to_string(static_cast<unsigned long>(t._tid));
  EXPECT_TRUE(t.Stop());
  const int kills = g_kills;
  EXPECT_FALSE(t.Stop());
  EXPECT_EQ(kills, g_kills);
  const auto logs = zorv_test::CapturedLogs();
  ASSERT_EQ(2u, logs.size()) << zorv_test::DumpLogs();
  ExpectLine(logs[0], "%s:%d thread start %lu", "thread start " + id);
  ExpectLine(logs[1], "%s:%d thread stop %lu", "thread stop " + id);

  ZORV::ZORVNOTIFYD::LOG_LEVEL = 8;
  ASSERT_TRUE(t.Start());
  EXPECT_TRUE(t.Stop());
  EXPECT_EQ(2u, zorv_test::CapturedLogs().size()) << zorv_test::DumpLogs();
}

TEST_F(ThreadTest, IdleFailedAndEndedThreadsAreNeverSignalled) {
  const int kills = g_kills;
  OneShot idle;
  EXPECT_FALSE(idle.DoAction(Record, "x"));
  EXPECT_FALSE(idle.Stop());

  g_fail_create = EAGAIN;
  Looper failed;
  EXPECT_FALSE(failed.Start());
  EXPECT_EQ(pthread_t{}, failed._tid);
  EXPECT_FALSE(failed.Stop());
  const auto logs = zorv_test::CapturedLogs();
  ASSERT_EQ(1u, logs.size()) << zorv_test::DumpLogs();
  ExpectLine(logs[0], "%s:%d pthread_create failed, reason=%m",
             std::string("pthread_create failed, reason=") + strerror(EAGAIN));

  OneShot ended;
  ASSERT_TRUE(ended.Start());
  while (!ended._stop) usleep(100);
  EXPECT_FALSE(ended.Stop());
  EXPECT_FALSE(ended.DoAction(Record, nullptr));
  EXPECT_EQ(kills, g_kills);
  EXPECT_EQ(0, g_seen.calls);
  EXPECT_EQ(0, pthread_join(ended._tid, nullptr));  // still joinable: Stop left it alone
}

TEST_F(ThreadTest, NullActionAndRaisedStopRefuseWithoutTakingTheSlot) {
  Looper t;
  ASSERT_TRUE(t.Start());
  const int kills = g_kills;
  // Held here: a refusal that took the slot first would deadlock.
  ASSERT_EQ(0, pthread_mutex_lock(&Thread::_lock));
  EXPECT_FALSE(t.DoAction(nullptr, "x"));
  t._stop = true;
  EXPECT_FALSE(t.DoAction(Record, "x"));
  EXPECT_EQ(nullptr, Thread::_this);
  ASSERT_EQ(0, pthread_mutex_unlock(&Thread::_lock));
  EXPECT_EQ(kills, g_kills);
  EXPECT_EQ(0, pthread_join(t._tid, nullptr));
}

TEST_F(ThreadTest, TextReachesTheWorkerAsACopyAndNoTextGivesNullAfterAFailedSend) {
  Looper t;
  ASSERT_TRUE(t.Start());
  const char text[] = "queue changed";
  ASSERT_TRUE(t.DoAction(Record, text));
  EXPECT_EQ(1, g_seen.calls);  // the action has run when DoAction returns
  EXPECT_TRUE(pthread_equal(t._tid, g_seen.thread));
  EXPECT_EQ(&t, g_seen.target);
  EXPECT_STREQ(text, g_seen.text);
  EXPECT_NE(text, g_seen.ptr);
  EXPECT_EQ(nullptr, Thread::_data);

  g_fail_kill = ESRCH;
  EXPECT_FALSE(t.DoAction(Record, "lost"));
  EXPECT_EQ(1, g_seen.calls);
  const auto logs = zorv_test::CapturedLogs();
  ASSERT_EQ(1u, logs.size()) << zorv_test::DumpLogs();
  ExpectLine(logs[0], "%s:%d pthread_kill failed, reason=%s",
             std::string("pthread_kill failed, reason=") + strerror(ESRCH));
  struct sigaction now = {};
  ASSERT_EQ(0, sigaction(SIGRTMAX - 1, nullptr, &now));
  EXPECT_EQ(SIG_DFL, now.sa_handler);
  EXPECT_EQ(nullptr, Thread::_data);
  EXPECT_EQ(nullptr, Thread::_action);

  ASSERT_TRUE(t.DoAction(Record, nullptr));
  EXPECT_EQ(2, g_seen.calls);
  EXPECT_EQ(nullptr, g_seen.ptr);
  EXPECT_TRUE(pthread_equal(t._tid, g_seen.thread));
}

std::atomic<bool> g_holding{false};
std::atomic<bool> g_release{false};
std::atomic<bool> g_overlap{false};

void Hold(Thread*, char*) {
  g_holding = true;
  while (!g_release) {
  }
  g_holding = false;
}

void MarkOverlap(Thread* target, char* text) {
  if (g_holding) g_overlap = true;
  Record(target, text);
}

TEST_F(ThreadTest, RequestsOnTwoObjectsAreSerialised) {
  Looper a;
  Looper b;
  ASSERT_TRUE(a.Start());
  ASSERT_TRUE(b.Start());
  std::thread first([&a] { EXPECT_TRUE(a.DoAction(Hold, nullptr)); });
  while (!g_holding) usleep(100);
  const int busy = pthread_mutex_trylock(&Thread::_lock);
  if (busy == 0) pthread_mutex_unlock(&Thread::_lock);
  EXPECT_EQ(EBUSY, busy);  // the slot stays taken while the action runs
  std::thread second([&b] { EXPECT_TRUE(b.DoAction(MarkOverlap, "b")); });
  usleep(20000);  // time for a request that does not wait to overtake
  g_release = true;
  first.join();
  second.join();
  EXPECT_FALSE(g_overlap);
  EXPECT_EQ(1, g_seen.calls);
  EXPECT_TRUE(pthread_equal(b._tid, g_seen.thread));
}

TEST_F(ThreadTest, StopRightAfterStartAlwaysReturns) {
  for (int i = 0; i < 200; ++i) {
    Looper looper;
    ASSERT_TRUE(looper.Start());
    ASSERT_TRUE(looper.Stop()) << i;
    // Racing Run's own return: delivered and joined, or refused and joinable.
    OneShot shot;
    ASSERT_TRUE(shot.Start());
    if (!shot.Stop()) {
      ASSERT_EQ(0, pthread_join(shot._tid, nullptr)) << i;
    }
  }
}

TEST_F(ThreadTest, StopFromTheWorkerItselfFailsToJoin) {
  SelfStopper t;
  ASSERT_TRUE(t.Start());
  ASSERT_EQ(0, pthread_join(t._tid, nullptr));
  EXPECT_FALSE(t.stopped);
  const auto logs = zorv_test::CapturedLogs();
  ASSERT_EQ(1u, logs.size()) << zorv_test::DumpLogs();
  ExpectLine(logs[0], "%s:%d pthread_join failed, reason=%m",
             std::string("pthread_join failed, reason=") + strerror(EDEADLK));
}

}  // namespace
