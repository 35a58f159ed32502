// The real clock and a thread-safe random source.
#pragma once

#include <mutex>
#include <random>

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
  std::mutex mu_;  // guards engine_
  std::mt19937 engine_;
};

}  // namespace vireo::linux_platform
