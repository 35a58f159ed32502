// Messages and events as they reach the local store, the reporting switch, and the
// files the service leaves behind.
#include <signal.h>

#include <filesystem>
#include <fstream>

#include "service_fixture.h"

namespace vireo::itest {
namespace {

namespace fs = std::filesystem;

class StoreTest : public ServiceTest {
 protected:
  // Waits until the query finds at least n messages and returns them.
  std::vector<nlohmann::json> messages(const std::string& where, std::size_t n = 1) {
    std::vector<nlohmann::json> found;
    eventually([&] { return (found = rows("SELECT * FROM telemetry_messages WHERE " + where + " ORDER BY id")).size() >= n; },
               15s);
    return found;
  }
};

TEST_F(StoreTest, MessagesSummariesEventsAndACleanExit) {
  auto c = connect();
  ASSERT_TRUE(c);
  // Without started sessions a broadcast goes out as a one-shot message.
  ASSERT_TRUE(c->sendMessage(Dictionary{{"k", Value(1)}}, 0x10000008, 4));
  auto found = messages("category = 8");
  ASSERT_EQ(found.size(), 1u);
  EXPECT_TRUE(found[0]["session"].is_null());
  EXPECT_EQ(found[0]["user_info"]["service_name"], "standalone");
  // An empty ID list reaches nobody (checked once everything is committed).
  ASSERT_TRUE(c->sendMessage(Dictionary{{"k", Value(2)}}, 0x1000000A, 4, std::vector<std::int64_t>{}));

  // Keys are cleaned, the category keeps its low 16 bits.
  auto start5 = startSession(*c, 5, 2);
  ASSERT_TRUE(c->sendMessage(Dictionary{{"buffer size", Value(512)}, {"a  b", Value("x")}, {"ratio", Value(0.5)}},
                             0x40000003, 1, std::vector<std::int64_t>{5}));
  found = messages("type = 1");
  ASSERT_EQ(found.size(), 1u);
  EXPECT_EQ(found[0]["category"], 3);
  EXPECT_EQ(found[0]["payload"]["buffer_size"], 512);
  EXPECT_EQ(found[0]["payload"]["a__b"], "x");
  EXPECT_EQ(found[0]["payload"]["ratio"], 0.5);
  ASSERT_FALSE(found[0]["session"].is_null());
  EXPECT_TRUE(found[0]["user_info"].is_null());  // a session's message has its session's infos
  auto sessions = rows("SELECT * FROM telemetry_sessions WHERE id = " + found[0]["session"].dump());
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_EQ(sessions[0]["user_info"]["service_name"], "telephony_session");
  EXPECT_TRUE(eventually([&] {
    return count("SELECT COUNT(*) FROM analytics_events WHERE name = 'com.orvane.vireo.Routing_Playback.Start'") == 1;
  }));

  // A client that leaves is reported with its uptime.
  {
    auto brief = connect();
    ASSERT_TRUE(brief);
    ASSERT_EQ(*brief->createReportingSession(3), true);
    std::this_thread::sleep_for(200ms);
  }

  // Every stop sends a summary gathering the session's entries under their
  // message identifiers; restarted, the session counts on (its own summary was
  // Undefined_Unknown_1, the next is Undefined_Unknown_2).
  auto start8 = startSession(*c, 8, 7);
  ASSERT_TRUE(c->sendMessage(Dictionary{{"a", Value(1)}}, 0x40000003, 1, std::vector<std::int64_t>{8}));
  ASSERT_TRUE(c->sendMessage(Dictionary{{"a", Value(2)}}, 0x40000003, 1, std::vector<std::int64_t>{8}));
  ASSERT_EQ(*c->stopReportingSessionForID(8), true);
  ASSERT_TRUE(start8.waitFor(5s));
  found = messages("category = 65535 AND type = 65535");
  ASSERT_EQ(found.size(), 1u);
  const auto& summary = found[0]["payload"];
  EXPECT_EQ(summary["VR_Session_Summary_Event"], "7") << summary.dump();
  EXPECT_TRUE(summary.contains("Routing_Playback_Start_1")) << summary.dump();
  EXPECT_TRUE(summary.contains("Routing_Playback_Start_2")) << summary.dump();
  auto again = c->startReportingSessionForID(8);
  ASSERT_TRUE(c->sendMessage(Dictionary{{"b", Value("x")}}, 0x40000003, 1, std::vector<std::int64_t>{8}));
  ASSERT_EQ(*c->stopReportingSessionForID(8), true);
  found = messages("category = 65535 AND type = 65535", 2);
  ASSERT_EQ(found.size(), 2u);
  EXPECT_TRUE(found[1]["payload"].contains("Routing_Playback_Start_3")) << found[1].dump();
  // Only internal builds write the session file.
  EXPECT_FALSE(fs::exists(fs::path(logsDir_) / "Audio" / "Reporting"));

  std::vector<nlohmann::json> uptime;
  ASSERT_TRUE(eventually([&] {
    return !(uptime = rows("SELECT * FROM analytics_events WHERE name = 'com.orvane.vireo.vrreportingclientuptime'"))
                .empty();
  }, 10s));
  EXPECT_TRUE(uptime[0]["payload"]["processName"].is_string());
  EXPECT_GE(uptime[0]["payload"]["seconds"].get<double>(), 0.1);

  // Pipelined sends each get their answer; SIGTERM then exits 0 with every row committed.
  auto start6 = startSession(*c, 6, 0);
  int answered = 0;
  for (int i = 0; i < 20; ++i)
    ASSERT_TRUE(c->sendMessageAsync(Dictionary{{"i", Value(i)}}, 0x08000005, 3, std::vector<std::int64_t>{6},
                                    [&](const client::Status& s) { answered += s.ok(); }));
  ASSERT_TRUE(eventually([&] {
    c->pump(100ms);
    return answered == 20;
  }));
  daemon_.signal(SIGTERM);
  EXPECT_EQ(daemon_.waitExit(15s), 0);
  EXPECT_EQ(count("SELECT COUNT(*) FROM telemetry_messages WHERE category = 5 AND type = 3"), 20);
  EXPECT_EQ(count("SELECT COUNT(*) FROM telemetry_messages WHERE category = 10"), 0);
  EXPECT_FALSE(fs::exists(fs::path(logsDir_) / "Audio" / "Reporting"));
}

TEST_F(StoreTest, ReportingSwitchFollowsTheNotificationAndSighup) {
  auto c = connect();
  ASSERT_TRUE(c);
  auto start = startSession(*c, 1, 2);
  const std::string suite = configDir_ + "/com.orvane.vireo.conf";
  writeFile(suite, "disable_reporting = true\n");
  ASSERT_TRUE(c->postNotification(client::kReportingNotification));
  client::Status last = client::Done{};
  EXPECT_TRUE(eventually([&] { return !(last = c->sendMessage(Dictionary{{"k", Value(1)}}, 3, 1)).ok(); }));
  ASSERT_FALSE(last);
  EXPECT_EQ(last.error().name, client::kReportingDisabledError);
  EXPECT_TRUE(last.error().isReportingDisabled());
  EXPECT_EQ(last.error().domain, "com.orvane.audio.reporting");
  EXPECT_EQ(last.error().code, 1);
  // Refused, addressed or not, before any session or sink sees it (checked in the store below).
  EXPECT_FALSE(c->sendMessage(Dictionary{{"refused", Value(1)}}, 0x40000003, 1, std::vector<std::int64_t>{1}));

  writeFile(suite, "# reporting back on\n");
  ASSERT_TRUE(c->postNotification(client::kReportingNotification));
  EXPECT_TRUE(eventually([&] { return c->sendMessage(Dictionary{{"k", Value(1)}}, 3, 1).ok(); }));

  writeFile(suite, "disable_reporting=yes\n");
  daemon_.signal(SIGHUP);
  EXPECT_TRUE(eventually([&] { return !c->sendMessage(Dictionary{}, 3, 1).ok(); }));
  EXPECT_FALSE(c->sendMessage(Dictionary{{"refused", Value(2)}}, 0x40000003, 1));
  daemon_.signal(SIGTERM);  // every row committed
  EXPECT_EQ(daemon_.waitExit(15s), 0);
  EXPECT_EQ(count("SELECT COUNT(*) FROM telemetry_messages WHERE payload LIKE '%refused%'"), 0);
  EXPECT_EQ(count("SELECT COUNT(*) FROM analytics_events WHERE payload LIKE '%refused%'"), 0);
  EXPECT_GT(count("SELECT COUNT(*) FROM telemetry_messages WHERE session IS NOT NULL"), 0);  // the session was reachable
}

// An internal build with one driver reporting statistics.
class InternalBuildTest : public StoreTest {
 protected:
  std::map<std::string, std::string> configurationFiles() override { return {{"device.conf", "InternalBuild=true\n"}}; }
  void beforeDaemonStarts() override {
    writeFile(runtimeDir_ + "/stats/Speaker/Underruns", "5\n");
    writeFile(runtimeDir_ + "/stats/Speaker/Overloads", "3\n");
  }
};

TEST_F(InternalBuildTest, StopSendsTheDriverDeltaAndWritesTheSessionFile) {
  auto c = connect();
  ASSERT_TRUE(c);
  auto start = startSession(*c, 11, 2, "Player");
  ASSERT_TRUE(c->sendMessage(Dictionary{{"route", Value("speaker")}, {"HostApplicationDisplayID", Value("spoofed")}},
                             0x40000003, 1, std::vector<std::int64_t>{11}));
  writeFile(runtimeDir_ + "/stats/Speaker/Underruns", "12\n");
  ASSERT_EQ(*c->stopReportingSessionForID(11), true);
  ASSERT_TRUE(answeredTrue(start));

  // Only the positive delta goes out, as category 9.
  auto found = messages("category = 9 AND type = 0");
  ASSERT_EQ(found.size(), 1u);
  EXPECT_EQ(found[0]["payload"]["Speaker_Underruns"], 7);
  EXPECT_FALSE(found[0]["payload"].contains("Speaker_Overloads"));
  EXPECT_LT(found[0]["id"], messages("type = 65535")[0]["id"]);  // ahead of the summary
  // The analytics event names the session's application; the message itself is untouched.
  auto events = rows("SELECT payload FROM analytics_events WHERE name = 'com.orvane.vireo.Routing_Playback.Start'");
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0]["payload"], (nlohmann::json{{"route", "speaker"}, {"HostApplicationDisplayID", "Player"}}));
  EXPECT_EQ(messages("type = 1")[0]["payload"]["HostApplicationDisplayID"], "spoofed");

  fs::path dir = fs::path(logsDir_) / "Audio" / "Reporting";
  fs::path file;
  ASSERT_TRUE(eventually([&] {
    std::error_code ec;
    for (const auto& e : fs::directory_iterator(dir, ec))
      if (e.path().filename().string().find("-vireo-Player-telephony.json") != std::string::npos) file = e.path();
    return !file.empty();
  }));
  std::ifstream in(file);
  auto content = nlohmann::json::parse(in, nullptr, false);
  ASSERT_TRUE(content.is_array()) << file;
  ASSERT_GE(content.size(), 2u);
  EXPECT_EQ(content[0]["HostApplicationDisplayID"], "Player");
  bool routed = false;
  for (const auto& entry : content)
    routed = routed || (entry.contains("Routing_Playback_Start_1") && entry["Routing_Playback_Start_1"]["route"] == "speaker");
  EXPECT_TRUE(routed) << content.dump(2);
}

}  // namespace
}  // namespace vireo::itest
