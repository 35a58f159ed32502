#include <gtest/gtest.h>

#include <algorithm>

#include "fakes/service_fakes.h"

namespace vireo {
namespace {

using testing::FakeConnection;
using testing::Replies;
using testing::ServiceHarness;

class RoutingTest : public ::testing::Test {
 protected:
  void SetUp() override {
    a = h.connect(100, "player");
    b = h.connect(200, "phone");
    // Client a owns 1 (started) and 2 (created only); client b owns 3 (started).
    for (auto [c, id] : {std::pair{a.get(), 1}, {a.get(), 2}, {b.get(), 3}}) {
      c->client().createReportingSession(id, nullptr);
      c->client().setServiceType(2, id, nullptr);
      if (id != 2) c->client().startReportingSessionForID(id, nullptr);
    }
    h.pump();
    // Sink calls in order, with the watched session's payload count at that moment.
    h.fake.analytics.onCall = [this] { calls.push_back({"analytics", payloads(watched.lock())}); };
    h.fake.energyLog.onCall = [this] { calls.push_back({"energy", payloads(watched.lock())}); };
  }

  std::shared_ptr<VRReportingSession> session(std::int64_t id) {
    auto found = a->instance()->findReportingSessionForID(id, false);
    return found ? found : b->instance()->findReportingSessionForID(id, false);
  }
  long payloads(std::int64_t id) { return payloads(session(id)); }
  static long payloads(const std::shared_ptr<VRReportingSession>& s) {
    auto data = s ? s->aggregatedPayloadData() : nullptr;
    if (!data) return -1;
    MutexLock guard(data->lock);
    return static_cast<long>(data->entries.size());
  }
  // Sends from client a and returns its one reply (an error when there was not exactly one).
  std::optional<Error> send(std::optional<std::vector<std::int64_t>> ids,
                            Dictionary payload = Dictionary{{"volume", 3}}) {
    Replies<std::optional<Error>> replies;
    a->client().sendMessage(std::move(payload), 0x40000003, 1, std::move(ids), replies.callback());
    h.pump();
    EXPECT_EQ(replies.values.size(), 1u);
    return replies.values.size() == 1 ? replies.values[0] : Error{"test", -1, "no single reply"};
  }

  using Calls = std::vector<std::pair<std::string, long>>;
  Calls calls;
  std::weak_ptr<VRReportingSession> watched;
  ServiceHarness h;
  std::unique_ptr<FakeConnection> a, b;
};

// Named sessions get the message whether started or not, after the sinks; empty, zero or
// unknown lists reach nobody.
TEST_F(RoutingTest, AddressedCallsTheSinksBeforeTheNamedSessionsOnly) {
  watched = session(3);
  EXPECT_FALSE(send(std::vector<std::int64_t>{3, 2}, Dictionary{{"EngineOnTime", 4.0}}));
  EXPECT_EQ(calls, (Calls{{"analytics", 0}, {"energy", 0}, {"analytics", 1}, {"energy", 1}}));
  EXPECT_EQ(payloads(3), 1);
  EXPECT_EQ(payloads(1), 0) << "not addressed";
  auto events = h.fake.analytics.events();
  EXPECT_EQ(std::count_if(events.begin(), events.end(),
                          [](auto& e) { return e.name == "com.orvane.vireo.Routing_Playback.Start"; }), 2);
  // The created-but-not-started session sends it on its own.
  h.fake.dispatcher.runLowPriority();
  ASSERT_EQ(h.fake.telemetry.oneShots().size(), 1u);
  EXPECT_EQ(h.fake.tracer.count(trace::kServerSend), 1u);

  // Empty, zero or unknown lists reach nobody, and have no standalone fallback.
  calls.clear();
  for (const auto& ids : {std::vector<std::int64_t>{}, std::vector<std::int64_t>{0, 0}, std::vector<std::int64_t>{0, 99}})
    EXPECT_FALSE(send(ids));
  h.fake.dispatcher.runLowPriority();
  EXPECT_EQ(h.fake.telemetry.oneShots().size(), 1u);
  EXPECT_TRUE(calls.empty());
  EXPECT_EQ(payloads(3), 1);
  auto misses = h.fake.logger.matching("failed to find reporting session 99");
  ASSERT_EQ(misses.size(), 1u);
  EXPECT_EQ(misses[0].level, LogLevel::Error);
  EXPECT_FALSE(h.fake.logger.contains("failed to find reporting session 0"));
}

TEST_F(RoutingTest, BroadcastReachesStartedSessionsOfEveryClientSessionFirst) {
  watched = session(1);
  EXPECT_FALSE(send(std::nullopt, Dictionary{{"EngineOnTime", 4.0}}));
  EXPECT_EQ(payloads(1), 1);
  EXPECT_EQ(payloads(3), 1);
  EXPECT_EQ(payloads(2), 0) << "created but never started";
  // The session had the message before the sinks.
  EXPECT_EQ(calls, (Calls{{"analytics", 1}, {"energy", 1}, {"analytics", 1}, {"energy", 1}}));
  EXPECT_TRUE(h.fake.logger.contains("sessions for client 100 : "));
  EXPECT_TRUE(h.fake.logger.contains("sessions for client 200 : "));
  EXPECT_TRUE(h.fake.logger.contains("active reporting sessions 2 : "));
  h.fake.dispatcher.runLowPriority();
  EXPECT_TRUE(h.fake.telemetry.oneShots().empty());
}

}  // namespace
}  // namespace vireo
