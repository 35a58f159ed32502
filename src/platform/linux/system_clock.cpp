#include "platform/linux/system_clock.h"

namespace vireo::linux_platform {

WallTime SystemClock::now() const { return std::chrono::system_clock::now(); }

namespace {
std::mt19937 seededEngine() {
  std::random_device device;
  std::seed_seq seed{device(), device(), device(), device()};
  return std::mt19937(seed);
}
}  // namespace

SystemRandom::SystemRandom() : engine_(seededEngine()) {}

std::uint32_t SystemRandom::uniformBelow(std::uint32_t bound) {
  if (bound <= 1) return 0;
  std::uniform_int_distribution<std::uint32_t> distribution(0, bound - 1);
  MutexLock lock(mu_);
  return distribution(engine_);
}

}  // namespace vireo::linux_platform
