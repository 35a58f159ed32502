#include "vocabulary/reporting_utility.h"

#include <gtest/gtest.h>

#include <chrono>
#include <thread>

#include "fakes/fake_platform.h"

namespace vireo {
namespace {

using testing::FakePlatform;

TEST(VocabularyLabels, CategoryComposesAreaAndKind) {
  EXPECT_EQ(VRReportingCategoryName(0x40000003), "Routing_Playback");
  EXPECT_EQ(VRReportingCategoryName(0x10000008), "DSP_Error");
  EXPECT_EQ(VRReportingCategoryName(0x80000000), "Toolbox_Undefined");
  EXPECT_EQ(VRReportingCategoryName(0x08000006), "Session_ClientRequest");
  EXPECT_EQ(VRReportingCategoryName(0x20000009), "HAL_HWReporting");
  EXPECT_EQ(VRReportingCategoryName(3), "Playback");
  EXPECT_EQ(VRReportingCategoryName(11), "Volume");
  EXPECT_EQ(VRReportingCategoryName(0), "Undefined");
  EXPECT_EQ(VRReportingCategoryName(12), "Undefined");
  EXPECT_EQ(VRReportingCategoryName(0x0000FFFF), "Undefined");
  // Unrecognised areas keep a bare separator; combined area bits are not recognised.
  EXPECT_EQ(VRReportingCategoryName(0x00010005), "_Setup");
  EXPECT_EQ(VRReportingCategoryName(0x0001000B), "_Volume");
  EXPECT_EQ(VRReportingCategoryName(0x30000001), "_Generic");
  EXPECT_EQ(VRReportingCategoryName(0xFFFFFFFF), "Undefined");
}

TEST(VocabularyLabels, TypeAndServiceTables) {
  EXPECT_EQ(VRReportingTypeName(0), "Generic");
  EXPECT_EQ(VRReportingTypeName(5), "IssueDetector");
  EXPECT_EQ(VRReportingTypeName(6), "Undefined");
  EXPECT_EQ(VRReportingTypeName(65535), "Unknown");
  EXPECT_EQ(VRReportingTypeName(0x0001FFFF), "Undefined");

  EXPECT_EQ(VRReportingServiceTypeName(0), "generic");
  EXPECT_EQ(VRReportingServiceTypeName(1), "vesper");
  EXPECT_EQ(VRReportingServiceTypeName(8), "nonlongformaudio");
  EXPECT_EQ(VRReportingServiceTypeName(11), "test");
  EXPECT_EQ(VRReportingServiceTypeName(65535), "unknown");
  EXPECT_FALSE(VRReportingServiceTypeName(12).has_value());
  EXPECT_FALSE(VRReportingServiceTypeName(65534).has_value());
  EXPECT_FALSE(VRReportingServiceTypeName(0x0001FFFF).has_value());
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

TEST(BoundedWait, FlagAlreadySetReturnsAtOnceWithoutLogging) {
  FakePlatform p;
  ReportingCondition cond;
  bool done = true;
  EXPECT_TRUE(VRReportingUtilityWait(cond, &done, "waiting", "gave up", p.logger, LogScope::Session, 30.0));
  EXPECT_EQ(p.logger.size(), 0u);
}

TEST(BoundedWait, SilenceGivesUpAfterOneInterval) {
  FakePlatform p;
  ReportingCondition cond;
  bool done = false;
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
