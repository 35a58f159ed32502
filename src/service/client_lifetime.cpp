// A client's way into and out of the registry, and its uptime event.
#include <chrono>
#include <cstdint>
#include <limits>
#include <utility>

#include "platform/logger.h"
#include "service/server_instance.h"
#include "service/service_delegate.h"
#include "vocabulary/reporting_environment.h"

namespace vireo {

namespace {
constexpr const char* kAcceptLabel = "-[VRReportingServiceDelegate listener:shouldAcceptNewConnection:]";

// uptime_sec is logged as a 32-bit integer; clamp so that an absurd clock cannot
// make the conversion undefined.
std::int32_t truncatedSeconds(double seconds) {
  if (!(seconds > std::numeric_limits<std::int32_t>::min())) return std::numeric_limits<std::int32_t>::min();
  if (seconds >= static_cast<double>(std::numeric_limits<std::int32_t>::max()))
    return std::numeric_limits<std::int32_t>::max();
  return static_cast<std::int32_t>(seconds);
}
}  // namespace

std::optional<std::string> VRReportingProcessName(const ProcessTable& processes, std::int32_t pid) {
  if (pid == processes.selfPid()) return processes.selfName();
  if (pid < 1) return std::nullopt;
  return processes.shortName(pid);
}

void VRReportingServiceDelegate::registerClient(const std::weak_ptr<VRReportingServerInstance>& weakInstance,
                                                std::int32_t pid) {
  auto instance = weakInstance.lock();
  if (!instance) return;  // the connection is already gone
  {
    MutexLock guard(registryLock_);
    clients_.push_back(instance);
  }
  instance->setClientStartDate(env_->platform.clock.now());
  instance->setClientProcessName(VRReportingProcessName(env_->platform.processes, pid));
}

void VRReportingServiceDelegate::connectionInterrupted(const std::shared_ptr<ReportingEnvironment>& env,
                                                       const std::weak_ptr<VRReportingServerInstance>& weakInstance) {
  VR_LOG(env->logger(), LogScope::Server, LogLevel::Default, kAcceptLabel,
         "InterruptionHandler: connection exited");
  if (auto instance = weakInstance.lock()) instance->handleConnectionError();
}

void VRReportingServiceDelegate::connectionInvalidated(const std::shared_ptr<ReportingEnvironment>& env,
                                                       const std::weak_ptr<VRReportingServerInstance>& weakInstance,
                                                       std::int32_t pid) {
  Logger& logger = env->logger();
  auto instance = weakInstance.lock();
  if (instance) instance->handleConnectionError();

  const WallTime now = env->platform.clock.now();
  const std::optional<WallTime> startDate = instance ? instance->clientStartDate() : std::nullopt;
  const std::optional<std::string> processName = instance ? instance->clientProcessName() : std::nullopt;
  const std::string nameOrUnknown = processName.value_or("unknown");

  Value seconds = -1;
  double uptime = -1;
  if (!startDate) {
    VR_LOG(logger, LogScope::Server, LogLevel::Default, kAcceptLabel,
           "clientStartDate is nil. clientpid=%d clientprocessname=%s", pid, nameOrUnknown.c_str());
  } else {
    const auto interval = *startDate > now ? *startDate - now : now - *startDate;
    uptime = std::chrono::duration<double>(interval).count();
    seconds = uptime;
    // The wording is historical: the condition is a start date in the future.
    if (*startDate > now) {
      VR_LOG(logger, LogScope::Server, LogLevel::Default, kAcceptLabel,
             "clientStartDate is in the past. clientpid=%d clientprocessname=%s", pid, nameOrUnknown.c_str());
    }
  }
  VR_LOG(logger, LogScope::Server, LogLevel::Default, kAcceptLabel,
         "InvalidationHandler: connection exited process=%s uptime_sec=%d",
         processName ? processName->c_str() : "(null)", truncatedSeconds(uptime));

  if (!processName) {
    VR_LOG(logger, LogScope::Server, LogLevel::Default, kAcceptLabel, "clientProcessName is nil. clientpid=%d", pid);
    return;
  }
  Dictionary event{{"processName", *processName}, {"seconds", seconds}};
  env->platform.analytics.sendEventLazy(kClientUptimeEvent, [event = std::move(event)] { return event; });
}

}  // namespace vireo
