#include "platform/linux/store/telemetry_service.h"

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <thread>

#include "platform/linux/store/analytics_service.h"
#include "platform/linux/store/energy_log_service.h"
#include "platform/linux/store/store_test_support.h"
#include "platform/linux/system_clock.h"

namespace vireo::linux_platform {
namespace {

using namespace std::chrono_literals;
using testing::Reader;
using testing::RecordingLogger;
using testing::TempDir;
using Backends = std::optional<std::vector<std::string>>;

struct ServicesTest : ::testing::Test {
  TempDir dir;
  SystemClock clock;
  RecordingLogger logger;
  std::shared_ptr<LocalStore> store = std::make_shared<LocalStore>(dir.sub("state"), logger, clock);
  std::string db() const { return dir.sub("state/vireo.db"); }
};

struct Configured {
  Backends backends;
  std::thread::id thread;
};

Configured configure(TelemetrySession& session) {
  std::promise<Configured> answer;
  session.startConfiguration([&](Backends backends) {
    answer.set_value(Configured{std::move(backends), std::this_thread::get_id()});
  });
  auto future = answer.get_future();
  EXPECT_EQ(future.wait_for(5s), std::future_status::ready);
  return future.get();
}

std::optional<Error> flush(TelemetrySession& session) {
  std::promise<std::optional<Error>> answer;
  session.flushMessages([&](std::optional<Error> error) { answer.set_value(std::move(error)); });
  auto future = answer.get_future();
  EXPECT_EQ(future.wait_for(15s), std::future_status::ready);
  return future.get();
}

TEST_F(ServicesTest, SessionRowCarriesInfoTokenAndMessages) {
  LocalTelemetryService service(store, dir.path());
  auto token = service.makeHierarchyToken();
  ASSERT_EQ(token->text.size(), 32u);
  EXPECT_EQ(token->text.find_first_not_of("0123456789abcdef"), std::string::npos);
  EXPECT_NE(service.makeHierarchyToken()->text, token->text);

  Dictionary info{{"client_type", 19}, {"client_version", 2.0}, {"session_id", 7}, {"batch_event", true},
                  {"hierarchy_token", token->text}};
  Dictionary user{{"client_name", "com.orvane.vireo"}, {"service_name", "telephony_session"}, {"Host", "x"}};
  auto session = service.createSession(info, user, {});
  auto* local = dynamic_cast<LocalTelemetrySession*>(session.get());
  ASSERT_TRUE(local && local->rowId());
  const std::string id = std::to_string(*local->rowId());
  EXPECT_EQ(session->description(), "<LocalTelemetrySession id=" + id + " token=" + token->text + ">");

  std::optional<Error> error;
  EXPECT_TRUE(session->sendMessage(8, 4, Dictionary{{"a_b", 1}}, &error));
  EXPECT_TRUE(session->sendMessage(3, 1, Dictionary{{"n", "v"}}, &error));
  EXPECT_FALSE(error);
  EXPECT_EQ(flush(*session), std::nullopt);

  // Visible as soon as the flush has answered, without another flush.
  Reader reader(db());
  EXPECT_EQ(reader.scalar("SELECT group_concat(key) FROM telemetry_sessions, json_each(session_info)"),
            "client_type,client_version,session_id,batch_event,hierarchy_token");
  EXPECT_EQ(reader.scalar("SELECT json_extract(session_info, '$.hierarchy_token') FROM telemetry_sessions"),
            token->text);
  EXPECT_EQ(reader.scalar("SELECT group_concat(key) FROM telemetry_sessions, json_each(user_info)"),
            "client_name,service_name,Host");
  EXPECT_EQ(reader.scalar("SELECT flushed_at > created_at - 1 FROM telemetry_sessions"), "1");
  EXPECT_EQ(reader.scalar("SELECT group_concat(session || ':' || category || ':' || type || ':' || payload, ' ') "
                          "FROM telemetry_messages WHERE session_info IS NULL AND user_info IS NULL"),
            id + ":8:4:{\"a_b\":1} " + id + ":3:1:{\"n\":\"v\"}");
}

TEST_F(ServicesTest, BackendDiscoveryFollowsTelemetryConf) {
  auto service = std::make_unique<LocalTelemetryService>(store, dir.path());
  struct Case {
    const char* file;  // nullptr: no telemetry.conf
    Backends answer;
    std::optional<std::string> column;
  };
  const Case cases[] = {
      {nullptr, std::vector<std::string>{"local"}, R"(["local"])"},
      {"# nothing here\nOther=1\n", std::vector<std::string>{"local"}, R"(["local"])"},
      {"Backends=none\n", std::nullopt, std::nullopt},
      {"Backends=\n", std::vector<std::string>{}, "[]"},
      {"Backends = local , remote\n", std::vector<std::string>{"local", "remote"}, R"(["local","remote"])"},
  };
  std::optional<std::thread::id> serviceThread;
  Reader reader(db());
  for (const auto& c : cases) {
    std::filesystem::remove(dir.sub("telemetry.conf"));
    if (c.file) dir.write("telemetry.conf", c.file);
    auto session = service->createSession(Dictionary{}, Dictionary{}, {});
    auto configured = configure(*session);
    EXPECT_EQ(configured.backends, c.answer) << (c.file ? c.file : "no file");
    // One long-lived thread of the service's own answers every call.
    EXPECT_NE(configured.thread, std::this_thread::get_id());
    if (serviceThread) {
      EXPECT_EQ(configured.thread, *serviceThread);
    }
    serviceThread = configured.thread;
    ASSERT_TRUE(store->flush(5s));
    auto id = std::to_string(*dynamic_cast<LocalTelemetrySession&>(*session).rowId());
    auto rows = reader.query("SELECT backends FROM telemetry_sessions WHERE id = " + id);
    ASSERT_EQ(rows.size(), 1u);
    EXPECT_EQ(rows[0][0], c.column) << (c.file ? c.file : "no file");
  }

  // A session keeps working after its service is gone.
  std::filesystem::remove(dir.sub("telemetry.conf"));
  auto orphan = service->createSession(Dictionary{}, Dictionary{}, {});
  service.reset();
  EXPECT_EQ(configure(*orphan).backends, Backends(std::vector<std::string>{"local"}));
  EXPECT_EQ(flush(*orphan), std::nullopt);
}

TEST_F(ServicesTest, OneShotMessageCarriesItsOwnInfo) {
  LocalTelemetryService service(store, dir.path());
  Dictionary info{{"client_type", 19}, {"client_version", 2.0}, {"session_id", -1}};
  Dictionary user{{"client_name", "com.orvane.vireo"}, {"service_name", "alarms"}};
  std::optional<Error> error;
  ASSERT_TRUE(service.sendOneMessage(info, user, 8, 4, Dictionary{{"a_b", 1}}, &error));
  ASSERT_TRUE(store->flush(5s));
  auto rows = Reader(db()).query("SELECT session, session_info, user_info, category, type, payload "
                                 "FROM telemetry_messages");
  ASSERT_EQ(rows.size(), 1u);
  EXPECT_EQ(rows[0], (testing::Row{std::nullopt, R"({"client_type":19,"client_version":2.0,"session_id":-1})",
                                   R"({"client_name":"com.orvane.vireo","service_name":"alarms"})", "8", "4",
                                   R"({"a_b":1})"}));
}

TEST_F(ServicesTest, AnalyticsExcludedEventsNeverBuildTheirPayload) {
  dir.write("analytics.conf", "Exclude = com.orvane.vireo.Error.*, *.Debug\n");
  LocalAnalyticsService analytics(store, dir.path());
  int calls = 0;
  auto payload = [&] {
    ++calls;
    return Dictionary{{"HostApplicationDisplayID", "Unknown"}, {"k", 1}};
  };
  analytics.sendEventLazy("com.orvane.vireo.Error.Error", payload);
  analytics.sendEventLazy("com.orvane.vireo.Routing_Playback.Debug", payload);
  analytics.sendEventLazy("com.orvane.vireo.Routing_Playback.Start", payload);
  EXPECT_EQ(calls, 1);

  dir.write("analytics.conf", "Exclude=\n");
  analytics.reload();
  analytics.sendEventLazy("com.orvane.vireo.Error.Error", payload);
  EXPECT_EQ(calls, 2);

  LocalEnergyLogService energy(store);
  energy.logEvent(28, "Lumen_Haptics", Dictionary{{"EngineOnDuration", 1.5}, {"ApplicationName", "Unknown"}});

  ASSERT_TRUE(store->flush(5s));
  Reader reader(db());
  EXPECT_EQ(reader.scalar("SELECT group_concat(name || '=' || payload, ' ') FROM analytics_events"),
            R"(com.orvane.vireo.Routing_Playback.Start={"HostApplicationDisplayID":"Unknown","k":1} )"
            R"(com.orvane.vireo.Error.Error={"HostApplicationDisplayID":"Unknown","k":1})");
  EXPECT_EQ(reader.scalar("SELECT client || ' ' || name || ' ' || payload FROM energy_events"),
            R"(28 Lumen_Haptics {"EngineOnDuration":1.5,"ApplicationName":"Unknown"})");
}

TEST_F(ServicesTest, UnwritableStateDirectoryMakesSendsFailWithoutCrashing) {
  dir.write("plain-file", "not a directory");
  auto broken = std::make_shared<LocalStore>(dir.sub("plain-file/state"), logger, clock);
  EXPECT_FALSE(broken->usable());
  EXPECT_FALSE(logger.errors().empty());

  LocalTelemetryService service(broken, dir.path());
  auto session = service.createSession(Dictionary{}, Dictionary{}, {});
  std::optional<Error> error;
  EXPECT_FALSE(session->sendMessage(1, 2, Dictionary{}, &error));
  ASSERT_TRUE(error);
  EXPECT_FALSE(error->description.empty());
  error.reset();
  EXPECT_FALSE(service.sendOneMessage(Dictionary{}, Dictionary{}, 1, 2, Dictionary{}, &error));
  EXPECT_TRUE(error);
  EXPECT_TRUE(flush(*session).has_value());
  EXPECT_EQ(configure(*session).backends, Backends(std::vector<std::string>{"local"}));

  int calls = 0;
  LocalAnalyticsService(broken, dir.path()).sendEventLazy("e", [&] {
    ++calls;
    return Dictionary{};
  });
  LocalEnergyLogService(broken).logEvent(28, "Lumen_Haptics", Dictionary{});
  EXPECT_EQ(calls, 1);
  EXPECT_FALSE(broken->flush(1s));
}

}  // namespace
}  // namespace vireo::linux_platform
