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
  using Json = nlohmann::json;
  auto expectFields = [&](const std::vector<std::pair<const char*, Json>>& fields) {
    Json doc = Json::parse(run(paths, {"--json"}));
    for (const auto& [pointer, value] : fields) EXPECT_EQ(doc[Json::json_pointer(pointer)], value) << pointer;
  };
  expectFields({{"/configured", false}, {"/device", "d1"}, {"/consent", false}, {"/last_error", "HTTP 500"},
                {"/last_error_at", 250.5}, {"/last_success_at", nullptr}, {"/tables/analytics_events/cursor", 2},
                {"/tables/analytics_events/backlog", 1}, {"/tables/analytics_events/dropped/forwarded", 4},
                {"/tables/analytics_events/dropped/unforwarded", 1}, {"/tables/energy_events/backlog", 1},
                {"/tables/store_changes/cursor", 0}});
  dir.write("forwarder.conf", "URL=http://x/\n");
  std::string text = run(paths, {});
  EXPECT_NE(text.find("forwarder     configured ("), std::string::npos) << text;
  EXPECT_NE(text.find("last error    1970-01-01T00:04:10.500Z: HTTP 500"), std::string::npos) << text;

  std::remove(paths.status.c_str());
  sql("DROP TABLE forward_state; DROP TABLE store_dropped; DROP TABLE store_changes");
  expectFields({{"/status_file", nullptr}, {"/tables/analytics_events/cursor", 0},
                {"/tables/analytics_events/backlog", 3}, {"/tables/analytics_events/dropped/forwarded", 0}});
  run({dir.sub("missing.db"), paths.status, paths.config}, {}, 1);
  run(paths, {"--db"}, 2);
}

}  // namespace
}  // namespace vireo::ctl
