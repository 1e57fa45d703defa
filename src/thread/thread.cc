// The worker thread: start, stop, and actions delivered by SIGRTMAX-1.

#include "thread.h"

#include <sched.h>
#include <semaphore.h>
#include <signal.h>
#include <syslog.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "syslog_percent_m.h"

namespace ZORV {
namespace ZORVNOTIFYD {

// The flag and the hand-over state below are touched by the signal handler:
// only lock-free atomics are safe there.
static_assert(sizeof(std::atomic<bool>) == 1, "_stop must be one byte");
static_assert(std::atomic<bool>::is_always_lock_free, "_stop must be lock-free");
static_assert(std::atomic<Thread*>::is_always_lock_free, "the target must be lock-free");
// The start and stop lines print the worker's id with "%lu".
static_assert(sizeof(pthread_t) <= sizeof(unsigned long), "pthread_t must fit an unsigned long");

pthread_mutex_t Thread::_lock = PTHREAD_MUTEX_INITIALIZER;
Thread* Thread::_this = nullptr;
void (*Thread::_action)(Thread*, char*) = nullptr;
char* Thread::_data = nullptr;

namespace {

constexpr const char kSource[] = "thread";

// The signal that carries requests; SIGRTMAX is known only at run time.
int ActionSignal() { return SIGRTMAX - 1; }

// Raised by the requester once the slot is filled and lowered by the handler
// that takes the request.  The release/acquire pair publishes the slot to the
// handler; a handler run without a request in the slot does nothing.
std::atomic<bool> g_armed{false};

// The target of the request being made, from before the requester's last
// look at the target's _stop until the request is finished.  A worker
// leaving Run stays while it is the target, so a request that passed that
// look is always delivered to a live thread.
std::atomic<Thread*> g_target{nullptr};

// The handler's report that the action has returned.  sem_post is
// async-signal-safe; the requester waits with sem_wait.
class Completion {
 public:
  Completion() { sem_init(&sem_, 0, 0); }
  ~Completion() { sem_destroy(&sem_); }
  Completion(const Completion&) = delete;
  Completion& operator=(const Completion&) = delete;

  void Post() { sem_post(&sem_); }
  void Wait() {
    while (sem_wait(&sem_) != 0 && errno == EINTR) {
    }
  }

 private:
  sem_t sem_;
};

Completion g_done;

// Holds the action slot for one request: _lock taken, the slot and the
// delivery target naming |thread|; released in the reverse order.
class SlotHold {
 public:
  explicit SlotHold(Thread* thread) : thread_(thread) {
    thread_->GetThreadLock();
    g_target.store(thread_);
  }
  ~SlotHold() {
    g_target.store(nullptr);
    thread_->ReleaseThreadLock();
  }
  SlotHold(const SlotHold&) = delete;
  SlotHold& operator=(const SlotHold&) = delete;

 private:
  Thread* const thread_;
};

struct FreeDeleter {
  void operator()(char* p) const { free(p); }
};

// Runs as the worker leaves Run, by returning or by unwinding (pthread_exit,
// cancellation): raises _stop so that no further request is accepted, then
// stays while a request accepted earlier is still on its way to this thread.
// After the store it only compares addresses: the owner may destroy the
// object as soon as it sees _stop raised.
class RunnerExit {
 public:
  explicit RunnerExit(Thread* thread) : thread_(thread) {}
  ~RunnerExit() {
    thread_->_stop.store(true);
    // The wait lasts until the pending request's handler has run, a matter
    // of microseconds; yielding rather than sleeping keeps the worker out of
    // blocking calls, where some runtimes (ThreadSanitizer's among them)
    // can drop an arriving signal.
    while (g_target.load() == thread_) sched_yield();
  }
  RunnerExit(const RunnerExit&) = delete;
  RunnerExit& operator=(const RunnerExit&) = delete;

 private:
  Thread* const thread_;
};

}  // namespace

Thread::Thread() : _tid(0), _stop(false) {}

Thread::~Thread() { Stop(); }

bool Thread::Start() {
  // Lowered here, before the worker exists, and never by the worker: a stop
  // delivered before the worker's first instruction is kept.
  _stop.store(false);
  const int rc = pthread_create(&_tid, nullptr, &Thread::ThreadRunner, this);
  if (rc != 0) {
    _tid = 0;
    errno = rc;
    ZORV_PERCENT_M_BEGIN
    syslog(LOG_ERR, "%s:%d pthread_create failed, reason=%m", kSource, __LINE__);
    ZORV_PERCENT_M_END
    return false;
  }
  if (LOG_LEVEL == 7) {
    syslog(LOG_ERR, "%s:%d thread start %lu", kSource, __LINE__, static_cast<unsigned long>(_tid));
  }
  return true;
}

bool Thread::Stop() {
  if (!DoAction(&Thread::ThreadStoper, nullptr)) return false;
  const int rc = pthread_join(_tid, nullptr);
  if (rc != 0) {
    errno = rc;
    ZORV_PERCENT_M_BEGIN
    syslog(LOG_ERR, "%s:%d pthread_join failed, reason=%m", kSource, __LINE__);
    ZORV_PERCENT_M_END
    return false;
  }
  if (LOG_LEVEL == 7) {
    syslog(LOG_ERR, "%s:%d thread stop %lu", kSource, __LINE__, static_cast<unsigned long>(_tid));
  }
  return true;
}

bool Thread::DoAction(void (*action)(Thread*, char*), const char* text) {
  if (action == nullptr) return false;
  if (_stop.load()) return false;
  if (_tid == 0) return false;  // never started: there is no worker to signal

  SlotHold hold(this);
  // The target is published before this look and the worker raises _stop
  // before it looks at the target (both sequentially consistent): either the
  // request is refused here or the worker waits for it.
  if (_stop.load()) return false;

  _action = action;
  std::unique_ptr<char, FreeDeleter> copy(text != nullptr ? strdup(text) : nullptr);
  _data = copy.get();
  g_armed.store(true, std::memory_order_release);

  const int signo = ActionSignal();
  signal(signo, &Thread::ThreadAction);
  const int rc = pthread_kill(_tid, signo);
  if (rc == 0) {
    g_done.Wait();  // the action has run; the copy is freed below, outside the handler
    return true;
  }
  g_armed.store(false);
  char reason[256];
  syslog(LOG_ERR, "%s:%d pthread_kill failed, reason=%s", kSource, __LINE__,
         strerror_r(rc, reason, sizeof(reason)));
  signal(signo, SIG_DFL);
  _data = nullptr;
  _action = nullptr;
  return false;
}

int Thread::GetThreadLock() {
  const int rc = pthread_mutex_lock(&_lock);
  _this = this;
  return rc;
}

int Thread::ReleaseThreadLock() {
  _this = nullptr;
  return pthread_mutex_unlock(&_lock);
}

bool Thread::InitThreadLock() {
  if (pthread_mutex_init(&_lock, nullptr) != 0) {
    syslog(LOG_ERR, "%s:%d pthread_mutex_init failed", kSource, __LINE__);
    return false;
  }
  return true;
}

void Thread::DestroyThreadLock() {
  pthread_mutex_destroy(&_lock);
  if (_data != nullptr) {
    free(_data);
    _data = nullptr;
  }
}

void* Thread::ThreadRunner(void* arg) {
  Thread* const self = static_cast<Thread*>(arg);
  // The worker inherits its creator's signal mask; requests need the signal
  // unblocked here.
  sigset_t action_signal;
  sigemptyset(&action_signal);
  sigaddset(&action_signal, ActionSignal());
  pthread_sigmask(SIG_UNBLOCK, &action_signal, nullptr);

  RunnerExit exit_guard(self);
  self->Run();
  return nullptr;
}

void Thread::ThreadStoper(Thread* target, char* /*text*/) { target->_stop.store(true); }

void Thread::ThreadAction(int /*signo*/) {
  const int saved_errno = errno;
  if (g_armed.exchange(false, std::memory_order_acq_rel)) {
    char* const data = _data;
    void (*const action)(Thread*, char*) = _action;
    Thread* const target = _this;
    _data = nullptr;
    _action = nullptr;
    signal(ActionSignal(), SIG_DFL);
    action(target, data);
    g_done.Post();
  }
  errno = saved_errno;
}

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
