// What one client can make the daemon hold is bounded by limits.conf; a call past
// a limit is refused with LimitsExceeded naming it, and the status shows it.
#include <string>

#include "service_fixture.h"

namespace vireo::itest {
namespace {

constexpr const char* kLimitsExceeded = "org.freedesktop.DBus.Error.LimitsExceeded";

class LimitsTest : public ServiceTest {
 protected:
  std::map<std::string, std::string> configurationFiles() override {
    return {{"limits.conf",
             "MaxSessionsPerClient=3\nMaxHeldStartsPerClient=2\nMaxPayloadBytes=1024\nMaxPayloadEntries=20\n"
             "MaxReporterIDsPerCall=3\nMaxClients=3\nMaxKeptBytesPerSession=2048\n"}};
  }
  // The refusal's error, checked to name the limit.
  template <class R>
  static ::testing::AssertionResult refusedBy(const R& result, const std::string& limit) {
    if (result) return ::testing::AssertionFailure() << "accepted";
    if (result.error().name != kLimitsExceeded || result.error().message.find(limit + "=") == std::string::npos)
      return ::testing::AssertionFailure() << result.error().name << ": " << result.error().message;
    return ::testing::AssertionSuccess();
  }
};

TEST_F(LimitsTest, EachLimitRefusesPastItAndTheStatusCountsIt) {
  auto c = connect();
  ASSERT_TRUE(c);
  for (std::int64_t id : {1, 2, 3}) ASSERT_EQ(*c->createReportingSession(id), true);
  EXPECT_TRUE(refusedBy(c->createReportingSession(4), "MaxSessionsPerClient"));
  EXPECT_EQ(*c->createReportingSession(3), true);  // replacing is not holding more
  ASSERT_EQ(*c->destroyReportingSession(3), true);
  ASSERT_EQ(*c->createReportingSession(4), true);

  // Starts held by running sessions count; one that is answered no longer does.
  auto first = c->startReportingSessionForID(1);
  auto second = c->startReportingSessionForID(2);
  ASSERT_TRUE(c->getAllReporters());  // both are held by now
  auto third = c->startReportingSessionForID(4);
  auto refused = third.waitFor(5s);
  ASSERT_TRUE(refused);
  EXPECT_TRUE(refusedBy(*refused, "MaxHeldStartsPerClient"));
  ASSERT_EQ(*c->stopReportingSessionForID(1), true);
  ASSERT_TRUE(first.waitFor(5s));
  auto fourth = c->startReportingSessionForID(4);
  ASSERT_TRUE(c->getAllReporters());
  EXPECT_FALSE(fourth.ready());

  // One payload: its bytes, its values, its reporter IDs.
  EXPECT_TRUE(refusedBy(c->sendMessage(Dictionary{{"s", std::string(2000, 'x')}}, 3, 1), "MaxPayloadBytes"));
  Dictionary many;
  for (int i = 0; i < 25; ++i) many.set(Value("k" + std::to_string(i)), Value(i));
  EXPECT_TRUE(refusedBy(c->sendMessage(many, 3, 1), "MaxPayloadEntries"));
  EXPECT_TRUE(refusedBy(c->sendMessage(Dictionary{{"k", 1}}, 3, 1, std::vector<std::int64_t>{2, 2, 2, 2}),
                        "MaxReporterIDsPerCall"));
  EXPECT_TRUE(refusedBy(c->setConfiguration(Dictionary{{"s", std::string(2000, 'x')}}, 2), "MaxPayloadBytes"));
  EXPECT_TRUE(c->sendMessage(Dictionary{{"k", 1}}, 3, 1, std::vector<std::int64_t>{2, 2, 2}));

  // What a running session keeps for its summary stays within its budget.
  for (int i = 0; i < 100; ++i)
    ASSERT_TRUE(c->sendMessage(Dictionary{{"text", std::string(100, 'y')}}, 3, 1, std::vector<std::int64_t>{2}));
  ASSERT_TRUE(waitForLog("session 2 keeps more than MaxKeptBytesPerSession=2048 bytes"));

  // Clients: two more connect; a fourth is refused until one goes away.
  auto b = connect();
  auto d = connect();
  ASSERT_TRUE(b && d);
  ASSERT_TRUE(b->getAllReporters());
  ASSERT_TRUE(d->getAllReporters());
  auto e = connect();
  ASSERT_TRUE(e);
  EXPECT_TRUE(refusedBy(e->getAllReporters(), "MaxClients"));
  d.reset();
  EXPECT_TRUE(eventually([&] { return bool(e->getAllReporters()); }));

  auto status = c->getStatus();
  ASSERT_TRUE(status) << status.error().message;
  const Dictionary* hits = status->find("limits_hit")->asDictionary();
  ASSERT_NE(hits, nullptr);
  for (const char* limit : {"MaxSessionsPerClient", "MaxHeldStartsPerClient", "MaxPayloadEntries",
                            "MaxReporterIDsPerCall", "MaxClients"})
    EXPECT_EQ(*hits->find(limit), Value(1ull)) << limit;
  EXPECT_EQ(*hits->find("MaxPayloadBytes"), Value(2ull));
  EXPECT_EQ(*status->find("started_sessions"), Value(2ull));
  EXPECT_GT(*status->find("kept_payloads_dropped")->toInt64(), 0);
  EXPECT_EQ(status->find("store")->asDictionary()->find("usable")->asBool() != nullptr, true);
  (void)second;
}

}  // namespace
}  // namespace vireo::itest
