#include "platform/linux/store/store.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <future>
#include <thread>

#include "platform/linux/store/analytics_service.h"
#include "platform/linux/store/energy_log_service.h"
#include "platform/linux/store/store_quota.h"
#include "platform/linux/store/telemetry_service.h"
#include "fakes/fake_platform.h"
#include "fakes/temp_dir.h"
#include "platform/linux/system_clock.h"

namespace vireo::linux_platform {
namespace {

using namespace std::chrono_literals;
using Backends = std::optional<std::vector<std::string>>;
using Names = std::vector<std::string>;

// An independent reader of the store's file, as another process would see it.
class Reader {
 public:
  explicit Reader(const std::string& path) { sqlite3_open_v2(path.c_str(), &db_, SQLITE_OPEN_READWRITE, nullptr); }
  ~Reader() { sqlite3_close(db_); }
  // The first column of the first row, "" when there is none or it is NULL.
  std::string scalar(const std::string& sql) const {
    sqlite3_stmt* s = nullptr;
    std::string out;
    if (sqlite3_prepare_v2(db_, sql.c_str(), -1, &s, nullptr) == SQLITE_OK && sqlite3_step(s) == SQLITE_ROW &&
        sqlite3_column_text(s, 0))
      out = reinterpret_cast<const char*>(sqlite3_column_text(s, 0));
    sqlite3_finalize(s);
    return out;
  }
  bool exec(const std::string& sql) const { return sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, nullptr) == SQLITE_OK; }

 private:
  sqlite3* db_ = nullptr;
};

// Each test in its own temporary directory, removed afterwards.
struct StoreTest : ::testing::Test {
  std::string sub(const std::string& name) const { return dir.sub(name); }
  void write(const std::string& name, const std::string& text) const { dir.write(name, text); }
  testing::TempDir dir;
  const std::string& root = dir.path();
  SystemClock clock;
  testing::RecordingLogger logger;
  std::size_t errors() const { return std::ranges::count(logger.entries(), LogLevel::Error, &testing::LogEntry::level); }
  std::string state() const { return sub("state/nested"); }
  std::string db() const { return state() + "/vireo.db"; }
};

// Name, type, NOT NULL and PRIMARY KEY of each column, as the published schema has them.
// (That rows show without a flush, the end-to-end suite sees on every query.)
TEST_F(StoreTest, CreatesThePublishedSchemaInWalMode) {
  LocalStore store(state(), logger, clock);
  ASSERT_TRUE(store.usable());
  EXPECT_EQ(std::filesystem::status(state()).permissions() & std::filesystem::perms::all, std::filesystem::perms(0755));
  Reader reader(db());
  auto columns = [&](const std::string& table) {
    return reader.scalar("SELECT group_concat(name || ' ' || type || iif(\"notnull\", ' NN', '') || iif(pk, ' PK', '')"
                         " || ';', '') FROM pragma_table_info('" + table + "')");
  };
  EXPECT_EQ(columns("telemetry_sessions"),
            "id INTEGER PK;session_info TEXT NN;user_info TEXT NN;backends TEXT;created_at REAL NN;flushed_at REAL;");
  EXPECT_EQ(columns("telemetry_messages"),
            "id INTEGER PK;session INTEGER;session_info TEXT;user_info TEXT;category INTEGER NN;type INTEGER NN;"
            "payload TEXT NN;sent_at REAL NN;");
  EXPECT_EQ(columns("analytics_events"), "id INTEGER PK;name TEXT NN;payload TEXT NN;at REAL NN;");
  EXPECT_EQ(columns("energy_events"), "id INTEGER PK;client INTEGER NN;name TEXT NN;payload TEXT NN;at REAL NN;");
  EXPECT_EQ(reader.scalar("SELECT group_concat(\"table\" || '(' || \"to\" || ')<-' || \"from\") "
                          "FROM pragma_foreign_key_list('telemetry_messages')"),
            "telemetry_sessions(id)<-session");
  // Besides them only the forwarder's cursors and change log, and the quota's counts.
  EXPECT_EQ(reader.scalar("SELECT group_concat(name) FROM (SELECT name FROM sqlite_master WHERE type='table' "
                          "ORDER BY name)"),
            "analytics_events,energy_events,forward_state,sqlite_sequence,store_changes,store_dropped,telemetry_messages,"
            "telemetry_sessions");
  EXPECT_EQ(reader.scalar("PRAGMA journal_mode"), "wal");
}

// Another process holding the write lock stands in for a failing disk.
TEST_F(StoreTest, LockedStoreKeepsEveryRowUntilItCanWriteAndRefusesPastItsLimit) {
  constexpr int kLimit = 40;
  LocalStore store(state(), logger, clock,
                   {.maxPendingBytes = 64 << 10, .maxPendingRows = kLimit, .retryDelay = 5ms,
                    .maxRetryDelay = 20ms, .busyTimeout = 10ms, .closeTimeout = 50ms});
  Reader blocker(db());
  ASSERT_TRUE(blocker.exec("BEGIN IMMEDIATE"));
  for (int i = 0; i < kLimit; ++i) ASSERT_TRUE(store.insertAnalyticsEvent("held", Dictionary{{"i", i}}, 1.0)) << i;
  // Past the row limit, and a row over the byte limit alone, are refused and counted.
  EXPECT_FALSE(store.insertAnalyticsEvent("over", Dictionary{}, 1.0));
  EXPECT_FALSE(store.insertAnalyticsEvent("over", Dictionary{}, 1.0));
  EXPECT_FALSE(store.insertAnalyticsEvent("big", Dictionary{{"pad", std::string(64 << 10, 'x')}}, 1.0));
  EXPECT_EQ(logger.count("writer queue full"), 1u);

  // Several failed attempts later, nothing is lost and the flush says it is not there.
  for (auto until = std::chrono::steady_clock::now() + 10s;
       store.status().writeErrors < 3 && std::chrono::steady_clock::now() < until;)
    std::this_thread::sleep_for(5ms);
  EXPECT_FALSE(store.flush(50ms));
  StoreStatus blocked = store.status();
  EXPECT_GE(blocked.writeErrors, 3u);
  EXPECT_EQ(blocked.pendingRows, std::uint64_t{kLimit});
  EXPECT_GT(blocked.pendingBytes, 0u);
  EXPECT_EQ(blocked.refusedRows, 3u);
  EXPECT_EQ(blocked.lastError, "database is locked");
  EXPECT_TRUE(blocked.usable);
  EXPECT_EQ(logger.count("write failed, retrying"), 1u);

  ASSERT_TRUE(blocker.exec("COMMIT"));
  EXPECT_TRUE(store.flush(5s));
  EXPECT_EQ(blocker.scalar("SELECT COUNT(DISTINCT json_extract(payload, '$.i')) FROM analytics_events "
                           "WHERE name = 'held'"),
            std::to_string(kLimit));
  EXPECT_EQ(store.status().pendingRows, 0u);
  EXPECT_TRUE(store.insertAnalyticsEvent("after", Dictionary{}, 2.0));
  EXPECT_TRUE(store.flush(5s));

  // Closing cannot wait for ever: it gives up on a store that stays locked.
  ASSERT_TRUE(blocker.exec("BEGIN IMMEDIATE"));
  ASSERT_TRUE(store.insertAnalyticsEvent("lost", Dictionary{}, 3.0));
  store.close();
  EXPECT_EQ(logger.count("write failed again, dropping 1 rows"), 1u);
  EXPECT_FALSE(store.insertAnalyticsEvent("closed", Dictionary{}, 3.0));
  ASSERT_TRUE(blocker.exec("COMMIT"));
  EXPECT_EQ(blocker.scalar("SELECT group_concat(DISTINCT name) FROM analytics_events"), "held,after");
}

// Past the quota, rows already forwarded go first, then the oldest, whichever table
// holds them; each table's newest row and every open forwarded session stay; what goes
// is counted per table.
TEST_F(StoreTest, QuotaDeletesForwardedRowsFirstThenTheOldestAndCountsThem) {
  constexpr std::int64_t kQuota = 512 << 10;
  LocalStore store(state(), logger, clock, {.maxStoreBytes = kQuota});
  const Dictionary payload{{"pad", std::string(900, 'x')}};
  const auto open = store.insertTelemetrySession({}, {}, 1.0);
  ASSERT_TRUE(open && store.insertEnergyEvent(1, "early", payload, 2.0));
  for (int i = 0; i < 100; ++i) ASSERT_TRUE(store.insertTelemetryMessage(*open, nullptr, nullptr, 1, 1, payload, 10.0 + i));
  ASSERT_TRUE(store.flush(5s));
  Reader reader(db());
  // The forwarder has sent the first 100 messages and the open session.
  ASSERT_TRUE(reader.exec("INSERT INTO forward_state VALUES ('telemetry_messages', 100), ('telemetry_sessions', 1)"));
  ASSERT_TRUE(store.insertEnergyEvent(1, "late", payload, 1300.0));
  for (int i = 0; i < 1000; ++i)
    ASSERT_TRUE(store.insertTelemetryMessage(*open, nullptr, nullptr, 1, 1, payload, 200.0 + i));
  ASSERT_TRUE(store.flush(5s));

  EXPECT_LE(std::stoll(reader.scalar("SELECT (SELECT page_count FROM pragma_page_count) - "
                                     "(SELECT freelist_count FROM pragma_freelist_count)")) *
                std::stoll(reader.scalar("PRAGMA page_size")),
            kQuota);
  const std::int64_t kept = std::stoll(reader.scalar("SELECT COUNT(*) FROM telemetry_messages"));
  const std::int64_t unforwarded = std::stoll(
      reader.scalar("SELECT unforwarded FROM store_dropped WHERE tbl = 'telemetry_messages'"));
  EXPECT_EQ(reader.scalar("SELECT forwarded FROM store_dropped WHERE tbl = 'telemetry_messages'"), "100");
  // The energy row of time 2 was older than every message left: it went with them.
  EXPECT_EQ(reader.scalar("SELECT unforwarded FROM store_dropped WHERE tbl = 'energy_events'"), "1");
  EXPECT_EQ(kept + 100 + unforwarded, 1100);
  EXPECT_EQ(reader.scalar("SELECT MIN(id) FROM telemetry_messages"), std::to_string(1101 - kept));
  EXPECT_EQ(reader.scalar("SELECT group_concat(name) FROM energy_events"), "late");
  EXPECT_EQ(reader.scalar("SELECT COUNT(*) FROM telemetry_sessions"), "1");
  EXPECT_EQ(store.status().quotaDroppedRows, static_cast<std::uint64_t>(101 + unforwarded));
  EXPECT_GE(logger.count("over MaxStoreBytes=524288"), 1u);
  EXPECT_EQ(errors(), 0u);

  EXPECT_EQ(parseByteSize(" 64M"), std::int64_t{64} << 20);
  EXPECT_EQ(parseByteSize("1g"), std::int64_t{1} << 30);
  EXPECT_EQ(parseByteSize("4096"), 4096);
  for (const char* bad : {"", "M", "-1K", "1.5G", "1KB", "99999999999T"}) EXPECT_EQ(parseByteSize(bad), std::nullopt) << bad;
}

TEST_F(StoreTest, FlushedRowsSurviveSigkillAndIdsContinue) {
  constexpr int kFlushed = 300;
  pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    LocalStore store(state(), logger, clock);
    store.insertTelemetrySession(Dictionary{}, Dictionary{}, 1.0);
    for (int i = 0; i < 20 * kFlushed; ++i) {
      store.insertTelemetryMessage(std::nullopt, nullptr, nullptr, 1, 2, Dictionary{{"i", i}}, 1.0);
      if (i == kFlushed - 1 && !store.flush(10s)) ::_exit(3);
    }
    ::raise(SIGKILL);
    ::_exit(4);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << status;

  LocalStore reopened(state(), logger, clock);
  ASSERT_TRUE(reopened.usable());
  // Session ids go on after the last one on disk.
  EXPECT_EQ(reopened.insertTelemetrySession(Dictionary{}, Dictionary{}, 1.0), std::optional<std::int64_t>(2));
  Reader reader(db());
  EXPECT_EQ(reader.scalar("PRAGMA integrity_check"), "ok");
  EXPECT_EQ(reader.scalar("SELECT COUNT(*) FROM telemetry_messages WHERE json_extract(payload, '$.i') < " +
                          std::to_string(kFlushed)),
            std::to_string(kFlushed));
  // Whatever else made it is a prefix, never a torn batch.
  EXPECT_EQ(reader.scalar("SELECT MAX(json_extract(payload, '$.i')) + 1 = COUNT(*) FROM telemetry_messages"), "1");
}

struct ServicesTest : StoreTest {
  std::shared_ptr<LocalStore> store = std::make_shared<LocalStore>(state(), logger, clock);
};

// Starts a session's asynchronous call and waits for its answer, noting the answering thread.
template <typename T, typename Start>
T await(Start start, std::thread::id* thread = nullptr) {
  std::promise<T> answer;
  start([&](T value) {
    if (thread) *thread = std::this_thread::get_id();
    answer.set_value(std::move(value));
  });
  auto future = answer.get_future();
  EXPECT_EQ(future.wait_for(15s), std::future_status::ready);
  return future.get();
}
Backends configure(TelemetrySession& session, std::thread::id* thread = nullptr) {
  return await<Backends>([&](auto done) { session.startConfiguration(done); }, thread);
}
std::optional<Error> flush(TelemetrySession& session) {
  return await<std::optional<Error>>([&](auto done) { session.flushMessages(done); });
}

// Another writer took the session id this store hands out next: that row alone is
// refused, and only the flushes that cover it say so.
TEST_F(ServicesTest, RowTheDatabaseRefusesIsDroppedAloneAndFailsOnlyFlushesThatCoverIt) {
  store.reset();
  store = std::make_shared<LocalStore>(state(), logger, clock, LocalStore::Options{.busyTimeout = 1ms});
  LocalTelemetryService service(store, root);
  Reader other(db());
  ASSERT_TRUE(other.exec("BEGIN IMMEDIATE"));
  ASSERT_TRUE(other.exec("INSERT INTO telemetry_sessions (id, session_info, user_info, created_at) "
                         "VALUES (1, '{}', '{}', 0)"));
  ASSERT_TRUE(store->insertAnalyticsEvent("before", Dictionary{}, 1.0));
  auto clash = service.createSession(Dictionary{{"mine", 1}}, Dictionary{}, {});
  ASSERT_EQ(dynamic_cast<LocalTelemetrySession&>(*clash).rowId(), std::optional<std::int64_t>(1));
  ASSERT_TRUE(store->insertAnalyticsEvent("after", Dictionary{}, 1.0));
  // Two more failed attempts: the last of them held all three rows, and so will the next.
  const auto failed = store->status().writeErrors;
  while (store->status().writeErrors < failed + 2) std::this_thread::sleep_for(1ms);
  ASSERT_TRUE(other.exec("COMMIT"));

  EXPECT_FALSE(store->flush(5s));  // every row so far: the refused one among them
  EXPECT_TRUE(flush(*clash).has_value());
  EXPECT_EQ(other.scalar("SELECT group_concat(name) FROM analytics_events"), "before,after");
  EXPECT_EQ(other.scalar("SELECT COUNT(*) || session_info FROM telemetry_sessions"), "1{}");
  const StoreStatus status = store->status();
  EXPECT_EQ(status.droppedBadRows, 1u);
  EXPECT_EQ(status.lastError, "UNIQUE constraint failed: telemetry_sessions.id");
  EXPECT_EQ(logger.count("dropping 1 of 3 rows"), 1u);

  // A later session, and the same session's next flush, are not blamed for it.
  auto next = service.createSession(Dictionary{}, Dictionary{}, {});
  std::optional<Error> error;
  EXPECT_TRUE(next->sendMessage(1, 2, Dictionary{}, &error));
  EXPECT_EQ(flush(*next), std::nullopt);
  EXPECT_EQ(other.scalar("SELECT COUNT(*) FROM telemetry_messages"), "1");  // visible once its flush answered
  EXPECT_EQ(flush(*clash), std::nullopt);
  const std::uint64_t mark = store->handedOver();
  ASSERT_TRUE(store->insertAnalyticsEvent("later", Dictionary{}, 2.0));
  EXPECT_TRUE(store->flush(5s, mark));
}

TEST_F(ServicesTest, BackendDiscoveryFollowsTelemetryConf) {
  auto service = std::make_unique<LocalTelemetryService>(store, root);
  struct Case {
    const char* file;  // nullptr: no telemetry.conf
    Backends answer;
    std::optional<std::string> column;
  };
  const Case cases[] = {
      {nullptr, Names{"local"}, R"(["local"])"},
      {"# nothing here\nOther=1\n", Names{"local"}, R"(["local"])"},
      {"Backends=none\n", std::nullopt, std::nullopt},
      {"Backends=\n", Names{}, "[]"},
      {"Backends = local , remote\n", Names{"local", "remote"}, R"(["local","remote"])"},
  };
  std::optional<std::thread::id> serviceThread;
  std::thread::id thread;
  Reader reader(db());
  for (const auto& c : cases) {
    std::filesystem::remove(sub("telemetry.conf"));
    if (c.file) write("telemetry.conf", c.file);
    auto session = service->createSession(Dictionary{}, Dictionary{}, {});
    EXPECT_EQ(configure(*session, &thread), c.answer) << (c.file ? c.file : "no file");
    // One long-lived thread of the service's own answers every call.
    EXPECT_NE(thread, std::this_thread::get_id());
    EXPECT_EQ(thread, serviceThread.value_or(thread));
    serviceThread = thread;
    ASSERT_TRUE(store->flush(5s));
    auto id = std::to_string(*dynamic_cast<LocalTelemetrySession&>(*session).rowId());
    EXPECT_EQ(reader.scalar("SELECT COUNT(*) || ' ' || ifnull(MAX(backends), 'NULL') FROM telemetry_sessions "
                            "WHERE id = " + id),
              "1 " + c.column.value_or("NULL"))
        << (c.file ? c.file : "no file");
  }

  // A session keeps working after its service is gone.
  std::filesystem::remove(sub("telemetry.conf"));
  auto orphan = service->createSession(Dictionary{}, Dictionary{}, {});
  service.reset();
  EXPECT_EQ(configure(*orphan), Backends(Names{"local"}));
  EXPECT_EQ(flush(*orphan), std::nullopt);
}

TEST_F(ServicesTest, AnalyticsExcludedEventsNeverBuildTheirPayload) {
  write("analytics.conf", "Exclude = com.orvane.vireo.Error.*, *.Debug\n");
  LocalAnalyticsService analytics(store, root);
  int calls = 0;
  auto payload = [&] { return ++calls, Dictionary{{"HostApplicationDisplayID", "Unknown"}, {"k", 1}}; };
  for (auto* name : {"com.orvane.vireo.Error.Error", "com.orvane.vireo.Routing_Playback.Debug",
                     "com.orvane.vireo.Routing_Playback.Start"})
    analytics.sendEventLazy(name, payload);
  EXPECT_EQ(calls, 1);

  write("analytics.conf", "Exclude=\n");
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
  write("plain-file", "not a directory");
  auto broken = std::make_shared<LocalStore>(sub("plain-file/state"), logger, clock);
  EXPECT_FALSE(broken->usable());
  EXPECT_GE(errors(), 1u);

  LocalTelemetryService service(broken, root);
  auto session = service.createSession(Dictionary{}, Dictionary{}, {});
  std::optional<Error> error;
  EXPECT_FALSE(session->sendMessage(1, 2, Dictionary{}, &error));
  ASSERT_TRUE(error);
  error.reset();
  EXPECT_FALSE(service.sendOneMessage(Dictionary{}, Dictionary{}, 1, 2, Dictionary{}, &error));
  EXPECT_TRUE(error);
  EXPECT_TRUE(flush(*session).has_value());
  EXPECT_EQ(configure(*session), Backends(Names{"local"}));

  int calls = 0;
  LocalAnalyticsService(broken, root).sendEventLazy("e", [&] { return ++calls, Dictionary{}; });
  LocalEnergyLogService(broken).logEvent(28, "Lumen_Haptics", Dictionary{});
  EXPECT_EQ(calls, 1);
  EXPECT_FALSE(broken->flush(1s));
}

}  // namespace
}  // namespace vireo::linux_platform
