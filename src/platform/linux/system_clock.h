// The real clock and a thread-safe random source.
#pragma once

#include <random>

#include "base/mutex.h"
#include "platform/clock.h"

namespace vireo::linux_platform {

class SystemClock : public Clock {
 public:
  WallTime now() const override;
};

class SystemRandom : public RandomSource {
 public:
  SystemRandom();
  std::uint32_t uniformBelow(std::uint32_t bound) override;

 private:
  Mutex mu_;  // guards engine_
  std::mt19937 engine_ VIREO_GUARDED_BY(mu_);
};

}  // namespace vireo::linux_platform
