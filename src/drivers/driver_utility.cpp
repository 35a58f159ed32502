#include "drivers/driver_utility.h"

#include <array>

namespace vireo {

namespace {

constexpr const char* kInitLabel = "-[VRReportingDriverUtility init]";
constexpr const char* kSnapShotLabel = "-[VRReportingDriverUtility getSnapShot]";
constexpr const char* kDeltaLabel = "-[VRReportingDriverUtility getDriverStatisticsRelativeToSnapShot:]";

const char* textOf(const std::optional<std::string>& name) { return name ? name->c_str() : "(null)"; }

// Stands in for a subscription whose creation gave no channel description, so that
// sampling it reaches the library, which then reports its own error.
class NoSubscribedChannels final : public DriverSubscribedChannels {
 public:
  std::unique_ptr<DriverSubscribedChannels> copy() const override { return std::make_unique<NoSubscribedChannels>(); }
};

const DriverSubscribedChannels& channelsOf(const VRReportingHWChannelSubscription& entry) {
  static const NoSubscribedChannels kNone;
  if (entry.subscribedChannels) return *entry.subscribedChannels;
  return kNone;
}

}  // namespace

std::shared_ptr<VRReportingDriver> VRReportingDriver::driverWithGroupName(std::optional<std::string> groupName,
                                                                          std::optional<std::string> subGroupName) {
  auto driver = std::make_shared<VRReportingDriver>();
  driver->groupName_ = std::move(groupName);
  driver->subGroupName_ = std::move(subGroupName);
  return driver;
}

std::string VRReportingDriver::description() const {
  return std::string(textOf(groupName_)) + "-" + textOf(subGroupName_);
}

const DriverSampleSet* DriverSnapshot::find(const std::string& description) const {
  for (const auto& [key, set] : samples) {
    if (key == description) return set.get();
  }
  return nullptr;
}

VRReportingDriverUtility::VRReportingDriverUtility(DriverStatsLibrary& library, Logger& logger)
    : library_(library), logger_(logger) {
  VR_LOG(logger_, LogScope::Driver, LogLevel::Info, kInitLabel, "creating hwreporting driver utility");

  const std::array<std::shared_ptr<VRReportingDriver>, 4> drivers = {
      VRReportingDriver::driverWithGroupName("OrvaneTK4HB", std::nullopt),
      VRReportingDriver::driverWithGroupName("Speaker", std::nullopt),
      VRReportingDriver::driverWithGroupName(std::nullopt, "MCA"),
      VRReportingDriver::driverWithGroupName("Haptics", "Stats"),
  };

  for (const auto& driver : drivers) {
    const char* group = textOf(driver->groupName());
    const char* subGroup = textOf(driver->subGroupName());
    std::optional<DriverStatsError> error;
    std::unique_ptr<DriverChannelSet> channels =
        library_.copyChannelsInGroup(driver->groupName(), driver->subGroupName(), 0, &error);
    if (error) {
      VR_LOG(logger_, LogScope::Driver, LogLevel::Error, kInitLabel, "error %li getting channels for driver %s-%s",
             static_cast<long>(error->code), group, subGroup);
    }
    if (!channels) continue;

    if (library_.channelCount(*channels) < 1) {
      VR_LOG(logger_, LogScope::Driver, LogLevel::Info, kInitLabel,
             "couldn't find any channels for driver group %s-%s", group, subGroup);
    } else {
      auto entry = std::make_shared<VRReportingHWChannelSubscription>(driver);
      std::unique_ptr<DriverSubscribedChannels> subscribed;
      // Not checked here: a failed subscription shows up as a sampling error later.
      entry->subscription = library_.createSubscription(*channels, &subscribed);
      if (subscribed) entry->subscribedChannels = subscribed->copy();
      ioChannelSubscriptions_.push_back(std::move(entry));
    }
    channels.reset();
    VR_LOG(logger_, LogScope::Driver, LogLevel::Default, kInitLabel, "subscribed to group group %s-%s", group,
           subGroup);
  }
}

std::shared_ptr<DriverSnapshot> VRReportingDriverUtility::getSnapShot() const {
  auto snapshot = std::make_shared<DriverSnapshot>();
  for (const auto& entry : ioChannelSubscriptions_) {
    const std::string description = entry->driver()->description();
    VR_LOG(logger_, LogScope::Driver, LogLevel::Info, kSnapShotLabel, "sampling driver %s", description.c_str());
    std::optional<DriverStatsError> error;
    std::unique_ptr<DriverSampleSet> samples = library_.createSamples(entry->subscription, channelsOf(*entry), &error);
    if (error) {
      VR_LOG(logger_, LogScope::Driver, LogLevel::Error, kSnapShotLabel, "HWReportCreateSamples error %li",
             static_cast<long>(error->code));
      continue;
    }
    // The snapshot keeps the library's own set; nobody else holds it, so no copy is needed.
    if (samples) snapshot->samples.emplace_back(description, std::move(samples));
  }
  return snapshot;
}

std::optional<Dictionary> VRReportingDriverUtility::getDriverStatisticsRelativeToSnapShot(
    const DriverSnapshot* snapshot) const {
  Dictionary result;
  for (const auto& entry : ioChannelSubscriptions_) {
    const VRReportingDriver& driver = *entry->driver();
    std::optional<DriverStatsError> error;
    VR_LOG(logger_, LogScope::Driver, LogLevel::Info, kDeltaLabel, "getting latest samples");
    std::unique_ptr<DriverSampleSet> samples = library_.createSamples(entry->subscription, channelsOf(*entry), &error);
    VR_LOG(logger_, LogScope::Driver, LogLevel::Info, kDeltaLabel, "done getting latest samples");
    if (error) {
      VR_LOG(logger_, LogScope::Driver, LogLevel::Error, kDeltaLabel, "HWReportCreateSamples error %li",
             static_cast<long>(error->code));
      continue;
    }
    if (!samples) continue;

    std::unique_ptr<DriverSampleSet> delta;
    const DriverSampleSet* report = samples.get();
    if (snapshot) {
      std::optional<DriverStatsError> deltaError;
      delta = library_.createSamplesDelta(snapshot->find(driver.description()), *samples, &deltaError);
      if (deltaError) {
        // The absolute counts go out in place of the differences; the stop path does not tell them apart.
        VR_LOG(logger_, LogScope::Driver, LogLevel::Error, kDeltaLabel, "HWReportCreateSamplesDelta error %li",
               static_cast<long>(deltaError->code));
      } else {
        report = delta.get();
      }
    }
    if (!report) continue;

    library_.iterate(*report, [&](const DriverChannel& channel) {
      const std::int64_t value = library_.simpleIntegerValue(channel);
      if (value < 1) return DriverIterate::Continue;
      std::string key;
      if (driver.groupName()) key += *driver.groupName() + "_";
      if (driver.subGroupName()) key += *driver.subGroupName() + "_";
      if (auto name = library_.channelName(channel)) key += *name;
      result.set(Value(std::move(key)), Value(value));
      return DriverIterate::Continue;
    });
  }
  if (result.empty()) return std::nullopt;
  return result;
}

}  // namespace vireo
