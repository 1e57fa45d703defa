// The group sync of the daemon's state: what is written to the state
// directory (journals, snapshots) reaches the disk at most one interval
// after it was written, with one sync for everything written meanwhile,
// never one per event.
#ifndef ZORVNOTIFYD_DAEMON_SYNC_TIMER_H_
#define ZORVNOTIFYD_DAEMON_SYNC_TIMER_H_

#include <cstdint>
#include <functional>
#include <utility>
#include <vector>

namespace zorvnotifyd {

class SyncTimer {
 public:
  // Syncs at most every |interval_ms| milliseconds while something is
  // written.
  explicit SyncTimer(int64_t interval_ms) : interval_ms_(interval_ms) {}

  // |sync| is called at each group sync (and at the stop): it makes what
  // its owner wrote durable.
  void Join(std::function<void()> sync) { syncs_.push_back(std::move(sync)); }
  // Something was written at |now_ms| that waits for a sync.
  void Wrote(int64_t now_ms) {
    if (due_ms_ < 0) due_ms_ = std::max(now_ms, last_ms_ + interval_ms_);
  }
  // When the next sync is due (milliseconds of the caller's clock), or -1
  // when nothing waits.
  int64_t due() const { return due_ms_; }
  // Syncs when due at |now_ms|; true when it did.
  bool RunIfDue(int64_t now_ms) {
    if (due_ms_ < 0 || now_ms < due_ms_) return false;
    Run(now_ms);
    return true;
  }
  // Syncs now.
  void Run(int64_t now_ms) {
    due_ms_ = -1;
    last_ms_ = now_ms;
    for (const auto& sync : syncs_) sync();
  }

 private:
  int64_t interval_ms_;
  int64_t due_ms_ = -1;
  int64_t last_ms_ = INT64_MIN / 2;
  std::vector<std::function<void()>> syncs_;
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_SYNC_TIMER_H_
