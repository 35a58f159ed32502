// What the engine shares process-wide: the platform and the internal-build flag,
// computed once per process on first use.
#pragma once

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
