// VRReportingUtility: the labels of categories, message types and service types,
// the host-application lookup, the internal-build flag and the bounded wait.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "base/value.h"
#include "platform/logger.h"

namespace vireo {

class ReportingEnvironment;

// "Routing_Playback" for 0x40000003; "_Setup" for an unknown area; "Undefined" for 0xFFFFFFFF.
std::string VRReportingCategoryName(std::uint32_t category);
// "Start" for 1, "Unknown" for 65535, "Undefined" for anything else unknown.
std::string VRReportingTypeName(std::uint32_t type);
// Lower-case service label; nothing for types without one (12..65534).
std::optional<std::string> VRReportingServiceTypeName(std::uint32_t serviceType);
// The label, or "unknown" where the table has none: used wherever a name must exist
// (telemetry service names, summary file names, the session's serviceName).
std::string serviceNameOrUnknown(std::uint32_t serviceType);

inline constexpr const char* kHostApplicationDisplayIDKey = "HostApplicationDisplayID";
// The stored "HostApplicationDisplayID" value as stored, or "Unknown"; never absent.
Value VRReportingHostApplicationDisplayID(const Dictionary* userInfo);

bool VRReportingIsInternalBuild(ReportingEnvironment& env);

// A lock with a condition. Whoever completes the awaited work sets the done flag
// while holding lock and then notifies condition.
struct ReportingCondition {
  std::mutex lock;
  std::condition_variable condition;

  // Sets *done under the lock and wakes the waiter.
  void signalDone(bool* done) {
    {
      std::lock_guard<std::mutex> guard(lock);
      *done = true;
    }
    condition.notify_all();
  }
};

// Waits until *done is set, allowing interval seconds of silence between signals.
// True when the flag was seen set, false after an interval without any signal. The
// flag is read only under condition.lock. Lines go to scope (the default log when
// absent). The wait is a blocking region, so a pool thread that waits is replaced.
bool VRReportingUtilityWait(ReportingCondition& condition, bool* done, std::string_view waitMessage,
                            std::string_view giveUpMessage, Logger& logger, std::optional<LogScope> scope,
                            double interval);

}  // namespace vireo
