#include "throttle/throttle_clock.h"

#include <cmath>

namespace vireo {

ThrottleClock::Duration ThrottleClock::durationFromSeconds(double seconds) {
  if (std::isnan(seconds)) return Duration::zero();
  constexpr double kLimit = 1e9;
  double clamped = seconds < -kLimit ? -kLimit : (seconds > kLimit ? kLimit : seconds);
  return std::chrono::duration_cast<Duration>(std::chrono::nanoseconds(std::llround(clamped * 1e9)));
}

void SteadyThrottleClock::sleepUntil(TimePoint deadline, const std::atomic<bool>* interrupt) {
  std::unique_lock guard(lock_);
  woken_.wait_until(guard, deadline, [&] { return interrupt && interrupt->load(); });
}

void SteadyThrottleClock::wake() {
  { std::lock_guard guard(lock_); }
  woken_.notify_all();
}

}  // namespace vireo
