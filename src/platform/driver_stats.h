// The driver-statistics library: channel groups, subscriptions, sample sets and
// their deltas. Handles are owned by whoever receives them.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

namespace vireo {

struct DriverStatsError {
  std::int64_t code = 0;
};

// A set of channels selected by group and subgroup.
class DriverChannelSet {
 public:
  virtual ~DriverChannelSet() = default;
};

// The library's description of the channels a subscription covers.
class DriverSubscribedChannels {
 public:
  virtual ~DriverSubscribedChannels() = default;
  virtual std::unique_ptr<DriverSubscribedChannels> copy() const = 0;
};

// One channel inside a sample set, as the iterator visits it.
class DriverChannel {
 public:
  virtual ~DriverChannel() = default;
};

// Values of every subscribed channel at one moment (or their differences).
class DriverSampleSet {
 public:
  virtual ~DriverSampleSet() = default;
  virtual std::unique_ptr<DriverSampleSet> copy() const = 0;
};

// An opaque, non-owning subscription handle; subscriptions live as long as the process.
using DriverSubscriptionHandle = const void*;

enum class DriverIterate { Continue, Stop };

class DriverStatsLibrary {
 public:
  virtual ~DriverStatsLibrary() = default;
  virtual std::unique_ptr<DriverChannelSet> copyChannelsInGroup(const std::optional<std::string>& group,
                                                                const std::optional<std::string>& subGroup,
                                                                std::uint64_t options,
                                                                std::optional<DriverStatsError>* error) = 0;
  virtual std::int32_t channelCount(const DriverChannelSet& channels) = 0;
  virtual DriverSubscriptionHandle createSubscription(const DriverChannelSet& channels,
                                                      std::unique_ptr<DriverSubscribedChannels>* subscribed) = 0;
  virtual std::unique_ptr<DriverSampleSet> createSamples(DriverSubscriptionHandle subscription,
                                                         const DriverSubscribedChannels& subscribed,
                                                         std::optional<DriverStatsError>* error) = 0;
  virtual std::unique_ptr<DriverSampleSet> createSamplesDelta(const DriverSampleSet* earlier,
                                                              const DriverSampleSet& later,
                                                              std::optional<DriverStatsError>* error) = 0;
  virtual void iterate(const DriverSampleSet& samples,
                       const std::function<DriverIterate(const DriverChannel&)>& visitor) = 0;
  virtual std::optional<std::string> channelName(const DriverChannel& channel) = 0;
  virtual std::int64_t simpleIntegerValue(const DriverChannel& channel) = 0;
};

}  // namespace vireo
