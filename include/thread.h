// Thread: a worker thread base class whose owner can make the running worker
// execute short actions, stopping among them, by the real-time signal
// SIGRTMAX-1.
//
// SIGRTMAX-1 (computed at run time) is reserved for this class in any process
// that uses it: its disposition is set to Thread::ThreadAction just before
// each request is sent and back to the default (which ends the process) as
// the handler begins, so nothing else may send, handle or expect it.
//
// Minimal use:
//
//   class Worker : public ZORV::ZORVNOTIFYD::Thread {
//    public:
//     ~Worker() override { Stop(); }  // before the members Run uses go away
//     int Run() override {
//       while (!_stop) DoSomeWork();   // returns soon after _stop is raised
//       return 0;
//     }
//   };
//
//   Thread::InitThreadLock();            // once, before the first request
//   Worker worker;
//   worker.Start();
//   ...
//   worker.Stop();                       // delivers the stop and joins
//   Thread::DestroyThreadLock();         // once, after every worker ended
//
// How requests travel.  A request (DoAction, and so Stop) fills the
// class-wide action slot (_this, _action, _data) and signals the worker; the
// worker runs the action inside the signal handler, interrupting Run wherever
// it is.  One request is in flight in the whole process at a time, across all
// Thread objects.  The requesting thread holds _lock from the moment it
// stores the request until the action has returned on the worker: it waits
// for the handler's completion signal (a semaphore post, which is safe in a
// signal handler) and then releases _lock itself, so the mutex is always
// unlocked by the thread that locked it.  The handler does only
// async-signal-safe work: it reads the slot, resets the disposition, runs
// the action and posts the completion.  The text copy handed to the action
// is freed by the requester after that completion, outside the handler.
// Consequently DoAction returns true only after the action has run.
//
// Lifecycle guarantees:
// - A Thread that was never started, or whose Start failed, is never
//   signalled: DoAction and Stop return false, and destroying it is harmless.
// - A stop requested at any time after Start returns is never lost: Start
//   lowers _stop before the worker exists and the worker never lowers it
//   again, so Stop right after Start always returns.
// - Requests are refused (false, no signal) once _stop is raised, that is
//   after a delivered stop or once Run has returned by itself.  A request
//   racing with Run's return is either delivered while the worker still
//   runs or refused; it never waits for a worker that is gone.  A worker
//   whose Run returned by itself is joined neither by Stop nor by the
//   destructor: its owner may pthread_join(_tid) itself.
// - The worker unblocks SIGRTMAX-1 as it begins; Run must not block it
//   again, or requests to that worker wait until it is unblocked.
// - Actions run in signal context: they do only what is safe there (such as
//   storing to lock-free atomics), and they must not make requests.
#ifndef ZORVNOTIFYD_THREAD_H_
#define ZORVNOTIFYD_THREAD_H_

#include <pthread.h>

#include <atomic>

#include "zorvnotifyd_export.h"

namespace ZORV {
namespace ZORVNOTIFYD {

// Verbosity of the library's syslog output (defined with the monitor queue
// API).  When it is exactly 7, Start and Stop log the worker's thread id.
ZORVNOTIFYD_EXPORT extern int LOG_LEVEL;

// Abstract worker thread; derive from it and implement Run.
class ZORVNOTIFYD_EXPORT Thread {
 public:
  // Leaves the object idle: _tid 0, _stop false.
  Thread();
  // Calls Stop() and ignores its result.  A derived class whose Run uses
  // its own members calls Stop() in its own destructor first.
  virtual ~Thread();

  Thread(const Thread&) = delete;
  Thread& operator=(const Thread&) = delete;

  // The worker's body, run on the worker thread.  Reads _stop and returns
  // soon after it becomes true.  The result is not used.
  virtual int Run() = 0;

  // Lowers _stop and creates the worker thread running Run.  True when the
  // thread was created; logs its id when LOG_LEVEL is 7.  On failure logs
  // the reason, leaves _tid 0 and returns false.  Call it on an object that
  // is idle or whose previous worker was joined.
  bool Start();

  // Delivers ThreadStoper to the worker and joins it.  True when the stop
  // was delivered and the thread joined (logs the id when LOG_LEVEL is 7).
  // False at once, without a signal, when the request is refused (never
  // started, already stopped, or Run returned by itself); false with a log
  // line when the join fails.  Called by one thread, once per Start.
  bool Stop();

  // Makes the worker run |action| with this object and a heap copy of
  // |text| (null when |text| is null) inside its SIGRTMAX-1 handler.  The
  // action only borrows the copy, which is freed after it returns.  Waits
  // while another request is in flight, then until the action has run.
  // True when the signal was sent (and so the action ran).  False without a
  // signal for a null action, a raised _stop or a never-started thread;
  // false with a log line when sending failed, the request then discarded.
  bool DoAction(void (*action)(Thread*, char*), const char* text);

  // Takes _lock (waiting while a request is in flight) and makes this
  // object the slot's target.  The result is not used.
  int GetThreadLock();
  // Clears the slot's target and releases _lock; called by the thread that
  // took it.  The result is not used.
  int ReleaseThreadLock();

  // Initialises _lock with default attributes.  False (and a log line) on
  // failure.  Call once before the first request.
  static bool InitThreadLock();
  // Destroys _lock and frees a text copy left in the slot, if any.  Call
  // once after every worker has ended.
  static void DestroyThreadLock();

  // The worker's start routine; |arg| is the Thread to run.  Runs Run(),
  // then raises _stop, and returns null only when no request aimed at this
  // worker is still waiting to be delivered.
  static void* ThreadRunner(void* arg);
  // The stop action: raises |target|'s _stop.  |text| is ignored.
  static void ThreadStoper(Thread* target, char* text);
  // The SIGRTMAX-1 handler, run on the worker: takes the request from the
  // slot, resets the disposition to the default, runs the action and
  // signals its completion to the requester.  |signo| is ignored.
  static void ThreadAction(int signo);

  pthread_t _tid;           // the worker's id; 0 until Start succeeds
  std::atomic<bool> _stop;  // raised by a delivered stop or when Run returns

  // The class-wide action slot.  _lock serialises requests: a requester
  // holds it while it fills the slot, sends the signal and waits for the
  // action to finish.  _this, _action and _data are written only by the
  // holder of _lock and read by the handler of the request in flight.
  static pthread_mutex_t _lock;
  static Thread* _this;                    // target in flight, else null
  static void (*_action)(Thread*, char*);  // action in flight, else null
  static char* _data;                      // text copy in flight, else null
};

}  // namespace ZORVNOTIFYD
}  // namespace ZORV

#endif  // ZORVNOTIFYD_THREAD_H_
