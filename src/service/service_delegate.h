// VRReportingServiceDelegate: the top of the service. Accepts every client
// connection with a server instance as its exported object, keeps the registry of
// connected clients, the reporting defaults and the driver statistics utility.
//
// The server queue is the one serial queue that orders all client work, the client
// registration and removal, and the defaults notification.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/mutex.h"
#include "base/value.h"
#include "dispatch/dispatch.h"
#include "drivers/driver_utility.h"
#include "platform/connection.h"
#include "service/service_delegate_protocol.h"

namespace vireo {

class ReportingEnvironment;
class ProcessTable;

inline constexpr const char* kServerQueueLabel = "com.orvane.vireo.reporting.server";
inline constexpr const char* kDefaultsSuite = "com.orvane.vireo";
inline constexpr const char* kDefaultsNotification = "com.orvane.vireo.reporting";
inline constexpr const char* kClientUptimeEvent = "com.orvane.vireo.vrreportingclientuptime";

// The short process name of a client, as registration records it: the service's own
// name for its own pid, nothing for pids below 1 or when the process table fails.
std::optional<std::string> VRReportingProcessName(const ProcessTable& processes, std::int32_t pid);

class VRReportingServiceDelegate final : public VRReportingServiceDelegateProtocol,
                                         public ListenerDelegate,
                                         public std::enable_shared_from_this<VRReportingServiceDelegate> {
 public:
  // init: the server queue, an empty registry, reporting on, the defaults
  // notification registered, the driver utility subscribed.
  static std::shared_ptr<VRReportingServiceDelegate> init(std::shared_ptr<ReportingEnvironment> env);
  VRReportingServiceDelegate(const VRReportingServiceDelegate&) = delete;
  VRReportingServiceDelegate& operator=(const VRReportingServiceDelegate&) = delete;

  // listener:shouldAcceptNewConnection:
  bool shouldAcceptNewConnection(ClientConnection& connection) override;

  // ---- VRReportingServiceDelegateProtocol ----
  std::optional<Dictionary> getDefaults() const override;
  std::vector<std::shared_ptr<VRReportingServerInstance>> getAllClients() const override;
  bool isReportingEnabled() const override { return reportingEnabled_.load(); }
  std::shared_ptr<VRReportingSession> findReportingSessionForID(std::int64_t reporterID) override;
  std::shared_ptr<DriverSnapshot> getSnapShot() override;
  std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(const DriverSnapshot* snapshot) override;
  void removeClient(const std::shared_ptr<VRReportingServerInstance>& client) override;

  // VRReportingDefaults: reads the suite afresh.
  Dictionary VRReportingDefaults() const;
  void listenForDefaultsNotification();

  const VRReportingDriverUtility& driverUtility() const { return *driverUtility_; }

 private:
  explicit VRReportingServiceDelegate(std::shared_ptr<ReportingEnvironment> env);

  // Server queue only.
  void defaultsChanged(int token);
  void registerClient(const std::weak_ptr<VRReportingServerInstance>& instance, std::int32_t pid);
  // Connection service threads; they only read the instance and queue work.
  static void connectionInterrupted(const std::shared_ptr<ReportingEnvironment>& env,
                                    const std::weak_ptr<VRReportingServerInstance>& instance);
  static void connectionInvalidated(const std::shared_ptr<ReportingEnvironment>& env,
                                    const std::weak_ptr<VRReportingServerInstance>& instance, std::int32_t pid);

  const std::shared_ptr<ReportingEnvironment> env_;
  const std::shared_ptr<SerialQueue> serverQueue_;
  // Made by init, read-only afterwards; its operations keep no state.
  std::unique_ptr<VRReportingDriverUtility> driverUtility_;
  // Token of the defaults notification; written once by listenForDefaultsNotification.
  std::atomic<int> notifyToken_{-1};

  // The delegate's object lock: held while a connection's exported object is set up
  // and for the whole of a lookup across all clients. Taken before registryLock_ and
  // the instances' own property locks, never after.
  Mutex objectLock_ VIREO_ACQUIRED_BEFORE(registryLock_);

  // Guards clients_ and defaults_ for readers on other threads. Both change only on
  // the server queue; the lock is held just for the copy in or out, never while
  // calling out.
  mutable Mutex registryLock_;
  std::vector<std::shared_ptr<VRReportingServerInstance>> clients_ VIREO_GUARDED_BY(registryLock_);
  std::optional<Dictionary> defaults_ VIREO_GUARDED_BY(registryLock_);

  std::atomic<bool> reportingEnabled_{true};
};

}  // namespace vireo
