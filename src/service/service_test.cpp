#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "dispatch/thread_pool.h"
#include "fakes/service_fakes.h"

namespace vireo {
namespace {

using testing::FakeConnection;
using testing::FakePlatform;
using testing::Replies;
using testing::ServiceHarness;

class ServiceTest : public ::testing::Test {
 protected:
  std::shared_ptr<VRReportingSession> sessionOf(const FakeConnection& c, std::int64_t id) {
    return c.instance()->findReportingSessionForID(id, false);
  }
  // Creates a session, typed when serviceType is given.
  void create(FakeConnection& c, std::int64_t id, std::uint16_t serviceType = 0xFFFF) {
    c.client().createReportingSession(id, nullptr);
    if (serviceType != 0xFFFF) c.client().setServiceType(serviceType, id, nullptr);
    h.pump();
  }
  // Starts a session; the start reply goes to starts.
  void start(FakeConnection& c, std::int64_t id) {
    c.client().startReportingSessionForID(id, starts.callback());
    h.pump();
  }

  ServiceHarness h;
  Replies<bool> starts;
};

// The end-to-end suite sees the answers; here the value kinds the bus reply is built
// from, and the trace codes (operations on ID 0 still trace, queries never do).
TEST_F(ServiceTest, QueryAnswerKindsAndTraceCodes) {
  auto c = h.connect(100, "player");
  create(*c, 5, 3);
  Replies<Dictionary> known, missing;
  c->client().reporterIDValid(5, known.callback());
  c->client().reporterIDValid(6, missing.callback());
  h.pump();
  EXPECT_EQ(known.values, (std::vector{Dictionary{{"reporterID", 5}, {"serviceType", 3u}}}));
  // Value == tells Int from UInt: the reply's D-Bus types follow from these kinds.
  EXPECT_EQ(missing.values, (std::vector{Dictionary{{"reporterID", 0}, {"serviceType", 0xFFFFu}}}));

  start(*c, 5);
  for (std::int64_t id : {5, 0}) c->client().stopReportingSessionForID(id, nullptr);
  c->client().destroyReportingSession(5, nullptr);
  c->client().getServiceNameForReporterID(5, nullptr);
  h.pump();
  const auto& tracer = h.fake.tracer;
  for (auto [code, n] : {std::pair{trace::kServerCreate, 1u}, {trace::kServerStart, 1u}, {trace::kServerStop, 2u},
                         {trace::kServerDestroy, 1u}, {trace::kSessionCreate, 1u}, {trace::kSessionStart, 1u},
                         {trace::kSessionStop, 1u}})
    EXPECT_EQ(tracer.count(code), n) << code;
}

// A create under an existing ID replaces the session and keeps its place. That a replaced
// session's held start is told so, and that only the owner stops or destroys a session,
// is checked end to end.
TEST_F(ServiceTest, LookupFollowsRegistryOrder) {
  auto first = h.connect(100, "player");
  auto second = h.connect(200, "phone");
  auto asker = h.connect(300, "alarm");
  create(*second, 9, 2);
  create(*first, 9);
  create(*first, 3);
  create(*first, 9, 1);
  Replies<Dictionary> valid;
  asker->client().reporterIDValid(9, valid.callback());
  Replies<std::vector<std::int64_t>> reporters;
  asker->client().getAllReporters(reporters.callback());
  h.pump();
  ASSERT_EQ(valid.values.size(), 1u);
  EXPECT_EQ(*valid.values[0].find("serviceType"), Value(1u)) << "the first connected client wins";
  EXPECT_TRUE(h.fake.logger.contains("found reporting session 9 for client 100"));
  EXPECT_EQ(reporters.values, (std::vector<std::vector<std::int64_t>>{{9, 3, 9}}));
}

TEST_F(ServiceTest, DefaultsFollowTheNotification) {
  EXPECT_FALSE(h.delegate->getDefaults().has_value());
  EXPECT_TRUE(h.fake.logger.contains("notify setup result 0"));
  h.postDefaults();
  EXPECT_EQ(h.delegate->getDefaults(), std::optional(Dictionary{{"disable_reporting", 0}}));
  EXPECT_TRUE(h.fake.logger.contains("re-reading vireo defaults"));

  // The device name reaches existing sessions only.
  auto owner = h.connect(100, "player");
  auto other = h.connect(200, "phone");
  create(*owner, 1);
  create(*owner, 9, 1);
  start(*owner, 9);
  h.fake.defaults.set("device_name", "kitchen");
  h.postDefaults();
  create(*owner, 3);
  EXPECT_EQ(*sessionOf(*owner, 1)->userInfo().find("device_name"), Value("kitchen"));
  EXPECT_EQ(*sessionOf(*owner, 9)->userInfo().find("device_name"), Value("kitchen"));
  EXPECT_FALSE(sessionOf(*owner, 3)->userInfo().contains("device_name"));
  EXPECT_EQ(h.delegate->getDefaults(), std::optional(Dictionary{{"device_name", "kitchen"}, {"disable_reporting", 0}}));

  // Disabled reporting hides sessions from other clients (the switch itself is checked end to end).
  h.fake.defaults.set("disable_reporting", "true");
  h.postDefaults();
  EXPECT_EQ(*h.delegate->getDefaults()->find("disable_reporting"), Value(true));
  std::size_t before = h.fake.logger.size();
  EXPECT_EQ(h.delegate->findReportingSessionForID(9), nullptr);
  EXPECT_EQ(h.delegate->findReportingSessionForID(0), nullptr);
  EXPECT_EQ(h.fake.logger.size(), before) << "disabled and zero lookups log nothing";
  Replies<Dictionary> own, foreign;
  owner->client().reporterIDValid(9, own.callback());
  other->client().reporterIDValid(9, foreign.callback());
  h.pump();
  EXPECT_EQ(*own.values.at(0).find("reporterID"), Value(9)) << "own map is not affected";
  EXPECT_EQ(*foreign.values.at(0).find("reporterID"), Value(0));
  h.fake.defaults.set("disable_reporting", std::nullopt);
  h.postDefaults();
  EXPECT_NE(h.delegate->findReportingSessionForID(9), nullptr);
}

// Uptime counts from registration on the server queue, not from acceptance.
TEST_F(ServiceTest, UptimeEventAtInvalidation) {
  h.fake.processes.setName(100, "player");
  FakeConnection c(100, "<conn 100>");
  EXPECT_TRUE(h.delegate->shouldAcceptNewConnection(c));
  EXPECT_TRUE(c.resumed());
  EXPECT_TRUE(h.delegate->getAllClients().empty());
  h.fake.clock.advance(std::chrono::seconds(3));  // not counted: registration is still queued
  h.pump();
  EXPECT_EQ(h.delegate->getAllClients(), std::vector{c.instance()});
  h.fake.clock.advance(std::chrono::milliseconds(2500));
  c.invalidate();
  h.pump();
  auto events = h.fake.analytics.events();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].name, "com.orvane.vireo.vrreportingclientuptime");
  EXPECT_EQ(events[0].payload, (Dictionary{{"processName", "player"}, {"seconds", 2.5}}));
  EXPECT_TRUE(h.fake.logger.contains("InvalidationHandler: connection exited process=player uptime_sec=2"));
  EXPECT_FALSE(h.fake.logger.contains("clientStartDate is"));
  EXPECT_TRUE(h.delegate->getAllClients().empty());

  // A clock moved back still gives a positive uptime.
  auto back = h.connect(101, "phone");
  h.fake.clock.advance(-std::chrono::seconds(1));
  back->invalidate();
  EXPECT_TRUE(h.fake.logger.contains("clientStartDate is in the past. clientpid=101 clientprocessname=phone"));
  events = h.fake.analytics.events();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(*events[1].payload.find("seconds"), Value(1.0));

  // No process name, or not registered yet: no event.
  auto unnamed = h.connect(102);
  unnamed->invalidate();
  EXPECT_TRUE(h.fake.logger.contains("clientProcessName is nil. clientpid=102"));
  EXPECT_TRUE(h.fake.logger.contains("process=(null) uptime_sec=0"));
  h.fake.processes.setName(103, "early");
  FakeConnection early(103, "<conn 103>");
  h.delegate->shouldAcceptNewConnection(early);
  early.invalidate();
  EXPECT_TRUE(h.fake.logger.contains("clientStartDate is nil. clientpid=103 clientprocessname=unknown"));
  EXPECT_TRUE(h.fake.logger.contains("uptime_sec=-1"));
  EXPECT_EQ(h.fake.analytics.events().size(), 2u);
  h.pump();  // registration, then the queued removal
  EXPECT_TRUE(h.delegate->getAllClients().empty());
}

// Clients call from their own threads while the defaults change, on the real pool:
// every operation only queues, so all replies arrive and nothing races (run under
// the sanitizers).
TEST(ServiceThreadsTest, ConcurrentClientsAllGetTheirReplies) {
  FakePlatform fake;
  ThreadPoolDispatcher pool;
  Platform platform = fake.over(pool);
  auto env = std::make_shared<ReportingEnvironment>(platform);
  auto delegate = VRReportingServiceDelegate::init(env);

  constexpr int kClients = 4, kSessions = 25;
  std::vector<std::unique_ptr<FakeConnection>> connections;
  for (int i = 0; i < kClients; ++i) {
    fake.processes.setName(100 + i, "client" + std::to_string(i));
    connections.push_back(std::make_unique<FakeConnection>(100 + i, "<conn>"));
    delegate->shouldAcceptNewConnection(*connections.back());
  }

  std::atomic<int> answers{0}, errors{0};
  BoolReply onBool = [&](bool ok) { answers += ok ? 1 : 0; };
  ErrorReply onSend = [&](std::optional<Error> e) { (e ? errors : answers) += 1; };
  std::vector<std::thread> threads;
  for (int i = 0; i < kClients; ++i) {
    threads.emplace_back([&, i] {
      VRReportingServiceProtocol& c = connections[i]->client();
      for (std::int64_t id = i * 1000 + 1; id <= i * 1000 + kSessions; ++id) {
        c.createReportingSession(id, onBool);
        c.setServiceType(2, id, onBool);
        c.startReportingSessionForID(id, onBool);
        c.sendMessage(Dictionary{{"n", id}}, 0x40000003, 1, std::nullopt, onSend);
        c.sendMessage(Dictionary{{"n", id}}, 0x40000003, 1, std::vector<std::int64_t>{id, id + 1}, onSend);
        c.stopReportingSessionForID(id, onBool);
        c.destroyReportingSession(id, onBool);
      }
    });
  }
  for (int k = 0; k < 10; ++k) {
    fake.defaults.set("device_name", "device" + std::to_string(k));
    fake.notifications.post(kDefaultsNotification);
  }
  for (auto& t : threads) t.join();
  for (auto& c : connections) c->invalidate();
  EXPECT_TRUE(pool.drain(std::chrono::seconds(30)));

  EXPECT_EQ(answers.load(), kClients * kSessions * 7);
  EXPECT_EQ(errors.load(), 0);
  EXPECT_TRUE(delegate->getAllClients().empty());
  EXPECT_GE(fake.analytics.events().size(), static_cast<std::size_t>(kClients)) << "uptime events";
  pool.shutdown();
}

}  // namespace
}  // namespace vireo
