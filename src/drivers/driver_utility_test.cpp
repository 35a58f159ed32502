#include "drivers/driver_utility.h"

#include <map>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "fakes/fake_platform.h"

namespace vireo {
namespace {

using ::testing::ElementsAre;

std::vector<std::string> messages(const testing::RecordingLogger& logger) {
  std::vector<std::string> out;
  for (const auto& entry : logger.entries()) out.push_back(entry.message);
  return out;
}

// A scripted library, also for the failures a real one rarely produces.
struct FakeChannel : DriverChannel {
  FakeChannel(std::optional<std::string> n, std::int64_t v) : name(std::move(n)), value(v) {}
  std::optional<std::string> name;
  std::int64_t value;
};
struct FakeSamples : DriverSampleSet {
  std::vector<FakeChannel> channels;
  std::unique_ptr<DriverSampleSet> copy() const override { return std::make_unique<FakeSamples>(*this); }
};
// Sets and subscriptions carry the driver's description ("Speaker-(null)").
struct Tagged : DriverChannelSet, DriverSubscribedChannels {
  explicit Tagged(std::string d) : driver(std::move(d)) {}
  std::unique_ptr<DriverSubscribedChannels> copy() const override { return std::make_unique<Tagged>(driver); }
  std::string driver;
};

struct DriverScript {
  std::int32_t channels = 1;
  std::optional<std::int64_t> copyError{}, samplesError{};
  bool returnsSet = true, subscriptionFails = false;
  std::vector<FakeChannel> values{};
};

class ScriptedLibrary final : public DriverStatsLibrary {
 public:
  std::map<std::string, DriverScript> drivers;
  std::optional<std::int64_t> deltaError;
  std::vector<std::string> deltaEarlier;  // per delta call: "set", or "none" without an earlier set

  std::unique_ptr<DriverChannelSet> copyChannelsInGroup(const std::optional<std::string>& group,
                                                        const std::optional<std::string>& subGroup, std::uint64_t,
                                                        std::optional<DriverStatsError>* error) override {
    const std::string key = group.value_or("(null)") + "-" + subGroup.value_or("(null)");
    auto it = drivers.find(key);
    if (it == drivers.end()) return nullptr;  // a driver the script leaves out is absent
    const DriverScript& script = it->second;
    if (script.copyError) *error = DriverStatsError{*script.copyError};
    return script.returnsSet ? std::make_unique<Tagged>(key) : nullptr;
  }
  std::int32_t channelCount(const DriverChannelSet& set) override {
    return drivers[dynamic_cast<const Tagged&>(set).driver].channels;
  }
  DriverSubscriptionHandle createSubscription(const DriverChannelSet& set,
                                              std::unique_ptr<DriverSubscribedChannels>* subscribed) override {
    const auto& driver = dynamic_cast<const Tagged&>(set).driver;
    if (drivers[driver].subscriptionFails) return nullptr;
    *subscribed = std::make_unique<Tagged>(driver);
    return this;
  }
  std::unique_ptr<DriverSampleSet> createSamples(DriverSubscriptionHandle handle, const DriverSubscribedChannels& subscribed,
                                                 std::optional<DriverStatsError>* error) override {
    const auto* s = dynamic_cast<const Tagged*>(&subscribed);
    if (!handle || !s) return *error = DriverStatsError{22}, nullptr;
    auto samples = std::make_unique<FakeSamples>();
    const DriverScript& script = drivers[s->driver];
    if (script.samplesError) *error = DriverStatsError{*script.samplesError};  // an error wins even with a set
    else samples->channels = script.values;
    return samples;
  }
  std::unique_ptr<DriverSampleSet> createSamplesDelta(const DriverSampleSet* earlier, const DriverSampleSet& later,
                                                      std::optional<DriverStatsError>* error) override {
    deltaEarlier.push_back(earlier ? "set" : "none");
    if (deltaError) return *error = DriverStatsError{*deltaError}, nullptr;
    auto delta = std::make_unique<FakeSamples>(static_cast<const FakeSamples&>(later));
    for (std::size_t i = 0; earlier && i < delta->channels.size(); ++i)
      if (const auto& before = static_cast<const FakeSamples&>(*earlier).channels; i < before.size())
        delta->channels[i].value -= before[i].value;
    return delta;
  }
  void iterate(const DriverSampleSet& samples, const std::function<DriverIterate(const DriverChannel&)>& visitor) override {
    for (const auto& c : static_cast<const FakeSamples&>(samples).channels)
      if (visitor(c) == DriverIterate::Stop) break;
  }
  std::optional<std::string> channelName(const DriverChannel& c) override { return static_cast<const FakeChannel&>(c).name; }
  std::int64_t simpleIntegerValue(const DriverChannel& c) override { return static_cast<const FakeChannel&>(c).value; }
};

TEST(DriverUtility, SnapshotAndPositiveDeltaUnderFlattenedKeys) {
  ScriptedLibrary library;
  auto& orvane = (library.drivers["OrvaneTK4HB-(null)"].values = {{"overruns", 0}, {"rx", 10}});
  auto& speaker = (library.drivers["Speaker-(null)"].values = {{"x", 5}});
  auto& mca = (library.drivers["(null)-MCA"].values = {{"drops", 1}, {"drops", 3}});  // one name in two groups
  auto& haptics = (library.drivers["Haptics-Stats"].values = {{"on", 0}});
  testing::RecordingLogger logger;
  VRReportingDriverUtility utility(library, logger);
  ASSERT_EQ(utility.ioChannelSubscriptions().size(), 4u);

  // Nothing grew yet. (Every group's keys show up in the deltas below.)
  auto snapshot = utility.getSnapShot();
  EXPECT_EQ(utility.getDriverStatisticsRelativeToSnapShot(snapshot.get()), std::nullopt);

  orvane = {{"overruns", 2}, {"rx", 15}};
  speaker = {{"x", 3}};                 // went down: not reported
  mca = {{"drops", 4}, {"drops", 10}};  // +3, then replaced by +7 under the same key
  haptics = {{"on", 2}};
  auto delta = utility.getDriverStatisticsRelativeToSnapShot(snapshot.get());
  ASSERT_TRUE(delta);
  EXPECT_EQ(*delta, (Dictionary{{"OrvaneTK4HB_overruns", 2}, {"OrvaneTK4HB_rx", 5}, {"MCA_drops", 7},
                                {"Haptics_Stats_on", 2}}));
  EXPECT_EQ(delta->find("MCA_drops")->kind(), Value::Kind::Int);

  // Without a snapshot: absolute values of at least 1.
  EXPECT_EQ(utility.getDriverStatisticsRelativeToSnapShot(nullptr),
            (Dictionary{{"OrvaneTK4HB_overruns", 2}, {"OrvaneTK4HB_rx", 15}, {"Speaker_x", 3}, {"MCA_drops", 10},
                        {"Haptics_Stats_on", 2}}));
}

TEST(DriverUtilityFailures, CopyAndSubscriptionErrors) {
  ScriptedLibrary library;
  library.drivers = {
      {"OrvaneTK4HB-(null)", {.channels = 2, .copyError = 5}},  // logged, but the returned set is still subscribed
      {"Speaker-(null)", {.copyError = 6, .returnsSet = false}},
      {"(null)-MCA", {.channels = 0}},
      {"Haptics-Stats", {.subscriptionFails = true, .values = {{"x", 4}}}},  // shows up as a sampling error
  };
  testing::RecordingLogger logger;
  VRReportingDriverUtility utility(library, logger);

  ASSERT_EQ(utility.ioChannelSubscriptions().size(), 2u);
  EXPECT_EQ(utility.ioChannelSubscriptions()[0]->driver()->description(), "OrvaneTK4HB-(null)");
  EXPECT_EQ(utility.ioChannelSubscriptions()[1]->subscription, nullptr);
  EXPECT_THAT(messages(logger), ElementsAre("creating hwreporting driver utility",
                                             "error 5 getting channels for driver OrvaneTK4HB-(null)",
                                             "subscribed to group group OrvaneTK4HB-(null)",
                                             "error 6 getting channels for driver Speaker-(null)",
                                             "couldn't find any channels for driver group (null)-MCA",
                                             "subscribed to group group (null)-MCA",
                                             "subscribed to group group Haptics-Stats"));
  for (const auto& line : logger.entries()) {
    EXPECT_EQ(line.scope, LogScope::Driver);
    EXPECT_EQ(line.function, "-[VRReportingDriverUtility init]");
  }
  EXPECT_EQ(logger.entries()[1].level, LogLevel::Error);
  logger.clear();

  auto snapshot = utility.getSnapShot();
  ASSERT_EQ(snapshot->samples.size(), 1u);
  EXPECT_EQ(snapshot->samples[0].first, "OrvaneTK4HB-(null)");
  EXPECT_THAT(messages(logger), ElementsAre("sampling driver OrvaneTK4HB-(null)", "sampling driver Haptics-Stats",
                                             "HWReportCreateSamples error 22"));
  EXPECT_EQ(utility.getDriverStatisticsRelativeToSnapShot(nullptr), std::nullopt);
}

TEST(DriverUtilityFailures, SamplingErrorDropsOnlyThatDriverAndDeltaErrorFallsBackToAbsolutes) {
  ScriptedLibrary library;
  library.drivers = {{"Speaker-(null)", {.values = {{"x", 4}, {std::nullopt, 3}, {"z", 0}}}},
                     {"(null)-MCA", {.values = {{"m", 1}}}},
                     {"Haptics-Stats", {.samplesError = 7, .values = {{"y", 9}}}}};
  testing::RecordingLogger logger;
  VRReportingDriverUtility utility(library, logger);
  logger.clear();

  auto snapshot = utility.getSnapShot();
  ASSERT_EQ(snapshot->samples.size(), 2u);
  EXPECT_THAT(messages(logger), ElementsAre("sampling driver Speaker-(null)", "sampling driver (null)-MCA",
                                             "sampling driver Haptics-Stats", "HWReportCreateSamples error 7"));
  EXPECT_EQ(logger.entries()[3].level, LogLevel::Error);
  EXPECT_EQ(logger.entries()[3].function, "-[VRReportingDriverUtility getSnapShot]");

  logger.clear();
  library.drivers["Speaker-(null)"].values[0] = {"x", 6};
  EXPECT_EQ(utility.getDriverStatisticsRelativeToSnapShot(snapshot.get()), (Dictionary{{"Speaker_x", 2}}));
  auto failed = logger.matching("HWReportCreateSamples error 7");
  ASSERT_EQ(failed.size(), 1u);
  EXPECT_EQ(failed[0].function, "-[VRReportingDriverUtility getDriverStatisticsRelativeToSnapShot:]");

  snapshot->samples.pop_back();  // MCA lacks its entry: passed on as no earlier set
  library.deltaError = 9;
  library.deltaEarlier.clear();
  logger.clear();
  // A nameless channel leaves the key ending in "_".
  EXPECT_EQ(utility.getDriverStatisticsRelativeToSnapShot(snapshot.get()),
            (Dictionary{{"Speaker_x", 6}, {"Speaker_", 3}, {"MCA_m", 1}}));
  EXPECT_THAT(library.deltaEarlier, ElementsAre("set", "none"));
  EXPECT_EQ(messages(logger)[2], "HWReportCreateSamplesDelta error 9");
  EXPECT_EQ(logger.entries()[2].level, LogLevel::Error);
}

}  // namespace
}  // namespace vireo
