#include <gtest/gtest.h>

#include <stdexcept>

#include "fakes/fake_platform.h"
#include "throttle/block_throttle.h"
#include "throttle/simulated_throttle_clock.h"

namespace vireo {
namespace {

using testing::RecordingLogger;
using Throttle = VRReportingBlockThrottle;

constexpr std::uint32_t kPlaybackStart[] = {0x40000003, 1};  // Routing_Playback, Start
const std::string kTail = "reporterID|42|Routing_Playback|Start";

std::string keyOf(const Dictionary& message, std::int64_t reporter = 42, std::uint32_t category = kPlaybackStart[0],
                  std::uint32_t type = kPlaybackStart[1]) {
  return Throttle::buildMessageKey(message, reporter, category, type);
}

TEST(ThrottleKeyTest, BuildsKeys) {
  struct Case {
    const char* name;
    Dictionary message;
    std::string expected;
  };
  const Case cases[] = {
      {"example", {{"Route", "Speaker"}, {"Volume", 0.5}, {"_throttle_seconds", 2}},
       "Route|Speaker|Volume|0.5|_throttle_seconds|^|"},
      {"volume pair", {{"Volume", 0.5}, {"VolumeOperationTime", 12}}, "Volume|^|VolumeOperationTime|^|"},
      {"empty", {}, ""},
      {"volume alone", {{"Volume", 0.75}}, "Volume|0.75|"},
      {"time alone", {{"VolumeOperationTime", 12.0}}, "VolumeOperationTime|12|"},
      {"default exclusions",
       {{"vrreporting_timestamp", 9.5}, {"A", 1}, {"systemuptime_sec", 5}, {"processuptime_ms", 7}},
       "A|1|processuptime_ms|^|systemuptime_sec|^|vrreporting_timestamp|^|"},
      {"exclusion array", {{"Level", 3}, {"Mode", 1}, {"_comparison_field_blacklist", Array{"Level"}}},
       "Level|^|Mode|1|_comparison_field_blacklist|^|"},
      {"exclusion not an array", {{"Level", 3}, {"_comparison_field_blacklist", "Level"}},
       "Level|3|_comparison_field_blacklist|^|"},
      {"byte order", {{"b", 1}, {"_x", 2}, {"B", 3}, {"a", 4}}, "B|3|_x|2|a|4|b|1|"},
      {"nested", {{"Cfg", Dictionary{{"z", true}, {"a", Array{0.5, "s"}}}}}, R"(Cfg|{"a": [0.5, "s"], "z": true}|)"},
      {"non-string key", {{Value(7), "x"}, {"6", "y"}}, "6|y|7|x|"},
  };
  for (const auto& c : cases) EXPECT_EQ(keyOf(c.message), c.expected + kTail) << c.name;
  const Dictionary m{{"Route", "Speaker"}};
  EXPECT_NE(keyOf(m), keyOf(m, 43));
  EXPECT_NE(keyOf(m), keyOf(m, 42, 0x40000004));
  EXPECT_NE(keyOf(m), keyOf(m, 42, kPlaybackStart[0], 2));
}

TEST(ThrottleSleepTimeTest, ReadsAndBoundsTheHold) {
  struct Case {
    Value time;
    double expected;
    const char* logged;  // the info line on the default log, if any
  };
  const Case cases[] = {
      {Value(), 0.5, nullptr},
      {4, 4.0, nullptr},
      {4.99, static_cast<double>(4.99f), nullptr},
      {5, 0.5, "Rejecting large throttle time. {time=5, max=5.000000}"},
      {5.2, 0.5, "Rejecting large throttle time. {time=5.2, max=5.000000}"},
      {-1, -1.0, nullptr},
      {"2", 0.5, "Rejecting non Numeral value of throttle time. {time=2}"},
      {2.3, 2.2999999523162842, nullptr},
  };
  for (const auto& c : cases) {
    RecordingLogger logger;
    Dictionary message{{"Route", "Speaker"}};
    if (!c.time.isAbsent()) message.set("_throttle_seconds", c.time);
    EXPECT_EQ(Throttle::determineSleepTime(message, logger), c.expected) << c.time.text();
    auto entries = logger.entries();
    ASSERT_EQ(entries.size(), c.logged ? 1u : 0u) << c.time.text();
    if (!c.logged) continue;
    EXPECT_EQ(entries[0].message, c.logged);
    EXPECT_EQ(entries[0].scope, LogScope::DefaultLog);
    EXPECT_EQ(entries[0].level, LogLevel::Info);
    EXPECT_EQ(entries[0].function, "+[VRReportingBlockThrottle determineSleepTime:]");
  }
}

// A throttle on simulated time. Its worker passes at 0, 0.1, 0.2 ... seconds until a
// run of timers shifts the phase; tests submit between passes so that no two
// threads act at the same instant.
struct Rig {
  struct Delivery {
    std::string label;
    double at;
  };

  Rig() { logger.setVerbose(LogScope::Session); }
  ~Rig() { throttle->stop(); }

  void sleepUntil(double seconds) {
    clock->sleepUntil(ThrottleClock::TimePoint(ThrottleClock::durationFromSeconds(seconds)), nullptr);
  }
  static Dictionary message(const std::string& route, double hold) {
    return {{"Route", route}, {"_throttle_seconds", hold}};
  }
  void submit(const std::string& label, const Dictionary& m, std::function<void()> extra = {}) {
    throttle->addMessageBlock(
        [this, label, extra] {
          deliveries.add({label, clock->seconds()});
          if (extra) extra();
        },
        42, m, kPlaybackStart[0], kPlaybackStart[1]);
  }

  std::shared_ptr<SimulatedThrottleClock> clock = std::make_shared<SimulatedThrottleClock>();
  RecordingLogger logger;
  std::shared_ptr<Throttle> throttle = Throttle::make(logger, clock);
  testing::Recorder<Delivery> deliveries;
};

TEST(ThrottleDeliveryTest, DeliversAtTheRightTimes) {
  struct Submission {
    double at;
    const char* label;
    const char* route;
    double hold;
  };
  struct Case {
    const char* name;
    std::vector<Submission> submissions;
    std::vector<Rig::Delivery> expected;
    std::size_t duplicates;
  };
  const Case cases[] = {
      {"burst of duplicates: the last, a hold after it",
       {{0.05, "a", "S", 0.5}, {0.25, "b", "S", 0.5}, {0.45, "c", "S", 0.5}}, {{"c", 0.95}}, 2},
      {"distinct keys: each once, by fire date",
       {{0.05, "a", "A", 0.3}, {0.06, "b", "B", 0.1}, {0.07, "c", "C", 0.2}}, {{"b", 0.16}, {"c", 0.27}, {"a", 0.35}},
       0},
      {"zero hold: next pass", {{0.05, "a", "A", 0}}, {{"a", 0.1}}, 0},
      {"negative hold: next pass", {{0.05, "a", "A", -1}}, {{"a", 0.1}}, 0},
      {"shorter hold brings an attached timer forward", {{0.05, "a", "S", 4}, {1.05, "b", "S", 0.5}}, {{"b", 1.55}},
       1},
      {"newcomer waits until attached timers have fired", {{0.05, "a", "A", 4}, {0.55, "b", "B", 0}},
       {{"a", 4.05}, {"b", 4.15}}, 0},
      {"fired key is new again", {{0.05, "a", "S", 0.5}, {1.0, "b", "S", 0.5}}, {{"a", 0.55}, {"b", 1.5}}, 0},
  };
  for (const auto& c : cases) {
    Rig rig;
    for (const auto& s : c.submissions) {
      rig.sleepUntil(s.at);
      rig.submit(s.label, Rig::message(s.route, s.hold));
    }
    rig.sleepUntil(10);
    auto got = rig.deliveries();
    ASSERT_EQ(got.size(), c.expected.size()) << c.name;
    for (std::size_t i = 0; i < got.size(); ++i) {
      EXPECT_EQ(got[i].label, c.expected[i].label) << c.name;
      EXPECT_NEAR(got[i].at, c.expected[i].at, 1e-6) << c.name;
    }
    EXPECT_EQ(rig.throttle->timersInFlightCount(), 0u) << c.name;
    EXPECT_EQ(rig.logger.count("Dropping duplicate message for Route|S|_throttle_seconds|^|" + kTail), c.duplicates)
        << c.name;
  }
}

class ThrottleTimingTest : public ::testing::Test, protected Rig {};

TEST_F(ThrottleTimingTest, WaitForCompletion) {
  throttle->waitForCompletion();  // nothing pending: back at once
  EXPECT_EQ(clock->seconds(), 0.0);
  EXPECT_TRUE(logger.contains("waitForCompletion. timersInFlight=0 unscheduledTimerKeys=0"));
  EXPECT_FALSE(logger.contains("Waiting up to"));

  sleepUntil(0.05);
  submit("held", message("A", 4));
  sleepUntil(0.07);
  throttle->waitForCompletion();  // returns at the first poll after 4.05
  EXPECT_NEAR(clock->seconds(), 4.07, 1e-6);
  EXPECT_EQ(deliveries().size(), 1u);
  EXPECT_TRUE(logger.contains("waitForCompletion. timersInFlight=1 unscheduledTimerKeys=1"));
  EXPECT_TRUE(logger.contains("Waiting up to 5 seconds for blockThrottle queue to be empty."));
  EXPECT_FALSE(logger.contains("Giving up"));

  // A delivery that takes 6 s keeps its entry in flight past the 5 s limit.
  sleepUntil(10.02);
  submit("slow", message("B", 0), [this] { clock->sleepFor(6); });
  throttle->waitForCompletion();
  EXPECT_NEAR(clock->seconds(), 15.02, 1e-6);
  auto giveUp = logger.matching("Giving up on waiting for completion after 5 seconds. timersInFlight=1");
  ASSERT_EQ(giveUp.size(), 1u);
  EXPECT_EQ(giveUp[0].level, LogLevel::Default);
  throttle->waitForCompletion();
  EXPECT_EQ(throttle->timersInFlightCount(), 0u);
}

TEST_F(ThrottleTimingTest, ThrowingDeliveryIsRetiredAndTheWorkerCarriesOn) {
  sleepUntil(0.05);
  submit("throws", message("A", 0), [] { throw std::runtime_error("boom"); });
  sleepUntil(0.55);
  EXPECT_EQ(throttle->timersInFlightCount(), 0u);
  auto errors = logger.matching("error=boom");
  ASSERT_EQ(errors.size(), 1u);
  EXPECT_EQ(errors[0].level, LogLevel::Error);
  EXPECT_EQ(errors[0].scope, LogScope::Session);

  submit("again", message("A", 0));
  sleepUntil(1.05);
  ASSERT_EQ(deliveries().size(), 2u);
  EXPECT_EQ(deliveries()[1].label, "again");
  EXPECT_NEAR(deliveries()[1].at, 0.6, 1e-6);
  EXPECT_FALSE(logger.contains("Dropping duplicate"));
}

TEST_F(ThrottleTimingTest, StopDropsPendingEntriesAndReleasesTheThrottle) {
  sleepUntil(0.05);
  submit("pending", message("A", 4));
  sleepUntil(0.15);  // attached by now
  throttle->stop();
  EXPECT_EQ(throttle->timersInFlightCount(), 0u);
  EXPECT_TRUE(deliveries().empty());
  EXPECT_EQ(throttle.use_count(), 1);  // the worker no longer holds it
}

}  // namespace
}  // namespace vireo
