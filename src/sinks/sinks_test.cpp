#include <gtest/gtest.h>

#include "fakes/fake_platform.h"
#include "session/reporting_session.h"
#include "sinks/voltmark_utility.h"

namespace vireo {
namespace {

using testing::FakePlatform;

class SinksTest : public ::testing::Test {
 protected:
  std::shared_ptr<VRReportingSession> session(const Dictionary* userInfo = nullptr) {
    auto s = VRReportingSession::initWithID(p.env, 9, {});
    s->setConfiguration(userInfo);
    return s;
  }
  FakePlatform p;
};

// The analytics event's name and payload are checked end to end (store suite).
TEST_F(SinksTest, EnergyLogOnlyForEngineOnReports) {
  Dictionary info{{"HostApplicationDisplayID", "com.example.game"}};
  auto s = session(&info);
  Dictionary unrelated{{"EngineOnTimes", 3}};
  VRReportingVoltmarkUtility::handleEvent(p.env, &unrelated, 0x40000003, 1, *s);
  VRReportingVoltmarkUtility::handleEvent(p.env, nullptr, 0, 0, *s);
  EXPECT_TRUE(p.energyLog.events().empty());
  EXPECT_EQ(p.logger.size(), 1u);  // only the session's creation line

  Dictionary full{{"EngineOnTime", 1.5}, {"vrreporting_timestamp", 1700000000.25}, {"other", 1}};
  VRReportingVoltmarkUtility::handleEvent(p.env, &full, 0, 0, *s);
  auto events = p.energyLog.events();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].client, 28);
  EXPECT_EQ(events[0].name, "Lumen_Haptics");
  EXPECT_EQ(events[0].event, (Dictionary{{"EngineOnDuration", 1.5},
                                         {"ApplicationName", "com.example.game"},
                                         {"TimestampEnd", 1700000000.25}}));

  // Without timestamp or application.
  auto bare = session();
  p.logger.clear();
  Dictionary message{{"EngineOnTime", 4}};
  VRReportingVoltmarkUtility::handleEvent(p.env, &message, 0, 0, *bare);
  events = p.energyLog.events();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[1].event, (Dictionary{{"EngineOnDuration", 4}, {"ApplicationName", "Unknown"}}));
  auto lines = p.logger.entries();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].message, "failed to get VRReporting timestamp for voltmark");
  EXPECT_EQ(lines[0].level, LogLevel::Error);
  EXPECT_EQ(lines[0].scope, LogScope::DefaultLog);
  EXPECT_EQ(lines[0].function, "+[VRReportingVoltmarkUtility handleEvent:withCategory:type:session:]");
}

}  // namespace
}  // namespace vireo
