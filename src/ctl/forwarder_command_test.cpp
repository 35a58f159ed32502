#include "ctl/forwarder_command.h"

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <cstdlib>
#include <nlohmann/json.hpp>

#include "fakes/fake_platform.h"
#include "fakes/temp_dir.h"
#include "platform/linux/store/store.h"
#include "platform/linux/system_clock.h"

namespace vireo::ctl {
namespace {

std::string run(const ForwarderPaths& paths, const std::vector<std::string>& args, int expectedStatus = 0) {
  char* buf = nullptr;
  std::size_t size = 0;
  std::FILE* out = open_memstream(&buf, &size);
  EXPECT_EQ(runForwarder(paths, args, false, out, out), expectedStatus);
  std::fclose(out);
  std::string text(buf, size);
  std::free(buf);
  return text;
}

// Cursors, live backlog and dropped counts from the store, the rest from
// forwarder.json; a store the forwarder never touched has everything waiting.
TEST(ForwarderCommandTest, ShowsStoreCountsAndStatusFileAndCopesWithAnOlderStore) {
  testing::TempDir dir;
  {
    testing::RecordingLogger logger;
    linux_platform::SystemClock clock;
    linux_platform::LocalStore store(dir.path(), logger, clock);
    for (int i = 0; i < 3; ++i) store.insertAnalyticsEvent("e", Dictionary{}, 100 + i);
    store.insertEnergyEvent(1, "e", Dictionary{}, 100);
    ASSERT_TRUE(store.flush(std::chrono::seconds(10)));
  }
  const ForwarderPaths paths{dir.sub("vireo.db"), dir.sub("forwarder.json"), dir.sub("forwarder.conf")};
  auto sql = [&](const char* text) {
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(paths.db.c_str(), &db), SQLITE_OK);
    EXPECT_EQ(sqlite3_exec(db, text, nullptr, nullptr, nullptr), SQLITE_OK) << sqlite3_errmsg(db);
    sqlite3_close(db);
  };
  sql("INSERT INTO forward_state VALUES ('analytics_events', 2); INSERT INTO store_dropped VALUES ('analytics_events', 4, 1)");
  dir.write("forwarder.json", R"({"device": "d1", "consent": false, "last_error": "HTTP 500", "last_error_at": 250.5,
                                  "next_attempt_at": null, "tables": {}})");
  auto doc = nlohmann::json::parse(run(paths, {"--json"}));
  EXPECT_EQ(doc["configured"], false);
  EXPECT_EQ(doc["device"], "d1");
  EXPECT_EQ(doc["consent"], false);
  EXPECT_EQ(doc["last_error"], "HTTP 500");
  EXPECT_EQ(doc["last_error_at"], 250.5);
  EXPECT_TRUE(doc["last_success_at"].is_null());
  const auto& analytics = doc["tables"]["analytics_events"];
  EXPECT_EQ(analytics["cursor"], 2);
  EXPECT_EQ(analytics["backlog"], 1);
  EXPECT_EQ(analytics["dropped"]["forwarded"], 4);
  EXPECT_EQ(analytics["dropped"]["unforwarded"], 1);
  EXPECT_EQ(doc["tables"]["energy_events"]["backlog"], 1);
  EXPECT_EQ(doc["tables"]["store_changes"]["cursor"], 0);

  dir.write("forwarder.conf", "URL=http://x/\n");
  std::string text = run(paths, {});
  EXPECT_NE(text.find("forwarder     configured ("), std::string::npos) << text;
  EXPECT_NE(text.find("last error    1970-01-01T00:04:10.500Z: HTTP 500"), std::string::npos) << text;

  std::remove(paths.status.c_str());
  sql("DROP TABLE forward_state; DROP TABLE store_dropped; DROP TABLE store_changes");
  doc = nlohmann::json::parse(run(paths, {"--json"}));
  EXPECT_TRUE(doc["status_file"].is_null());
  EXPECT_EQ(doc["tables"]["analytics_events"]["cursor"], 0);
  EXPECT_EQ(doc["tables"]["analytics_events"]["backlog"], 3);
  EXPECT_EQ(doc["tables"]["analytics_events"]["dropped"]["forwarded"], 0);
  run({dir.sub("missing.db"), paths.status, paths.config}, {}, 1);
  run(paths, {"--db"}, 2);
}

}  // namespace
}  // namespace vireo::ctl
