// Simulated time for throttle tests. Time stands still while any participating
// thread is awake and jumps to the earliest deadline once all of them sleep, so a
// test of a five-second hold runs instantly and always sees the same instants.
// Header-only; the engine itself never uses it.
#pragma once

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <list>

#include "base/mutex.h"
#include "throttle/throttle_clock.h"

namespace vireo {

class SimulatedThrottleClock final : public ThrottleClock {
 public:
  // The creating thread counts as a participant; the throttle adds its worker.
  explicit SimulatedThrottleClock(int participants = 1) : participants_(participants) {}

  TimePoint now() const override {
    MutexLock guard(lock_);
    return now_;
  }

  // Seconds since the clock was made.
  double seconds() const { return std::chrono::duration<double>(now().time_since_epoch()).count(); }

  void sleepUntil(TimePoint deadline, const std::atomic<bool>* interrupt) override {
    MutexLock guard(lock_);
    auto me = sleepers_.insert(sleepers_.end(), Sleeper{deadline, interrupt});
    while (now_ < deadline && !(interrupt && interrupt->load())) {
      if (!advanceIfAllAsleep()) guard.wait(changed_);
    }
    sleepers_.erase(me);
  }

  void wake() override {
    { MutexLock guard(lock_); }
    changed_.notify_all();
  }

  void threadJoins() override {
    MutexLock guard(lock_);
    ++participants_;
  }

  void threadLeaves() override {
    MutexLock guard(lock_);
    --participants_;
    advanceIfAllAsleep();
  }

 private:
  struct Sleeper {
    TimePoint deadline;
    const std::atomic<bool>* interrupt;
  };

  // Called with lock_ held; true when time moved. It stays put while a sleeper is
  // already due or has its interrupt raised: that thread is about to wake.
  bool advanceIfAllAsleep() VIREO_REQUIRES(lock_) {
    if (sleepers_.empty() || static_cast<int>(sleepers_.size()) < participants_) return false;
    for (const auto& s : sleepers_)
      if (s.interrupt && s.interrupt->load()) return false;
    auto earliest = std::min_element(sleepers_.begin(), sleepers_.end(),
                                     [](const Sleeper& a, const Sleeper& b) { return a.deadline < b.deadline; });
    if (earliest->deadline <= now_) return false;
    now_ = earliest->deadline;
    changed_.notify_all();
    return true;
  }

  mutable Mutex lock_;  // guards now_, sleepers_ and participants_
  std::condition_variable changed_;
  TimePoint now_ VIREO_GUARDED_BY(lock_){};
  std::list<Sleeper> sleepers_ VIREO_GUARDED_BY(lock_);
  int participants_ VIREO_GUARDED_BY(lock_);
};

}  // namespace vireo
