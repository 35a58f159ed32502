// VRReportingSession: one reporting session of one client. Its record, lifecycle,
// message identifiers, message sending and aggregation, telemetry backend session,
// single messages and the summary sent at stop.
//
// start/stop/setServiceType/setConfiguration/updateDefaults are called by the server
// instance on the server queue; all telemetry work runs on the session's own serial
// queue, in submission order. Every closure submitted there holds the session.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/mutex.h"
#include "base/ring.h"
#include "base/value.h"
#include "base/value_pack.h"
#include "dispatch/dispatch.h"
#include "drivers/driver_utility.h"
#include "platform/clock.h"
#include "platform/orientation.h"
#include "platform/telemetry_service.h"
#include "service/reporting_protocol.h"

namespace vireo {

class ReportingEnvironment;

// The gathered payloads of a running session with the lock that guards them. Each
// start makes a new one; stop drops it, so a sender that still holds the old one
// appends to an array nobody reads any more. What is kept is bounded: past the
// byte budget the oldest entries go first. Entries are kept packed (value_pack.h),
// at about their JSON size, and unpacked once, for the summary.
struct AggregatedPayloads {
  Mutex lock;
  Ring<std::string> entries VIREO_GUARDED_BY(lock);  // packed
  std::size_t keptBytes VIREO_GUARDED_BY(lock) = 0;
  std::uint64_t dropped VIREO_GUARDED_BY(lock) = 0;  // entries let go for the budget

  // With lock held: appends at the end (or, with front, at the start) and drops the
  // oldest entries while over budget. Returns how many it dropped.
  std::size_t appendLocked(const Value& entry, std::size_t budget, bool front = false) VIREO_REQUIRES(lock);
  // Calls f with each entry, unpacked, oldest first.
  template <typename F>
  void forEachLocked(F&& f) const VIREO_REQUIRES(lock) {
    for (const std::string& packed : entries) {
      std::string_view in = packed;
      if (auto value = unpackValue(in)) f(*value);
    }
  }
  Array arrayLocked() const VIREO_REQUIRES(lock) {
    Array array;
    array.reserve(entries.size());
    forEachLocked([&](Value& v) { array.push_back(std::move(v)); });
    return array;
  }
};

class VRReportingSession : public std::enable_shared_from_this<VRReportingSession> {
 public:
  // initWithID:processIdentifiers:
  static std::shared_ptr<VRReportingSession> initWithID(std::shared_ptr<ReportingEnvironment> env,
                                                        std::int64_t reporterID,
                                                        std::vector<std::int32_t> processIdentifiers);
  ~VRReportingSession();
  VRReportingSession(const VRReportingSession&) = delete;
  VRReportingSession& operator=(const VRReportingSession&) = delete;

  // setServiceType:
  void setServiceType(std::uint16_t serviceType);
  // setConfiguration: and updateDefaults: (identical merges into userInfo)
  void setConfiguration(const Dictionary* configuration);
  void updateDefaults(const Dictionary* defaults);
  void start();
  void stop();

  // sendMessage:category:type:reply: and sendMessage:category:type:sync:reply:
  void sendMessage(const Dictionary& message, std::uint32_t category, std::uint16_t type, BoolReply reply);
  void sendMessage(const Dictionary& message, std::uint32_t category, std::uint16_t type, bool sync,
                   BoolReply reply);
  // messageIdForCategory:type:
  std::string messageIdForCategory(std::uint32_t category, std::uint16_t type);
  // createSummaryEventForSession
  std::optional<Dictionary> createSummaryEventForSession();
  // shouldReportOrientation: internal builds, service types 7 and 2, any device class but 6.
  bool shouldReportOrientation();

  // sendSingleMessage:category:type:serviceType:userInfo:reply: (class operation)
  static void sendSingleMessage(const std::shared_ptr<ReportingEnvironment>& env, const Dictionary& message,
                                std::uint32_t category, std::uint16_t type, std::uint16_t serviceType,
                                const Dictionary* userInfo, ErrorReply reply);

  // ---- fields ----
  bool started() const { return started_.load(); }
  bool skylarkReportingSessionStarted() const { return skylarkReportingSessionStarted_.load(); }
  std::uint16_t serviceType() const { return serviceType_; }
  Dictionary userInfo() const;
  std::shared_ptr<DriverSnapshot> driverSnapShot() const;
  void setDriverSnapShot(std::shared_ptr<DriverSnapshot> snapshot);
  BoolReply transactionCompleteBlock() const;
  void setTransactionCompleteBlock(BoolReply block);
  std::int64_t reporterID() const { return reporterID_; }
  const std::vector<std::int32_t>& processIdentifiers() const { return processIdentifiers_; }
  // The current payload array (absent once stopped).
  std::shared_ptr<AggregatedPayloads> aggregatedPayloadData() const;
  Dictionary messageTypeCounts() const;
  std::string serviceName() const;
  std::optional<std::string> orientationCallbackID() const;
  std::optional<WallTime> startDate() const;
  std::shared_ptr<TelemetrySession> skylarkReportingSession() const;
  std::shared_ptr<HierarchyToken> skylarkReportingAgentToken() const;
  const std::shared_ptr<SerialQueue>& skylarkReportingQueue() const { return skylarkReportingQueue_; }

  // Text for log lines ("%@").
  std::string description() const;

 private:
  VRReportingSession(std::shared_ptr<ReportingEnvironment> env, std::int64_t reporterID,
                     std::vector<std::int32_t> processIdentifiers);
  // The backend-session closure run on skylarkReportingQueue after start. It leaves
  // the queue parked while the telemetry service looks for backends.
  void startBackendSession(const Dictionary& userInfo, const std::string& serviceName, bool backendFound);
  // The orientation handlers registered at start; mode is "device" or "ui".
  void registerOrientationHandlers();
  void unregisterOrientationHandlers();
  void orientationChanged(const char* mode, Orientation orientation);
  // Appends one entry to payloads within the session's budget, logging the first drop.
  void keep(AggregatedPayloads& payloads, Value entry);
  void deliver(const Dictionary& cleaned, const Value& received, bool submittedWhileStarted,
               std::uint32_t category, std::uint16_t type);

  const std::shared_ptr<ReportingEnvironment> env_;
  const std::int64_t reporterID_;
  const std::vector<std::int32_t> processIdentifiers_;
  const std::shared_ptr<SerialQueue> skylarkReportingQueue_;

  std::atomic<bool> started_{false};
  std::atomic<bool> skylarkReportingSessionStarted_{false};
  std::atomic<std::uint16_t> serviceType_{0xFFFF};

  // Each field below is read and written whole under fieldsLock_; no lock spans
  // several operations (the server queue orders start, stop and configuration).
  mutable Mutex fieldsLock_;
  Dictionary userInfo_ VIREO_GUARDED_BY(fieldsLock_);
  std::shared_ptr<DriverSnapshot> driverSnapShot_ VIREO_GUARDED_BY(fieldsLock_);
  BoolReply transactionCompleteBlock_ VIREO_GUARDED_BY(fieldsLock_);
  std::shared_ptr<AggregatedPayloads> aggregatedPayloadData_ VIREO_GUARDED_BY(fieldsLock_);
  Dictionary messageTypeCounts_ VIREO_GUARDED_BY(fieldsLock_);
  std::string serviceName_ VIREO_GUARDED_BY(fieldsLock_) = "unknown";
  std::optional<std::string> orientationCallbackID_ VIREO_GUARDED_BY(fieldsLock_);
  std::optional<WallTime> startDate_ VIREO_GUARDED_BY(fieldsLock_);
  std::shared_ptr<TelemetrySession> skylarkReportingSession_ VIREO_GUARDED_BY(fieldsLock_);
  std::shared_ptr<HierarchyToken> skylarkReportingAgentToken_ VIREO_GUARDED_BY(fieldsLock_);
};

}  // namespace vireo
