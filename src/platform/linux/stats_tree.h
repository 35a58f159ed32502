// The driver-statistics library over a file tree: RUNTIME_DIRECTORY/stats holds
// GROUP/CHANNEL (a channel without subgroup) and GROUP/SUBGROUP/CHANNEL, each file one
// decimal integer. Integrators fill the tree with symlinks to real counters.
//
// The tree's layout is scanned once, when the library is built, so the channel set of
// every subscription is fixed for the life of the daemon; the files themselves are read
// again at every sample. A file that does not hold a number (or has vanished) is left
// out of that sample.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/mutex.h"
#include "platform/driver_stats.h"

namespace vireo::linux_platform {

// One counter file of the tree.
struct StatsTreeChannel {
  std::string relativePath;  // GROUP/CHANNEL or GROUP/SUBGROUP/CHANNEL; orders channels
  std::string group;
  std::optional<std::string> subGroup;
  std::string name;          // the file name
  std::string path;          // full path, opened at every sample
};

// Parses a counter file's text: one decimal int64, blanks around it allowed, nothing else.
std::optional<std::int64_t> parseStatsCounter(std::string_view text);

// Safe for concurrent use: the scanned tree is immutable after construction and the
// sampling operations keep no state; only subscription creation takes the lock.
class StatsTreeLibrary final : public DriverStatsLibrary {
 public:
  explicit StatsTreeLibrary(std::string statsDirectory);
  ~StatsTreeLibrary() override;

  std::unique_ptr<DriverChannelSet> copyChannelsInGroup(const std::optional<std::string>& group,
                                                        const std::optional<std::string>& subGroup,
                                                        std::uint64_t options,
                                                        std::optional<DriverStatsError>* error) override;
  std::int32_t channelCount(const DriverChannelSet& channels) override;
  DriverSubscriptionHandle createSubscription(const DriverChannelSet& channels,
                                              std::unique_ptr<DriverSubscribedChannels>* subscribed) override;
  std::unique_ptr<DriverSampleSet> createSamples(DriverSubscriptionHandle subscription,
                                                 const DriverSubscribedChannels& subscribed,
                                                 std::optional<DriverStatsError>* error) override;
  std::unique_ptr<DriverSampleSet> createSamplesDelta(const DriverSampleSet* earlier, const DriverSampleSet& later,
                                                      std::optional<DriverStatsError>* error) override;
  void iterate(const DriverSampleSet& samples,
               const std::function<DriverIterate(const DriverChannel&)>& visitor) override;
  std::optional<std::string> channelName(const DriverChannel& channel) override;
  std::int64_t simpleIntegerValue(const DriverChannel& channel) override;

  // The channels found at construction, sorted by relative path.
  const std::vector<StatsTreeChannel>& channels() const { return channels_; }

 private:
  struct Subscription;

  const std::string directory_;
  // Written by the constructor only.
  std::vector<StatsTreeChannel> channels_;
  // errno of a failed scan of an existing tree (0 when the scan went through); reported
  // by every channel copy together with whatever was found.
  int scanError_ = 0;

  // Guards subscriptions_. Entries are never removed: their addresses are the
  // subscription handles, which live as long as the library.
  Mutex subscriptionsLock_;
  std::vector<std::unique_ptr<Subscription>> subscriptions_ VIREO_GUARDED_BY(subscriptionsLock_);
};

}  // namespace vireo::linux_platform
