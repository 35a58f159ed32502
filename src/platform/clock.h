// Wall-clock time and random numbers, injectable so that tests need not sleep.
#pragma once

#include <chrono>
#include <cstdint>

namespace vireo {

using WallTime = std::chrono::system_clock::time_point;

class Clock {
 public:
  virtual ~Clock() = default;
  virtual WallTime now() const = 0;
};

class RandomSource {
 public:
  virtual ~RandomSource() = default;
  // A uniformly distributed whole number in [0, bound); bound > 0.
  virtual std::uint32_t uniformBelow(std::uint32_t bound) = 0;
};

// Seconds since the Unix epoch, as stored in the store's REAL columns.
inline double unixSeconds(WallTime t) {
  return std::chrono::duration<double>(t.time_since_epoch()).count();
}

}  // namespace vireo
