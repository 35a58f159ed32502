#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "dispatch/thread_pool.h"
#include "fakes/service_fakes.h"

namespace vireo {
namespace {

using testing::FakeConnection;
using testing::ProcessExited;
using testing::Replies;
using testing::ServiceHarness;

class ServiceTest : public ::testing::Test {
 protected:
  std::shared_ptr<VRReportingSession> sessionOf(const FakeConnection& c, std::int64_t id) {
    return c.instance()->findReportingSessionForID(id, false);
  }
  // Creates (and optionally starts) a session; the start reply goes to starts.
  void create(FakeConnection& c, std::int64_t id, std::uint16_t serviceType = 0xFFFF) {
    c.client().createReportingSession(id, nullptr);
    if (serviceType != 0xFFFF) c.client().setServiceType(serviceType, id, nullptr);
    h.pump();
  }
  void start(FakeConnection& c, std::int64_t id) {
    c.client().startReportingSessionForID(id, starts.callback());
    h.pump();
  }

  ServiceHarness h;
  Replies<bool> starts;
};

// ---- replies ----

TEST_F(ServiceTest, BooleanOperationsAnswerTrueOnceForAnyID) {
  auto c = h.connect(100, "player");
  for (std::int64_t id : {std::int64_t{0}, std::int64_t{5}, std::int64_t{99}}) {
    Replies<bool> created, typed, configured, stopped, destroyed;
    if (id != 99) c->client().createReportingSession(id, created.callback());
    c->client().setServiceType(2, id, typed.callback());
    c->client().setConfiguration(Dictionary{{"a", 1}}, id, configured.callback());
    c->client().stopReportingSessionForID(id, stopped.callback());
    c->client().destroyReportingSession(id, destroyed.callback());
    EXPECT_TRUE(typed.values.empty()) << "replies only come from the server queue";
    h.pump();
    if (id != 99) {
      EXPECT_EQ(created.values, std::vector<bool>{true});
    }
    EXPECT_EQ(typed.values, std::vector<bool>{true}) << id;
    EXPECT_EQ(configured.values, std::vector<bool>{true}) << id;
    EXPECT_EQ(stopped.values, std::vector<bool>{true}) << id;
    EXPECT_EQ(destroyed.values, std::vector<bool>{true}) << id;
  }
  EXPECT_EQ(h.fake.tracer.count(trace::kServerCreate), 2u);
  EXPECT_EQ(h.fake.tracer.count(trace::kServerStop), 3u);
  EXPECT_EQ(h.fake.tracer.count(trace::kServerDestroy), 3u);
  EXPECT_TRUE(h.fake.logger.contains("destroying 99"));
  EXPECT_FALSE(h.fake.logger.contains("destroying 0"));
}

TEST_F(ServiceTest, ServiceTypeQueryAnswersTwiceForIDZero) {
  auto a = h.connect(100, "player");
  auto b = h.connect(200, "phone");
  create(*a, 5, 3);
  Replies<std::uint16_t> zero, unknown, own, other;
  a->client().getServiceNameForReporterID(0, zero.callback());
  a->client().getServiceNameForReporterID(42, unknown.callback());
  a->client().getServiceNameForReporterID(5, own.callback());
  b->client().getServiceNameForReporterID(5, other.callback());
  h.pump();
  EXPECT_EQ(zero.values, (std::vector<std::uint16_t>{0xFFFF, 0xFFFF}));
  EXPECT_EQ(unknown.values, std::vector<std::uint16_t>{0xFFFF});
  EXPECT_EQ(own.values, std::vector<std::uint16_t>{3});
  EXPECT_EQ(other.values, std::vector<std::uint16_t>{3}) << "found across clients";
}

TEST_F(ServiceTest, StartAnswersWhenTheSessionStopsAndNeverForUnknownOrRunning) {
  auto c = h.connect(100, "player");
  Replies<bool> zero, unknown, again;
  c->client().startReportingSessionForID(0, zero.callback());
  c->client().startReportingSessionForID(77, unknown.callback());
  create(*c, 5);
  start(*c, 5);
  EXPECT_EQ(zero.values, std::vector<bool>{true});
  EXPECT_TRUE(unknown.values.empty());
  EXPECT_TRUE(starts.values.empty()) << "held until the stop";
  EXPECT_TRUE(sessionOf(*c, 5)->started());
  EXPECT_EQ(h.drivers.samplesTaken(), 1);

  c->client().startReportingSessionForID(5, again.callback());
  h.pump();
  EXPECT_EQ(h.drivers.samplesTaken(), 1) << "no second snapshot";

  c->client().stopReportingSessionForID(5, nullptr);
  h.pump();
  EXPECT_EQ(starts.values, std::vector<bool>{true});
  EXPECT_TRUE(again.values.empty());

  // Started again: the earlier start is answered once more, the new one at its stop.
  Replies<bool> third;
  c->client().startReportingSessionForID(5, third.callback());
  h.pump();
  EXPECT_EQ(starts.values, (std::vector<bool>{true, true}));
  EXPECT_TRUE(third.values.empty());
  c->client().stopReportingSessionForID(5, nullptr);
  h.pump();
  EXPECT_EQ(third.values, std::vector<bool>{true});
  EXPECT_TRUE(unknown.values.empty());
  EXPECT_TRUE(again.values.empty());
}

TEST_F(ServiceTest, ValidationAnswersWithBusKinds) {
  auto c = h.connect(100, "player");
  create(*c, 5, 2);
  Replies<Dictionary> known, unknown;
  c->client().reporterIDValid(5, known.callback());
  c->client().reporterIDValid(6, unknown.callback());
  h.pump();
  ASSERT_EQ(known.values.size(), 1u);
  ASSERT_EQ(unknown.values.size(), 1u);
  EXPECT_EQ(known.values[0], (Dictionary{{"reporterID", 5}, {"serviceType", 2u}}));
  const Dictionary& none = unknown.values[0];
  ASSERT_EQ(none.size(), 2u);
  EXPECT_EQ(none[0].first, Value("reporterID"));
  EXPECT_EQ(none[0].second.kind(), Value::Kind::Int);
  EXPECT_EQ(none[0].second.toInt64(), 0);
  EXPECT_EQ(none[1].first, Value("serviceType"));
  EXPECT_EQ(none[1].second.kind(), Value::Kind::UInt);
  EXPECT_EQ(none[1].second.toInt64(), 0xFFFF);
}

TEST_F(ServiceTest, KillServiceExitsWithStatusTwoWithoutReplyOrQueueing) {
  auto c = h.connect(100, "player");
  Replies<bool> killed;
  try {
    c->client().killService(killed.callback());
    ADD_FAILURE() << "killService returned";
  } catch (const ProcessExited& exited) {
    EXPECT_EQ(exited.status, 2);
  }
  EXPECT_EQ(h.fake.process.statuses(), std::vector<int>{2});
  EXPECT_EQ(h.serverQueue()->pending(), 0u);
  EXPECT_TRUE(killed.values.empty());
  EXPECT_TRUE(h.fake.logger.contains("DESTROYING SERVICE"));
}

// ---- sessions ----

TEST_F(ServiceTest, CreateUnderAnExistingIDReplacesWithoutStoppingAndKeepsItsPlace) {
  auto c = h.connect(100, "player");
  create(*c, 5);
  create(*c, 6);
  start(*c, 5);
  auto first = sessionOf(*c, 5);
  create(*c, 5);
  auto second = sessionOf(*c, 5);
  EXPECT_NE(first, second);
  EXPECT_TRUE(first->started());
  EXPECT_FALSE(second->started());
  Replies<std::vector<std::int64_t>> reporters;
  c->client().getAllReporters(reporters.callback());
  h.pump();
  EXPECT_EQ(reporters.values, (std::vector<std::vector<std::int64_t>>{{5, 6}}));
}

TEST_F(ServiceTest, StopSendsTheDriverDeltaIntoTheSessionBeforeStopping) {
  auto c = h.connect(100, "player");
  create(*c, 5, 2);
  h.drivers.setValue(10);
  start(*c, 5);
  h.drivers.setValue(13);
  c->client().stopReportingSessionForID(5, nullptr);
  h.pump();
  EXPECT_FALSE(sessionOf(*c, 5)->started());
  EXPECT_EQ(sessionOf(*c, 5)->driverSnapShot(), nullptr);
  EXPECT_TRUE(h.fake.logger.contains("fetching driver logs"));
  EXPECT_TRUE(h.fake.logger.contains("stopping 5"));

  auto telemetry = h.fake.telemetry.lastSession();
  ASSERT_NE(telemetry, nullptr);
  auto sent = telemetry->sent();
  ASSERT_GE(sent.size(), 2u) << "driver delta, then the summary";
  EXPECT_EQ(sent[0].category, 9);
  EXPECT_EQ(sent[0].type, 0);
  ASSERT_NE(sent[0].payload.find("Speaker_X"), nullptr);
  EXPECT_EQ(sent[0].payload.find("Speaker_X")->toInt64(), 3);
  EXPECT_EQ(sent.back().type, 0xFFFF);
}

TEST_F(ServiceTest, StopWithoutDriverGrowthStillStops) {
  auto c = h.connect(100, "player");
  create(*c, 5);
  start(*c, 5);
  c->client().stopReportingSessionForID(5, nullptr);
  h.pump();
  EXPECT_TRUE(h.fake.logger.contains("nothing interesting to fetch from the drivers"));
  EXPECT_FALSE(sessionOf(*c, 5)->started());
  EXPECT_EQ(starts.values, std::vector<bool>{true});
}

TEST_F(ServiceTest, OtherClientsMayStartButNotStopOrDestroyASession) {
  auto owner = h.connect(100, "player");
  auto other = h.connect(200, "phone");
  create(*owner, 5);
  start(*other, 5);
  ASSERT_TRUE(sessionOf(*owner, 5)->started());
  Replies<bool> stopped, destroyed;
  other->client().stopReportingSessionForID(5, stopped.callback());
  other->client().destroyReportingSession(5, destroyed.callback());
  h.pump();
  EXPECT_EQ(stopped.values, std::vector<bool>{true});
  EXPECT_EQ(destroyed.values, std::vector<bool>{true});
  ASSERT_NE(sessionOf(*owner, 5), nullptr);
  EXPECT_TRUE(sessionOf(*owner, 5)->started());
}

TEST_F(ServiceTest, DestroyStopsARunningSessionAndRemovesIt) {
  auto c = h.connect(100, "player");
  create(*c, 5);
  start(*c, 5);
  auto session = sessionOf(*c, 5);
  c->client().destroyReportingSession(5, nullptr);
  h.pump();
  EXPECT_FALSE(session->started());
  EXPECT_EQ(sessionOf(*c, 5), nullptr);
  EXPECT_EQ(starts.values, std::vector<bool>{true});
}

// ---- registry ----

TEST_F(ServiceTest, LookupAcrossClientsFollowsRegistryOrder) {
  auto first = h.connect(100, "player");
  auto second = h.connect(200, "phone");
  auto asker = h.connect(300, "alarm");
  create(*second, 9, 2);
  create(*first, 9, 1);
  create(*first, 3);
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

// ---- defaults ----

TEST_F(ServiceTest, DefaultsAreAbsentAndReportingOnUntilTheFirstNotification) {
  EXPECT_FALSE(h.delegate->getDefaults().has_value());
  EXPECT_TRUE(h.delegate->isReportingEnabled());
  auto regs = h.fake.notifications.registrations();
  ASSERT_EQ(regs.size(), 1u);
  EXPECT_EQ(regs[0].name, "com.orvane.vireo.reporting");
  EXPECT_EQ(regs[0].queue, std::static_pointer_cast<SerialQueue>(h.serverQueue()));
  EXPECT_EQ(h.serverQueue()->qos(), QoS::UserInteractive);
  EXPECT_TRUE(h.fake.logger.contains("notify setup result 0"));

  h.postDefaults();
  ASSERT_TRUE(h.delegate->getDefaults().has_value());
  EXPECT_EQ(*h.delegate->getDefaults(), (Dictionary{{"disable_reporting", 0}}));
  EXPECT_EQ(h.delegate->getDefaults()->find("disable_reporting")->kind(), Value::Kind::Int);
  EXPECT_TRUE(h.delegate->isReportingEnabled());
  EXPECT_TRUE(h.fake.logger.contains("re-reading vireo defaults"));
}

TEST_F(ServiceTest, DeviceNameReachesExistingSessionsOnly) {
  auto c = h.connect(100, "player");
  create(*c, 1);
  create(*c, 2);
  start(*c, 2);
  h.fake.defaults.set("com.orvane.vireo", "device_name", "kitchen");
  h.postDefaults();
  create(*c, 3);
  EXPECT_EQ(*sessionOf(*c, 1)->userInfo().find("device_name"), Value("kitchen"));
  EXPECT_EQ(*sessionOf(*c, 2)->userInfo().find("device_name"), Value("kitchen"));
  EXPECT_FALSE(sessionOf(*c, 3)->userInfo().contains("device_name"));
  EXPECT_EQ(*h.delegate->getDefaults(), (Dictionary{{"device_name", "kitchen"}, {"disable_reporting", 0}}));
}

TEST_F(ServiceTest, DisableReportingHidesOtherClientsAndDeletingTheKeyRestores) {
  auto owner = h.connect(100, "player");
  auto other = h.connect(200, "phone");
  create(*owner, 9, 1);
  h.fake.defaults.set("com.orvane.vireo", "disable_reporting", "true");
  h.postDefaults();
  EXPECT_FALSE(h.delegate->isReportingEnabled());
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

  h.fake.defaults.remove("com.orvane.vireo", "disable_reporting");
  h.postDefaults();
  EXPECT_TRUE(h.delegate->isReportingEnabled());
  EXPECT_NE(h.delegate->findReportingSessionForID(9), nullptr);
}

// ---- connection lifetime ----

TEST_F(ServiceTest, AcceptedClientIsRegisteredOnTheServerQueue) {
  h.fake.processes.setName(100, "player");
  FakeConnection c(100, "<conn 100>");
  EXPECT_TRUE(h.delegate->shouldAcceptNewConnection(c));
  EXPECT_TRUE(c.resumed());
  ASSERT_NE(c.instance(), nullptr);
  EXPECT_TRUE(h.delegate->getAllClients().empty());
  EXPECT_TRUE(h.fake.logger.contains("newConnection: <conn 100>"));
  EXPECT_TRUE(h.fake.logger.contains("new client with pid 100"));

  const WallTime registeredAt = h.fake.clock.now() + std::chrono::seconds(3);
  h.fake.clock.set(registeredAt);
  h.pump();
  EXPECT_EQ(h.delegate->getAllClients(), std::vector{c.instance()});
  EXPECT_EQ(c.instance()->clientStartDate(), registeredAt);
  EXPECT_EQ(c.instance()->clientProcessName(), "player");
}

TEST_F(ServiceTest, ProcessNameLookup) {
  h.fake.processes.setSelf(4242, "vireod");
  h.fake.processes.setName(7, "player");
  h.fake.processes.setName(0, "kernel");
  EXPECT_EQ(VRReportingProcessName(h.fake.processes, 4242), "vireod");
  EXPECT_EQ(VRReportingProcessName(h.fake.processes, 7), "player");
  EXPECT_EQ(VRReportingProcessName(h.fake.processes, 8), std::nullopt);
  EXPECT_EQ(VRReportingProcessName(h.fake.processes, 0), std::nullopt);
  EXPECT_EQ(VRReportingProcessName(h.fake.processes, -3), std::nullopt);
}

TEST_F(ServiceTest, ConnectionErrorStopsSessionsAndActsOnlyOnce) {
  auto c = h.connect(100, "player");
  create(*c, 5);
  create(*c, 6);
  start(*c, 5);
  c->interrupt();
  EXPECT_TRUE(h.fake.logger.contains("InterruptionHandler: connection exited"));
  EXPECT_EQ(h.delegate->getAllClients().size(), 1u) << "removal is queued";
  h.pump();
  EXPECT_TRUE(h.delegate->getAllClients().empty());
  EXPECT_FALSE(sessionOf(*c, 5)->started());
  EXPECT_NE(sessionOf(*c, 6), nullptr) << "sessions stay in the map";
  EXPECT_EQ(starts.values, std::vector<bool>{true});

  c->invalidate();
  h.pump();
  EXPECT_EQ(h.fake.logger.count("removing 100 from the server client list"), 1u);
  EXPECT_FALSE(h.fake.logger.contains("dealloc 100"));
  c->release();
  EXPECT_TRUE(h.fake.logger.contains("dealloc 100 from the server client list"));
}

TEST_F(ServiceTest, InvalidationSendsTheUptimeEvent) {
  auto c = h.connect(100, "player");
  h.fake.clock.advance(std::chrono::milliseconds(2500));
  c->invalidate();
  h.pump();
  auto events = h.fake.analytics.events();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].name, "com.orvane.vireo.vrreportingclientuptime");
  EXPECT_EQ(events[0].payload, (Dictionary{{"processName", "player"}, {"seconds", 2.5}}));
  EXPECT_TRUE(h.fake.logger.contains("InvalidationHandler: connection exited process=player uptime_sec=2"));
  EXPECT_FALSE(h.fake.logger.contains("clientStartDate is"));
  EXPECT_TRUE(h.delegate->getAllClients().empty());
}

TEST_F(ServiceTest, AClockMovedBackStillGivesAPositiveUptime) {
  auto c = h.connect(100, "player");
  h.fake.clock.advance(-std::chrono::seconds(1));
  c->invalidate();
  EXPECT_TRUE(h.fake.logger.contains("clientStartDate is in the past. clientpid=100 clientprocessname=player"));
  auto events = h.fake.analytics.events();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(*events[0].payload.find("seconds"), Value(1.0));
}

TEST_F(ServiceTest, UnknownProcessNameSendsNoEvent) {
  auto c = h.connect(100);
  c->invalidate();
  EXPECT_TRUE(h.fake.analytics.events().empty());
  EXPECT_TRUE(h.fake.logger.contains("clientProcessName is nil. clientpid=100"));
  EXPECT_TRUE(h.fake.logger.contains("process=(null) uptime_sec=0"));
}

TEST_F(ServiceTest, InvalidationBeforeRegistrationLeavesNoClientBehind) {
  h.fake.processes.setName(100, "player");
  FakeConnection c(100, "<conn 100>");
  h.delegate->shouldAcceptNewConnection(c);
  c.invalidate();
  EXPECT_TRUE(h.fake.logger.contains("clientStartDate is nil. clientpid=100 clientprocessname=unknown"));
  EXPECT_TRUE(h.fake.logger.contains("uptime_sec=-1"));
  EXPECT_TRUE(h.fake.analytics.events().empty());
  h.pump();  // registration, then the queued removal
  EXPECT_TRUE(h.delegate->getAllClients().empty());
}

}  // namespace
}  // namespace vireo

namespace vireo {
namespace {

using testing::FakeConnection;
using testing::FakePlatform;

// Clients call from their own threads while the defaults change, on the real pool:
// every operation only queues, so all replies arrive and nothing races (run under
// the sanitizers).
TEST(ServiceThreadsTest, ConcurrentClientsAllGetTheirReplies) {
  FakePlatform fake;
  ThreadPoolDispatcher pool;
  Platform platform{fake.logger, fake.tracer,   fake.clock,         fake.random,  pool,
                    fake.telemetry, fake.analytics, fake.energyLog, fake.defaults, fake.notifications,
                    fake.device,    fake.processes, fake.files,     fake.driverStats, fake.process};
  auto env = std::make_shared<ReportingEnvironment>(platform);
  auto delegate = VRReportingServiceDelegate::init(env);

  constexpr int kClients = 4;
  constexpr int kSessions = 25;
  std::vector<std::unique_ptr<FakeConnection>> connections;
  for (int i = 0; i < kClients; ++i) {
    fake.processes.setName(100 + i, "client" + std::to_string(i));
    connections.push_back(std::make_unique<FakeConnection>(100 + i, "<conn>"));
    delegate->shouldAcceptNewConnection(*connections.back());
  }

  std::atomic<int> answers{0};
  std::atomic<int> errors{0};
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
    fake.defaults.set("com.orvane.vireo", "device_name", "device" + std::to_string(k));
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
