#include <gtest/gtest.h>
#include <sqlite3.h>

#include <ctime>
#include <string>

#include "fakes/fake_platform.h"
#include "fakes/temp_dir.h"
#include "forwarder/forward_store.h"
#include "platform/linux/store/store.h"

namespace vireo::forwarder {
namespace {

class ForwardStoreTest : public ::testing::Test {
 protected:
  void SetUp() override {
    {  // the daemon's store makes the schema, change log included
      testing::RecordingLogger logger;
      testing::FakeClock clock;
      linux_platform::LocalStore daemon(dir.path(), logger, clock);
      ASSERT_TRUE(daemon.usable());
    }
    ASSERT_EQ(sqlite3_open(db().c_str(), &raw), SQLITE_OK);
    std::string error;
    store = ForwardStore::open(db(), &error);
    ASSERT_TRUE(store) << error;
  }
  void TearDown() override { sqlite3_close(raw); }
  std::string db() const { return dir.sub("vireo.db"); }
  void exec(const std::string& sql) { ASSERT_EQ(sqlite3_exec(raw, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sql; }
  void session(int id, double createdAt) {
    exec("INSERT INTO telemetry_sessions (id, session_info, user_info, created_at) VALUES (" + std::to_string(id) +
         ", '{}', '{}', " + std::to_string(createdAt) + ")");
  }
  const ForwardedTable& sessions() const { return forwardedTables().front(); }

  testing::TempDir dir;
  sqlite3* raw = nullptr;
  std::unique_ptr<ForwardStore> store;
  std::string error;
};

// Changes are logged only for rows the forwarder may have read already; each changed
// row goes once, in its current state, with the last change's seq as its version.
TEST_F(ForwardStoreTest, ChangeLogCoversRowsUpToTheWatchMark) {
  const double now = static_cast<double>(std::time(nullptr));
  session(1, now);
  exec("UPDATE telemetry_sessions SET backends = '[\"a\"]' WHERE id = 1");
  std::int64_t mark = 0;
  ASSERT_TRUE(store->raiseWatchMark(&mark, &error)) << error;
  EXPECT_EQ(mark, 1);
  session(2, now);
  exec("UPDATE telemetry_sessions SET backends = '[\"b\"]'");
  exec("UPDATE telemetry_sessions SET flushed_at = 5.5 WHERE id = 1");
  Batch batch;
  ASSERT_TRUE(store->readChanges(0, 100, "dev", &batch, &error)) << error;
  EXPECT_EQ(batch.entries, 2);
  EXPECT_EQ(batch.rows, 1);
  EXPECT_NE(batch.body.find("\"backends\":\"[\\\"b\\\"]\""), std::string::npos) << batch.body;
  EXPECT_NE(batch.body.find("\"flushed_at\":5.5"), std::string::npos) << batch.body;
  EXPECT_NE(batch.body.find("\"version\":" + std::to_string(batch.last)), std::string::npos) << batch.body;
  ASSERT_TRUE(store->commit(kChangesName, batch.last, &error)) << error;
  EXPECT_EQ(store->backlog(kChangesName, 0), 0);
  // New rows stop at the mark.
  ASSERT_TRUE(store->readRows(sessions(), 0, mark, 100, "dev", &batch, &error)) << error;
  EXPECT_EQ(batch.rows, 1);
  EXPECT_EQ(batch.last, 1);
}

// A session id missing before a newer row may still be on its way to the disk:
// a recent row after the gap waits, an old one does not.
TEST_F(ForwardStoreTest, RecentRowAfterAGapInSessionIdsWaits) {
  const double now = static_cast<double>(std::time(nullptr));
  session(1, now - 100);
  session(3, now);
  Batch batch;
  ASSERT_TRUE(store->readRows(sessions(), 0, 100, 100, "dev", &batch, &error)) << error;
  EXPECT_EQ(batch.last, 1);
  exec("UPDATE telemetry_sessions SET created_at = created_at - 100 WHERE id = 3");
  ASSERT_TRUE(store->readRows(sessions(), 0, 100, 100, "dev", &batch, &error)) << error;
  EXPECT_EQ(batch.last, 3);
}

// Only forwarded rows older than the cutoff go, and never a table's newest row,
// which the daemon's next id follows.
TEST_F(ForwardStoreTest, PruneKeepsUnforwardedRecentAndNewestRows) {
  exec("BEGIN");
  for (int i = 0; i < 1200; ++i) exec("INSERT INTO analytics_events (name, payload, at) VALUES ('e', '{}', 10)");
  exec("COMMIT");
  exec("INSERT INTO analytics_events (name, payload, at) VALUES ('e', '{}', 1000)");  // 1201: recent
  for (int i = 0; i < 3; ++i) exec("INSERT INTO energy_events (client, name, payload, at) VALUES (1, 'e', '{}', 10)");
  ASSERT_TRUE(store->commit("analytics_events", 1150, &error));
  ASSERT_TRUE(store->commit("energy_events", 3, &error));
  EXPECT_EQ(store->prune(500, [] { return false; }, &error), 1150u + 2u) << error;
  EXPECT_EQ(store->backlog("analytics_events", 0), 51);
  EXPECT_EQ(store->backlog("energy_events", 0), 1);
}

}  // namespace
}  // namespace vireo::forwarder
