// VRReportingDriverUtility: subscriptions to the statistics channels of four fixed
// audio drivers, snapshots at session start and the positive growth at stop.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "base/value.h"
#include "platform/driver_stats.h"
#include "platform/logger.h"

namespace vireo {

class VRReportingDriver {
 public:
  // driverWithGroupName:subGroupName:
  static std::shared_ptr<VRReportingDriver> driverWithGroupName(std::optional<std::string> groupName,
                                                                std::optional<std::string> subGroupName);
  const std::optional<std::string>& groupName() const { return groupName_; }
  const std::optional<std::string>& subGroupName() const { return subGroupName_; }
  // "%@-%@" of both names, an absent one printed as "(null)".
  std::string description() const;

 private:
  std::optional<std::string> groupName_;
  std::optional<std::string> subGroupName_;
};

class VRReportingHWChannelSubscription {
 public:
  // initWithDriver:
  explicit VRReportingHWChannelSubscription(std::shared_ptr<VRReportingDriver> driver) : driver_(std::move(driver)) {}
  DriverSubscriptionHandle subscription = nullptr;
  std::shared_ptr<DriverSubscribedChannels> subscribedChannels;
  const std::shared_ptr<VRReportingDriver>& driver() const { return driver_; }

 private:
  std::shared_ptr<VRReportingDriver> driver_;
};

// Driver description -> copy of that driver's sample set, in subscription order.
struct DriverSnapshot {
  std::vector<std::pair<std::string, std::shared_ptr<const DriverSampleSet>>> samples;
  const DriverSampleSet* find(const std::string& description) const;
};

class VRReportingDriverUtility {
 public:
  // init: subscribes once; never fails as a whole.
  VRReportingDriverUtility(DriverStatsLibrary& library, Logger& logger);

  // getSnapShot: never absent, possibly empty.
  std::shared_ptr<DriverSnapshot> getSnapShot() const;
  // getDriverStatisticsRelativeToSnapShot: flattened channel key -> positive growth;
  // nothing when no channel grew.
  std::optional<Dictionary> getDriverStatisticsRelativeToSnapShot(const DriverSnapshot* snapshot) const;

  const std::vector<std::shared_ptr<VRReportingHWChannelSubscription>>& ioChannelSubscriptions() const {
    return ioChannelSubscriptions_;
  }

 private:
  DriverStatsLibrary& library_;
  Logger& logger_;
  // Filled by the constructor, read-only afterwards.
  std::vector<std::shared_ptr<VRReportingHWChannelSubscription>> ioChannelSubscriptions_;
};

}  // namespace vireo
