#include "ctl/store_query.h"

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <tuple>

#include "fakes/fake_platform.h"
#include "fakes/temp_dir.h"
#include "platform/linux/store/store.h"
#include "platform/linux/system_clock.h"

namespace vireo::ctl {
namespace {

class StoreQueryTest : public ::testing::Test {
 protected:
  // Rows written by the daemon's own store, so the queries run against its schema.
  void SetUp() override {
    testing::RecordingLogger logger;
    linux_platform::SystemClock clock;
    linux_platform::LocalStore store(dir_, logger, clock);
    auto media = store.insertTelemetrySession(Dictionary{{"client_type", "x"}},
                                              Dictionary{{"client_name", "vireo"}, {"service_name", "media"}}, 100);
    auto phone = store.insertTelemetrySession(Dictionary{},
                                              Dictionary{{"client_name", "vireo"}, {"service_name", "telephony"}}, 200);
    ASSERT_TRUE(media && phone);
    store.setBackends(*media, std::vector<std::string>{"local"});
    store.setFlushed(*phone, 210);
    store.insertTelemetryMessage(media, nullptr, nullptr, 3, 4, Dictionary{{"a_b", 1}}, 101);
    store.insertTelemetryMessage(phone, nullptr, nullptr, 9, 0, Dictionary{{"k", 2}}, 201);
    const Dictionary none, standalone{{"service_name", "standalone"}};
    store.insertTelemetryMessage(std::nullopt, &none, &standalone, 8, 4, Dictionary{{"k", 3}}, 300);
    store.insertAnalyticsEvent("com.orvane.vireo.Session_Generic.Start", Dictionary{{"x", 1}}, 150);
    store.insertAnalyticsEvent("com.orvane.vireo.vrreportingclientuptime", Dictionary{{"seconds", 2.5}}, 250);
    store.insertEnergyEvent(7, "Lumen_Haptics", Dictionary{{"EngineOnDuration", 3}}, 160);
    ASSERT_TRUE(store.flush(std::chrono::seconds(10)));
  }

  // Writes one analytics event with the daemon's store (opened for the call alone).
  void addEvent(const std::string& dir, const std::string& name) {
    testing::RecordingLogger logger;
    linux_platform::SystemClock clock;
    linux_platform::LocalStore store(dir, logger, clock);
    store.insertAnalyticsEvent(name, Dictionary{{"n", 1}}, 400);
    store.insertEnergyEvent(1, name, Dictionary{}, 400);
    ASSERT_TRUE(store.flush(std::chrono::seconds(10)));
  }
  static std::string poll(StoreWatcher& w, bool json = false) {
    char* buf = nullptr;
    std::size_t size = 0;
    std::FILE* out = open_memstream(&buf, &size);
    w.poll(out, json);
    std::fclose(out);
    std::string text(buf, size);
    std::free(buf);
    return text;
  }

  // Runs a query and returns its standard output.
  std::string run(const std::string& table, std::vector<std::string> args) {
    std::string error;
    auto q = parseStoreQuery(table, args, &error);
    EXPECT_TRUE(q) << error;
    if (!q) return {};
    q->db = db_;
    char* buf = nullptr;
    std::size_t size = 0;
    std::FILE* out = open_memstream(&buf, &size);
    EXPECT_EQ(runStoreQuery(*q, out, stderr), 0);
    std::fclose(out);
    std::string text(buf, size);
    std::free(buf);
    return text;
  }

  testing::TempDir tmp_;
  const std::string dir_ = tmp_.path();
  const std::string db_ = dir_ + "/vireo.db";
};

TEST_F(StoreQueryTest, FiltersAndLimitSelectRowsInOrder) {
  const std::tuple<std::string, std::vector<std::string>, std::vector<int>> cases[] = {
      {"sessions", {"--json"}, {1, 2}},
      {"messages", {"--json", "--name", "tele*"}, {2}},
      {"messages", {"--json", "--name", "standalone"}, {3}},  // the message's own user_info
      {"messages", {"--json", "--session", "1"}, {1}},
      {"messages", {"--json", "--since", "150", "--until=250"}, {2}},
      {"messages", {"--json", "--limit", "2"}, {2, 3}},  // the last rows, oldest first
      {"analytics", {"--json", "--name", "*uptime"}, {2}},
      {"energy", {"--json", "--session", "7"}, {1}},
  };
  for (const auto& [table, args, expected] : cases) {
    std::vector<int> ids;
    for (const auto& row : nlohmann::json::parse(run(table, args))) ids.push_back(row["id"]);
    EXPECT_EQ(ids, expected) << table << " " << args.back();
  }
  // JSON columns are embedded as JSON, NULL stays null.
  auto rows = nlohmann::json::parse(run("sessions", {"--json"}));
  EXPECT_EQ(rows[0]["user_info"]["service_name"], "media");
  EXPECT_EQ(rows[0]["backends"][0], "local");
  EXPECT_TRUE(rows[1]["backends"].is_null());
  EXPECT_EQ(rows[1]["flushed_at"], 210.0);
  rows = nlohmann::json::parse(run("messages", {"--json", "--name", "standalone"}));
  EXPECT_TRUE(rows[0]["session"].is_null());
}

TEST_F(StoreQueryTest, TextOutputUsageAndMissingStore) {
  std::string text = run("analytics", {"--limit", "1"});
  EXPECT_NE(text.find("at=1970-01-01T00:04:10.000Z"), std::string::npos) << text;
  EXPECT_NE(text.find("payload={\"seconds\":2.5}"), std::string::npos) << text;
  // Usage errors, and a store that is not there.
  std::string error;
  EXPECT_FALSE(parseStoreQuery("analytics", {"--session", "1"}, &error));
  EXPECT_FALSE(parseStoreQuery("sessions", {"--since", "soon"}, &error));
  EXPECT_FALSE(parseStoreQuery("sessions", {"--limit"}, &error));
  auto q = parseStoreQuery("sessions", {}, &error);
  ASSERT_TRUE(q);
  q->db = dir_ + "/missing.db";
  EXPECT_EQ(runStoreQuery(*q, stdout, stdout), 1);
}

// Only rows added after the watch began; a store that appears (or is replaced) later
// is shown from its first row.
TEST_F(StoreQueryTest, WatchFollowsNewRowsAcrossAMissingAndAReplacedFile) {
  StoreWatcher existing(db_, {"analytics"});
  EXPECT_EQ(poll(existing), "");
  addEvent(dir_, "new");
  auto line = nlohmann::json::parse(poll(existing, true));  // one line: the energy row is not watched
  EXPECT_EQ(line["table"], "analytics");
  EXPECT_EQ(line["id"], 3);
  EXPECT_EQ(line["payload"]["n"], 1);
  EXPECT_EQ(poll(existing), "");

  const std::string later = dir_ + "/later";
  StoreWatcher waiting(later + "/vireo.db", {});
  EXPECT_EQ(poll(waiting), "");
  addEvent(later, "first");
  std::string text = poll(waiting);
  EXPECT_NE(text.find("analytics: id=1  name=first"), std::string::npos) << text;
  EXPECT_NE(text.find("energy: id=1  client=1  name=first"), std::string::npos) << text;
  std::filesystem::remove_all(later);
  EXPECT_EQ(poll(waiting), "");
  addEvent(later, "again");
  text = poll(waiting);
  EXPECT_NE(text.find("analytics: id=1  name=again"), std::string::npos) << text;
}

}  // namespace
}  // namespace vireo::ctl
