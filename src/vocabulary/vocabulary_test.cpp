#include "vocabulary/reporting_utility.h"

#include <gtest/gtest.h>

#include <chrono>
#include <thread>

#include "fakes/fake_platform.h"

namespace vireo {
namespace {

using testing::FakePlatform;

TEST(VocabularyLabels, CategoryTypeAndServiceTables) {
  // Unrecognised areas keep a bare separator; combined area bits are not recognised.
  const std::pair<std::uint32_t, const char*> categories[] = {
      {0x40000003, "Routing_Playback"}, {0x10000008, "DSP_Error"}, {0x80000000, "Toolbox_Undefined"},
      {0x08000006, "Session_ClientRequest"}, {0x20000009, "HAL_HWReporting"}, {3, "Playback"}, {11, "Volume"},
      {0, "Undefined"}, {12, "Undefined"}, {0x0000FFFF, "Undefined"}, {0xFFFFFFFF, "Undefined"},
      {0x00010005, "_Setup"}, {0x0001000B, "_Volume"}, {0x30000001, "_Generic"}};
  for (auto [category, name] : categories) EXPECT_EQ(VRReportingCategoryName(category), name) << category;
  const std::pair<std::uint32_t, const char*> types[] = {
      {0, "Generic"}, {5, "IssueDetector"}, {6, "Undefined"}, {65535, "Unknown"}, {0x0001FFFF, "Undefined"}};
  for (auto [type, name] : types) EXPECT_EQ(VRReportingTypeName(type), name) << type;
  const std::pair<std::uint32_t, std::optional<std::string>> services[] = {
      {0, "generic"}, {1, "vesper"}, {8, "nonlongformaudio"}, {11, "test"}, {65535, "unknown"},
      {12, std::nullopt}, {65534, std::nullopt}, {0x0001FFFF, std::nullopt}};
  for (auto& [service, name] : services) EXPECT_EQ(VRReportingServiceTypeName(service), name) << service;
  EXPECT_EQ(serviceNameOrUnknown(12), "unknown");
  EXPECT_EQ(serviceNameOrUnknown(2), "telephony");
}

TEST(VocabularyLabels, HostApplicationIsStoredValueOrUnknown) {
  EXPECT_EQ(VRReportingHostApplicationDisplayID(nullptr), Value("Unknown"));
  Dictionary none{{"other", 1}};
  EXPECT_EQ(VRReportingHostApplicationDisplayID(&none), Value("Unknown"));
  Dictionary app{{"HostApplicationDisplayID", "com.example.player"}};
  EXPECT_EQ(VRReportingHostApplicationDisplayID(&app), Value("com.example.player"));
  Dictionary numeric{{"HostApplicationDisplayID", 7}};
  EXPECT_EQ(VRReportingHostApplicationDisplayID(&numeric), Value(7));
}

TEST(VocabularyLabels, InternalBuildIsComputedOnce) {
  FakePlatform p;
  p.setInternalBuild(true);
  EXPECT_TRUE(VRReportingIsInternalBuild(*p.env));
  p.setInternalBuild(false);
  EXPECT_TRUE(VRReportingIsInternalBuild(*p.env));

  FakePlatform unanswered;
  EXPECT_FALSE(VRReportingIsInternalBuild(*unanswered.env));
}

// Waits until the waiter has logged its wait line `times` times; the waiter holds
// the lock while logging, so once the lock is ours again it is inside the wait.
void awaitWaitLines(const testing::RecordingLogger& logger, std::size_t times) {
  while (logger.count("waiting") < times) std::this_thread::sleep_for(std::chrono::milliseconds(1));
}

TEST(BoundedWait, SetFlagReturnsAtOnceAndSilenceGivesUpAfterOneInterval) {
  FakePlatform p;
  ReportingCondition cond;
  bool done = true;
  EXPECT_TRUE(VRReportingUtilityWait(cond, &done, "waiting", "gave up", p.logger, LogScope::Session, 30.0));
  EXPECT_EQ(p.logger.size(), 0u);

  done = false;
  EXPECT_FALSE(VRReportingUtilityWait(cond, &done, "waiting", "gave up", p.logger, LogScope::Session, 0.02));
  auto lines = p.logger.entries();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[0].message, "waiting");
  EXPECT_EQ(lines[0].level, LogLevel::Default);
  EXPECT_EQ(lines[0].function, "VRReportingUtilityWait");
  EXPECT_EQ(lines[1].message, "gave up");
  EXPECT_EQ(lines[1].level, LogLevel::Error);
  EXPECT_EQ(lines[1].scope, LogScope::Session);
  // The condition is left unlocked.
  EXPECT_TRUE(cond.lock.try_lock());
  cond.lock.unlock();
}

TEST(BoundedWait, SignalWithoutFlagRestartsUntilFlagIsSet) {
  FakePlatform p;
  ReportingCondition cond;
  bool done = false;
  std::thread signaller([&] {
    awaitWaitLines(p.logger, 1);
    {
      std::lock_guard<std::mutex> guard(cond.lock);
    }
    cond.condition.notify_all();  // wakes without the flag
    awaitWaitLines(p.logger, 2);
    cond.signalDone(&done);
  });
  EXPECT_TRUE(VRReportingUtilityWait(cond, &done, "waiting", "gave up", p.logger, std::nullopt, 30.0));
  signaller.join();
  EXPECT_EQ(p.logger.count("waiting"), 2u);
  EXPECT_EQ(p.logger.count("continuing"), 2u);
  EXPECT_FALSE(p.logger.contains("gave up"));
  EXPECT_EQ(p.logger.entries().front().scope, LogScope::DefaultLog);
}

}  // namespace
}  // namespace vireo
