// What the engine shares process-wide: the platform and the internal-build flag,
// computed once per process on first use.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <mutex>

#include "platform/platform.h"

namespace vireo {

class ReportingEnvironment {
 public:
  explicit ReportingEnvironment(Platform& platform) : platform(platform) {}
  ReportingEnvironment(const ReportingEnvironment&) = delete;
  ReportingEnvironment& operator=(const ReportingEnvironment&) = delete;

  Platform& platform;
  Logger& logger() const { return platform.logger; }

  // How long a session waits for the telemetry service to find backends before it
  // logs and waits again; tests shorten it.
  std::atomic<double> backendWaitInterval{9.0};
  // Bytes of payloads one session keeps for its summary (limits.conf MaxKeptBytesPerSession).
  std::atomic<std::size_t> maxKeptBytesPerSession{1u << 20};
  // Payloads let go for that budget, over the process's life.
  std::atomic<std::uint64_t> keptPayloadsDropped{0};

  // VRReportingIsInternalBuild: the device's "InternalBuild" answer, false without one.
  bool isInternalBuild() {
    std::call_once(internalBuildOnce_, [this] { internalBuild_ = platform.device.boolAnswer("InternalBuild").value_or(false); });
    return internalBuild_;
  }

 private:
  std::once_flag internalBuildOnce_;
  bool internalBuild_ = false;  // written once under internalBuildOnce_
};

}  // namespace vireo
