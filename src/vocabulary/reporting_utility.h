// VRReportingUtility: the labels of categories, message types and service types,
// the host-application lookup, the internal-build flag and the bounded wait for a
// backend (which parks its queue instead of blocking a thread).
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/mutex.h"
#include "base/value.h"
#include "dispatch/dispatch.h"
#include "platform/logger.h"

namespace vireo {

class ReportingEnvironment;
class ReportingWaiter;

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

// What a waiter and whoever completes the awaited work share (both hold it by
// shared_ptr): a done flag and the wake-up of the waiter's parked queue.
class ReportingCondition {
 public:
  explicit ReportingCondition(bool done = false) : done_(done) {}
  ReportingCondition(const ReportingCondition&) = delete;
  ReportingCondition& operator=(const ReportingCondition&) = delete;

  // Sets the done flag and wakes the waiter.
  void signalDone() { wake(true); }
  // Wakes the waiter without setting the flag: it waits another interval. A wake-up
  // while nobody waits is lost (the flag is not).
  void signal() { wake(false); }
  bool done() const;

 private:
  friend class ReportingWaiter;
  void wake(bool setDone);

  mutable Mutex lock_;  // guards done_, waiter_ and parking_
  bool done_ VIREO_GUARDED_BY(lock_);
  std::weak_ptr<ReportingWaiter> waiter_ VIREO_GUARDED_BY(lock_);  // the wait in progress, if any
  std::shared_ptr<Parking> parking_ VIREO_GUARDED_BY(lock_);       // its queue's current park, while it waits
};

// Waits until the condition is done, allowing interval seconds of silence between
// signals, without holding a thread: call it from a closure running on queue, which
// stays parked while the wait goes on (later closures of the queue wait behind it).
// onDone(true) once the flag is seen set, onDone(false) after an interval without any
// signal; it runs on queue, at once when the flag is already set. Each round logs
// waitMessage; a signal logs "continuing" and checks the flag again; silence logs
// giveUpMessage at error level. A signal that comes once the interval has run out,
// before the queue has gone on, is too late: the wait still gives up. Lines go to
// scope (the default log when absent) under the label "VRReportingUtilityWait". One
// wait per condition at a time; logger must outlive the wait.
void VRReportingUtilityWaitAsync(std::shared_ptr<SerialQueue> queue, std::shared_ptr<ReportingCondition> condition,
                                 std::string_view waitMessage, std::string_view giveUpMessage, Logger& logger,
                                 std::optional<LogScope> scope, double interval, std::function<void(bool)> onDone);

}  // namespace vireo
