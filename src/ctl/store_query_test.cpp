#include "ctl/store_query.h"

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <nlohmann/json.hpp>

#include <cstdio>
#include <cstdlib>
#include <tuple>

#include "fakes/temp_dir.h"

namespace vireo::ctl {
namespace {

class StoreQueryTest : public ::testing::Test {
 protected:
  void SetUp() override {
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(db_.c_str(), &db), SQLITE_OK);
    const char* sql = R"(
      CREATE TABLE telemetry_sessions (id INTEGER PRIMARY KEY, session_info TEXT NOT NULL, user_info TEXT NOT NULL,
        backends TEXT, created_at REAL NOT NULL, flushed_at REAL);
      CREATE TABLE telemetry_messages (id INTEGER PRIMARY KEY, session INTEGER REFERENCES telemetry_sessions(id),
        session_info TEXT, user_info TEXT, category INTEGER NOT NULL, type INTEGER NOT NULL, payload TEXT NOT NULL,
        sent_at REAL NOT NULL);
      CREATE TABLE analytics_events (id INTEGER PRIMARY KEY, name TEXT NOT NULL, payload TEXT NOT NULL, at REAL NOT NULL);
      CREATE TABLE energy_events (id INTEGER PRIMARY KEY, client INTEGER NOT NULL, name TEXT NOT NULL,
        payload TEXT NOT NULL, at REAL NOT NULL);
      INSERT INTO telemetry_sessions VALUES (1, '{"client_type":"x"}', '{"client_name":"vireo","service_name":"media"}',
        '["local"]', 100, NULL), (2, '{}', '{"client_name":"vireo","service_name":"telephony"}', NULL, 200, 210);
      INSERT INTO telemetry_messages VALUES (1, 1, NULL, NULL, 3, 4, '{"a_b":1}', 101), (2, 2, NULL, NULL, 9, 0,
        '{"k":2}', 201), (3, NULL, '{}', '{"service_name":"standalone"}', 8, 4, '{"k":3}', 300);
      INSERT INTO analytics_events VALUES (1, 'com.orvane.vireo.Session_Generic.Start', '{"x":1}', 150),
        (2, 'com.orvane.vireo.vrreportingclientuptime', '{"seconds":2.5}', 250);
      INSERT INTO energy_events VALUES (1, 7, 'Lumen_Haptics', '{"EngineOnDuration":3}', 160);
    )";
    ASSERT_EQ(sqlite3_exec(db, sql, nullptr, nullptr, nullptr), SQLITE_OK);
    sqlite3_close(db);
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

}  // namespace
}  // namespace vireo::ctl
