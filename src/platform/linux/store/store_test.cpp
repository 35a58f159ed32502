#include "platform/linux/store/store.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <thread>

#include "platform/linux/store/store_test_support.h"
#include "platform/linux/system_clock.h"

namespace vireo::linux_platform {
namespace {

using namespace std::chrono_literals;
using testing::Reader;
using testing::RecordingLogger;
using testing::TempDir;

struct StoreTest : ::testing::Test {
  TempDir dir;
  SystemClock clock;
  RecordingLogger logger;
  std::string state() const { return dir.sub("state/nested"); }
  std::string db() const { return state() + "/vireo.db"; }
};

// cid|name|type|notnull|dflt|pk of each column, as the contract's tables have them.
TEST_F(StoreTest, CreatesTheContractSchemaInWalMode) {
  LocalStore store(state(), logger, clock);
  ASSERT_TRUE(store.usable());
  struct stat st {};
  ASSERT_EQ(::stat(state().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0755u);

  Reader reader(db());
  auto columns = [&](const std::string& table) {
    std::string out;
    for (const auto& row : reader.query("PRAGMA table_info(" + table + ")")) {
      out += *row[1] + " " + *row[2] + (*row[3] == "1" ? " NN" : "") + (*row[5] == "1" ? " PK" : "") + ";";
    }
    return out;
  };
  EXPECT_EQ(columns("telemetry_sessions"),
            "id INTEGER PK;session_info TEXT NN;user_info TEXT NN;backends TEXT;created_at REAL NN;flushed_at REAL;");
  EXPECT_EQ(columns("telemetry_messages"),
            "id INTEGER PK;session INTEGER;session_info TEXT;user_info TEXT;category INTEGER NN;type INTEGER NN;"
            "payload TEXT NN;sent_at REAL NN;");
  EXPECT_EQ(columns("analytics_events"), "id INTEGER PK;name TEXT NN;payload TEXT NN;at REAL NN;");
  EXPECT_EQ(columns("energy_events"), "id INTEGER PK;client INTEGER NN;name TEXT NN;payload TEXT NN;at REAL NN;");
  auto fk = reader.query("PRAGMA foreign_key_list(telemetry_messages)");
  ASSERT_EQ(fk.size(), 1u);
  EXPECT_EQ(*fk[0][2] + "(" + *fk[0][4] + ")<-" + *fk[0][3], "telemetry_sessions(id)<-session");
  EXPECT_EQ(reader.scalar("SELECT COUNT(*) FROM sqlite_master WHERE type='table'"), "4");
  EXPECT_EQ(reader.scalar("PRAGMA journal_mode"), "wal");
}

TEST_F(StoreTest, FlushMakesEveryKindOfRowVisibleWithJsonInInsertionOrder) {
  LocalStore store(state(), logger, clock);
  Dictionary info{{"client_type", 19}, {"session_id", -1}, {"batch_event", true}};
  Dictionary user{{"service_name", "x"}, {"client_name", "com.orvane.vireo"}};
  Dictionary payload{{"zeta", 1}, {"alpha", "a"}, {"mid", Dictionary{{"k", 2.5}}}};
  auto id = store.insertTelemetrySession(info, user, 100.5);
  ASSERT_TRUE(id);
  EXPECT_TRUE(store.insertTelemetryMessage(*id, nullptr, nullptr, 8, 4, payload, 101.0));
  EXPECT_TRUE(store.insertTelemetryMessage(std::nullopt, &info, &user, 3, 1, payload, 102.0));
  EXPECT_TRUE(store.setBackends(*id, std::vector<std::string>{"local", "remote"}));
  EXPECT_TRUE(store.setFlushed(*id, 103.0));
  EXPECT_TRUE(store.insertAnalyticsEvent("com.orvane.vireo.Error.Error", payload, 104.0));
  EXPECT_TRUE(store.insertEnergyEvent(28, "Lumen_Haptics", payload, 105.0));
  ASSERT_TRUE(store.flush(5s));

  Reader reader(db());
  auto s = reader.query("SELECT id, json_type(session_info), json_type(user_info), backends, created_at, flushed_at "
                        "FROM telemetry_sessions");
  ASSERT_EQ(s.size(), 1u);
  EXPECT_EQ(s[0], (testing::Row{std::to_string(*id), "object", "object", R"(["local","remote"])", "100.5", "103.0"}));
  EXPECT_EQ(reader.scalar("SELECT group_concat(key) FROM telemetry_sessions, json_each(user_info)"),
            "service_name,client_name");
  auto m = reader.query("SELECT session, session_info IS NULL, json_type(user_info), category, type, sent_at "
                        "FROM telemetry_messages ORDER BY id");
  ASSERT_EQ(m.size(), 2u);
  EXPECT_EQ(m[0], (testing::Row{std::to_string(*id), "1", std::nullopt, "8", "4", "101.0"}));
  EXPECT_EQ(m[1], (testing::Row{std::nullopt, "0", "object", "3", "1", "102.0"}));
  for (const char* table : {"telemetry_messages", "analytics_events", "energy_events"}) {
    EXPECT_EQ(reader.scalar(std::string("SELECT group_concat(key) FROM (SELECT key FROM ") + table +
                            ", json_each(payload) ORDER BY " + table + ".id LIMIT 3)"),
              "zeta,alpha,mid")
        << table;
  }
  EXPECT_EQ(reader.scalar("SELECT json_extract(payload, '$.mid.k') FROM analytics_events"), "2.5");
  EXPECT_EQ(reader.scalar("SELECT name || '@' || at FROM analytics_events"), "com.orvane.vireo.Error.Error@104.0");
  EXPECT_EQ(reader.scalar("SELECT client || name || at FROM energy_events"), "28Lumen_Haptics105.0");
  EXPECT_TRUE(logger.errors().empty());
}

TEST_F(StoreTest, RowsBecomeVisibleWithinASecondWithoutFlush) {
  LocalStore store(state(), logger, clock);
  Reader reader(db());
  const auto handedOver = std::chrono::steady_clock::now();
  ASSERT_TRUE(store.insertAnalyticsEvent("e", Dictionary{}, 1.0));
  while (reader.scalar("SELECT COUNT(*) FROM analytics_events") != "1" &&
         std::chrono::steady_clock::now() - handedOver < 1s) {
    std::this_thread::sleep_for(10ms);
  }
  EXPECT_EQ(reader.scalar("SELECT COUNT(*) FROM analytics_events"), "1");
}

TEST_F(StoreTest, CloseCommitsAndSessionIdsContinueAfterReopen) {
  {
    LocalStore store(state(), logger, clock);
    EXPECT_EQ(store.insertTelemetrySession(Dictionary{}, Dictionary{}, 1.0), std::optional<std::int64_t>(1));
    EXPECT_EQ(store.insertTelemetrySession(Dictionary{}, Dictionary{}, 1.0), std::optional<std::int64_t>(2));
    store.close();
    EXPECT_FALSE(store.usable());
    EXPECT_FALSE(store.insertAnalyticsEvent("late", Dictionary{}, 1.0));
    store.close();
  }
  LocalStore again(state(), logger, clock);
  EXPECT_EQ(again.insertTelemetrySession(Dictionary{}, Dictionary{}, 1.0), std::optional<std::int64_t>(3));
  again.close();
  EXPECT_EQ(Reader(db()).scalar("SELECT group_concat(id) FROM telemetry_sessions"), "1,2,3");
}

// Another process holding the write lock stands in for a failing disk.
TEST_F(StoreTest, FailedBatchIsDroppedAfterRetryAndWritingGoesOn) {
  LocalStore::Options options;
  options.busyTimeout = 20ms;
  options.retryDelay = 10ms;
  options.maxPendingBytes = 64 << 10;
  LocalStore store(state(), logger, clock, options);
  Reader blocker(db());
  ASSERT_TRUE(blocker.exec("BEGIN IMMEDIATE"));
  ASSERT_TRUE(store.insertAnalyticsEvent("lost", Dictionary{}, 1.0));
  EXPECT_FALSE(store.flush(5s));
  EXPECT_GE(logger.errors().size(), 2u);

  // While the writer is stuck, the bounded queue refuses rows instead of growing.
  ASSERT_TRUE(store.insertAnalyticsEvent("stuck", Dictionary{}, 1.0));
  int accepted = 0;
  while (store.insertAnalyticsEvent("fill", Dictionary{{"pad", std::string(512, 'x')}}, 1.0) && accepted < 10000)
    ++accepted;
  EXPECT_LT(accepted, 10000);

  ASSERT_TRUE(blocker.exec("COMMIT"));
  store.flush(5s);  // may still meet the batch that ran into the lock
  ASSERT_TRUE(store.insertAnalyticsEvent("kept", Dictionary{}, 2.0));
  EXPECT_TRUE(store.flush(5s));
  EXPECT_EQ(blocker.scalar("SELECT COUNT(*) FROM analytics_events WHERE name='lost'"), "0");
  EXPECT_EQ(blocker.scalar("SELECT COUNT(*) FROM analytics_events WHERE name='kept'"), "1");
}

TEST_F(StoreTest, FlushedRowsSurviveSigkill) {
  constexpr int kFlushed = 300;
  pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    LocalStore store(state(), logger, clock);
    for (int i = 0; i < kFlushed; ++i)
      store.insertTelemetryMessage(std::nullopt, nullptr, nullptr, 1, 2, Dictionary{{"i", i}}, 1.0);
    if (!store.flush(10s)) ::_exit(3);
    for (int i = kFlushed; i < 20 * kFlushed; ++i)
      store.insertTelemetryMessage(std::nullopt, nullptr, nullptr, 1, 2, Dictionary{{"i", i}}, 1.0);
    ::raise(SIGKILL);
    ::_exit(4);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << status;

  LocalStore reopened(state(), logger, clock);
  ASSERT_TRUE(reopened.usable());
  Reader reader(db());
  EXPECT_EQ(reader.scalar("PRAGMA integrity_check"), "ok");
  EXPECT_EQ(reader.scalar("SELECT COUNT(*) FROM telemetry_messages WHERE json_extract(payload, '$.i') < " +
                          std::to_string(kFlushed)),
            std::to_string(kFlushed));
  // Whatever else made it is a prefix, never a torn batch.
  EXPECT_EQ(reader.scalar("SELECT MAX(json_extract(payload, '$.i')) + 1 = COUNT(*) FROM telemetry_messages"), "1");
}

}  // namespace
}  // namespace vireo::linux_platform
