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
  MutexLock guard(lock_);
  while (!(interrupt && interrupt->load()))
    if (guard.waitUntil(woken_, deadline) == std::cv_status::timeout) break;
}

void SteadyThrottleClock::wake() {
  { MutexLock guard(lock_); }
  woken_.notify_all();
}

}  // namespace vireo
