// The time source of the message throttle: monotonic now, a sleep that another
// thread can cut short, and the wake that does so. Injectable so that tests run on
// simulated time instead of sleeping.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>

#include "base/mutex.h"

namespace vireo {

class ThrottleClock {
 public:
  using TimePoint = std::chrono::steady_clock::time_point;
  using Duration = TimePoint::duration;

  virtual ~ThrottleClock() = default;
  virtual TimePoint now() const = 0;
  // Blocks until deadline. With interrupt given, also returns once *interrupt is
  // true: the waker sets the flag first and then calls wake(), so a wake that
  // comes before the sleep begins is not lost.
  virtual void sleepUntil(TimePoint deadline, const std::atomic<bool>* interrupt) = 0;
  virtual void wake() = 0;
  // A simulated clock advances only when every thread that uses it sleeps; the
  // throttle announces its worker with these. A real clock ignores them.
  virtual void threadJoins() {}
  virtual void threadLeaves() {}

  void sleepFor(double seconds) { sleepUntil(now() + durationFromSeconds(seconds), nullptr); }

  // Seconds as a clock duration. Clamped to +-1e9 s (and NaN read as 0) so that any
  // hold a client can smuggle in still gives a representable deadline.
  static Duration durationFromSeconds(double seconds);
};

// steady_clock with a condition variable for the interruptible sleep.
class SteadyThrottleClock final : public ThrottleClock {
 public:
  TimePoint now() const override { return std::chrono::steady_clock::now(); }
  void sleepUntil(TimePoint deadline, const std::atomic<bool>* interrupt) override;
  void wake() override;

 private:
  Mutex lock_;  // pairs with woken_ so that a wake cannot slip between a sleeper's check and its wait
  std::condition_variable woken_;
};

}  // namespace vireo
