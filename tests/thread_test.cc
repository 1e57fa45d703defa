// Worker thread: start and stop with their log lines, actions and their text
// delivered on the worker one request at a time, refusals that send no signal.

#include "thread.h"

#include <dlfcn.h>
#include <sched.h>
#include <signal.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <string>
#include <thread>

#include <gtest/gtest.h>

#include "support/syslog_capture.h"

using ZORV::ZORVNOTIFYD::Thread;

// The library's pthread_kill and pthread_create calls land in the definitions
// below (the test exports its symbols): request signals are counted, failures
// injected on demand, and every call otherwise forwarded.
static std::atomic<int> g_kills{0}, g_fail_kill{0}, g_fail_create{0};

extern "C" int pthread_kill(pthread_t tid, int sig) noexcept {
  static const auto real =
      reinterpret_cast<decltype(&pthread_kill)>(dlsym(RTLD_NEXT, "pthread_kill"));
  const int err = sig == SIGRTMAX - 1 ? (++g_kills, g_fail_kill.exchange(0)) : 0;
  return err != 0 ? err : real(tid, sig);
}

extern "C" int pthread_create(pthread_t* tid, const pthread_attr_t* attr, void* (*fn)(void*),
                              void* arg) noexcept {
  static const auto real =
      reinterpret_cast<decltype(&pthread_create)>(dlsym(RTLD_NEXT, "pthread_create"));
  const int err = g_fail_create.exchange(0);
  return err != 0 ? err : real(tid, attr, fn, arg);
}

namespace {

// What the last action saw; written in signal context, so plain stores only.
std::atomic<int> g_calls{0};
struct Seen {
  pthread_t thread;
  Thread* target;
  const char* ptr;
  char text[64];
} g_seen;

void Record(Thread* target, char* text) {
  g_seen = {pthread_self(), target, text, {}};
  strncpy(g_seen.text, text != nullptr ? text : "", sizeof g_seen.text - 1);
  ++g_calls;
}

// Loops until stopped, returns at once, or calls Stop on itself.  The loop
// yields, never sleeps: ThreadSanitizer's runtime drops a signal that arrives
// while its thread sleeps in an intercepted call, which hung the TSan run.
class Worker : public Thread {
 public:
  enum Kind { kLoop, kReturn, kStopSelf };
  explicit Worker(Kind kind = kLoop) : kind_(kind) {}
  ~Worker() override { Stop(); }
  int Run() override {
    if (kind_ == kStopSelf) self_stop = Stop();
    while (kind_ == kLoop && !_stop) sched_yield();
    return 0;
  }
  const Kind kind_;
  std::atomic<int> self_stop{-1};  // Stop's result on the worker, once it returned
};

// Each captured line as "<priority> <format> = <source>: <message>", the source
// line number left out.
std::string Logs() {
  std::string out;
  for (const auto& l : zorv_test::CapturedLogs())
    out += std::to_string(l.priority) + " " + l.format + " = " +
           l.text.substr(0, l.text.find(':') + 1) + l.text.substr(l.text.find(' ')) + "\n";
  return out;
}

// Spins in the worker's signal handler until released.
std::atomic<bool> g_holding{false}, g_release{false};
void Hold(Thread*, char*) {
  while (!g_release) g_holding = true;
}

// Sends SIGRTMAX-1 to this thread, which has it before pthread_kill returns.
// Empty when it arrived, else what went wrong: every request to a worker
// travels as that signal, and qemu-user 7.2 does not deliver the highest
// real-time signals to its guest (its pthread_kill fails with EINVAL).
std::atomic<bool> g_probe_arrived{false};
std::string RequestSignalProblem() {
  const int signo = SIGRTMAX - 1;
  struct sigaction probe = {}, old = {};
  probe.sa_handler = [](int) { g_probe_arrived = true; };
  if (sigaction(signo, &probe, &old) != 0) return std::string("sigaction: ") + strerror(errno);
  const int rc = pthread_kill(pthread_self(), signo);
  sigaction(signo, &old, nullptr);
  const std::string name = "SIGRTMAX-1 (" + std::to_string(signo) + ")";
  if (rc != 0) return "sending " + name + " to a thread failed: " + strerror(rc);
  return g_probe_arrived ? "" : name + " sent to this thread did not arrive";
}

class ThreadTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    ASSERT_TRUE(Thread::InitThreadLock());
    request_signal_problem_ = RequestSignalProblem();
  }
  static void TearDownTestSuite() { Thread::DestroyThreadLock(); }
  void SetUp() override {
    if (!request_signal_problem_.empty()) {
      GTEST_SKIP() << request_signal_problem_
                   << ": this system (qemu-user, for one) does not deliver the worker's request "
                      "signal, so no worker-thread test can run here";
    }
    zorv_test::ClearLogs();
    g_calls = 0;
  }
  void TearDown() override { ZORV::ZORVNOTIFYD::LOG_LEVEL = 3; }
  static inline std::string request_signal_problem_;
};

TEST_F(ThreadTest, ActionsRunOnTheWorkerOneAtATime) {
  Worker t, other;
  ASSERT_TRUE(t.Start() && other.Start());
  // A text reaches the action on the worker as an equal copy elsewhere; the
  // action has run when DoAction returns.
  const char text[] = "queue changed";
  ASSERT_TRUE(t.DoAction(Record, text));
  EXPECT_EQ(g_calls, 1);
  EXPECT_TRUE(pthread_equal(g_seen.thread, t._tid) && g_seen.target == &t);
  EXPECT_STREQ(g_seen.text, text);
  EXPECT_NE(g_seen.ptr, text);

  // A failed send drops its text: the next request without one gives null.
  g_fail_kill = ESRCH;
  EXPECT_FALSE(t.DoAction(Record, "lost"));
  struct sigaction now = {};  // the handler is reset
  EXPECT_TRUE(sigaction(SIGRTMAX - 1, nullptr, &now) == 0 && now.sa_handler == SIG_DFL);
  ASSERT_TRUE(t.DoAction(Record, nullptr));
  EXPECT_EQ(g_calls, 2);
  EXPECT_EQ(g_seen.ptr, nullptr);
  EXPECT_TRUE(pthread_equal(g_seen.thread, t._tid));
  EXPECT_EQ(Thread::_data, nullptr);

  // Two requesters on two objects: the second waits for the first action.
  g_holding = g_release = false;
  std::thread first([&t] { EXPECT_TRUE(t.DoAction(Hold, nullptr)); });
  while (!g_holding) sched_yield();
  std::atomic<bool> asking{false};
  std::thread second([&other, &asking] {
    asking = true;
    EXPECT_TRUE(other.DoAction(Record, "b"));
  });
  while (!asking) sched_yield();
  std::this_thread::sleep_for(std::chrono::milliseconds(20));  // time to overtake
  EXPECT_EQ(g_calls, 2);
  g_release = true;
  first.join();
  second.join();
  EXPECT_EQ(g_calls, 3);
  EXPECT_TRUE(pthread_equal(g_seen.thread, other._tid));
  EXPECT_EQ(Logs(),
            "3 %s:%d pthread_kill failed, reason=%s = thread: pthread_kill failed, reason=" +
                std::string(strerror(ESRCH)) + "\n");
}

// Start and Stop log the same id at LOG_LEVEL 7 only.  Idle, never created,
// joined and ended objects refuse requests without a signal.
TEST_F(ThreadTest, StartStopAndRefusals) {
  Worker idle, failed, joined, ended(Worker::kReturn);
  g_fail_create = EAGAIN;
  EXPECT_FALSE(failed.Start());
  EXPECT_EQ(failed._tid, pthread_t{});
  ZORV::ZORVNOTIFYD::LOG_LEVEL = 7;
  ASSERT_TRUE(joined.Start());
  const std::string id = std::to_string(static_cast<unsigned long>(joined._tid));
  ASSERT_EQ(pthread_mutex_lock(&Thread::_lock), 0);  // a refusal that took it would hang
  EXPECT_FALSE(joined.DoAction(nullptr, "x"));
  ASSERT_EQ(pthread_mutex_unlock(&Thread::_lock), 0);
  ASSERT_TRUE(joined.Stop());
  ZORV::ZORVNOTIFYD::LOG_LEVEL = 8;
  ASSERT_TRUE(ended.Start());
  while (!ended._stop) sched_yield();
  const int kills = g_kills;
  for (Worker* t : {&idle, &failed, &joined, &ended}) {
    EXPECT_FALSE(t->DoAction(Record, "x") || t->Stop());
  }
  EXPECT_EQ(g_kills, kills);
  EXPECT_EQ(pthread_join(ended._tid, nullptr), 0);  // still joinable: Stop left it alone
  EXPECT_EQ(Logs(),
            "3 %s:%d pthread_create failed, reason=%m = thread: pthread_create failed, reason=" +
                std::string(strerror(EAGAIN)) +
                "\n3 %s:%d thread start %lu = thread: thread start " + id +
                "\n3 %s:%d thread stop %lu = thread: thread stop " + id + "\n");
}

// Stop right after Start always returns; Stop called by the worker on itself
// fails to join and logs why.
TEST_F(ThreadTest, StopRightAfterStartAlwaysReturns) {
  for (int i = 0; i < 200; ++i) {
    Worker loop, shot(Worker::kReturn);
    ASSERT_TRUE(loop.Start());
    ASSERT_TRUE(loop.Stop()) << i;
    // Racing Run's own return: delivered and joined, or refused and joinable.
    ASSERT_TRUE(shot.Start());
    ASSERT_TRUE(shot.Stop() || pthread_join(shot._tid, nullptr) == 0) << i;
  }
#if !defined(__SANITIZE_THREAD__)  // TSan's runtime can abort on joining a thread whose
                                   // join of itself failed
  Worker self(Worker::kStopSelf);
  ASSERT_TRUE(self.Start());
  ASSERT_EQ(pthread_join(self._tid, nullptr), 0);
  EXPECT_EQ(self.self_stop, 0);
  EXPECT_EQ(Logs(),
            "3 %s:%d pthread_join failed, reason=%m = thread: pthread_join failed, reason=" +
                std::string(strerror(EDEADLK)) + "\n");
#endif
}

}  // namespace
