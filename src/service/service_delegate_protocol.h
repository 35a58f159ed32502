// VRReportingServiceDelegateProtocol: what a server instance may ask of the service
// host. Instances hold it weakly.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <vector>

#include "base/value.h"

namespace vireo {

class VRReportingServerInstance;
class VRReportingSession;
struct DriverSnapshot;

class VRReportingServiceDelegateProtocol {
 public:
  virtual ~VRReportingServiceDelegateProtocol() = default;
  // The reporting defaults; absent until the first change notification.
  virtual std::optional<Dictionary> getDefaults() const = 0;
  // The registered clients in registry order (a snapshot of the list).
  virtual std::vector<std::shared_ptr<VRReportingServerInstance>> getAllClients() const = 0;
  virtual bool isReportingEnabled() const = 0;
  // findReportingSessionForID: across all clients, first registered client first.
  virtual std::shared_ptr<VRReportingSession> findReportingSessionForID(std::int64_t reporterID) = 0;
  virtual std::shared_ptr<DriverSnapshot> getSnapShot() = 0;
  // getDriverStatisticsRelativeToSnapShot:
  virtual std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(const DriverSnapshot* snapshot) = 0;
  // removeClient: drops every occurrence of the instance.
  virtual void removeClient(const std::shared_ptr<VRReportingServerInstance>& client) = 0;
};

}  // namespace vireo
