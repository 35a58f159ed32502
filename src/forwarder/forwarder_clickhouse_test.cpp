// vireo-forwarder against a real ClickHouse server, started per test on free
// loopback ports in a temporary directory. The store is written by the daemon's
// own store code.
#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sqlite3.h>
#include <sys/socket.h>

#include <chrono>
#include <ctime>
#include <fstream>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "fakes/child_process.h"
#include "fakes/fake_platform.h"
#include "fakes/temp_dir.h"
#include "forwarder/clickhouse.h"
#include "platform/linux/store/store.h"

namespace vireo {
namespace {

using namespace std::chrono_literals;
using Json = nlohmann::json;
using Env = std::map<std::string, std::string>;

std::string serverPath() {
  for (const char* p : {"/usr/sbin/clickhouse-server", "/usr/bin/clickhouse-server"})
    if (access(p, X_OK) == 0) return p;
  return {};
}
constexpr const char* kTables[] = {"telemetry_sessions", "telemetry_messages", "analytics_events", "energy_events"};

int freePort() {
  const int fd = socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in a{.sin_family = AF_INET, .sin_port = 0, .sin_addr = {htonl(INADDR_LOOPBACK)}, .sin_zero = {}};
  socklen_t len = sizeof a;
  bind(fd, reinterpret_cast<sockaddr*>(&a), len);
  getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len);
  close(fd);
  return ntohs(a.sin_port);
}

class ForwarderTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (server_path.empty()) GTEST_SKIP() << "clickhouse-server is not installed (Debian package clickhouse-server)";
    port = freePort();
    const std::string ch = dir.sub("ch/");
    dir.write("ch/users.xml",
              "<yandex><profiles><default/></profiles><quotas><default/></quotas><users><fleet>"
              "<password>s3cret</password><networks><ip>127.0.0.1</ip></networks>"
              "<profile>default</profile><quota>default</quota></fleet></users></yandex>\n");
    std::string config = "<yandex><logger><level>warning</level><log>" + ch + "server.log</log></logger>";
    for (auto [key, value] : {std::pair<std::string, std::string>{"http_port", std::to_string(port)},
                              {"tcp_port", std::to_string(freePort())}, {"listen_host", "127.0.0.1"},
                              {"path", ch + "data/"}, {"tmp_path", ch + "tmp/"}, {"user_files_path", ch + "files/"},
                              {"format_schema_path", ch + "schemas/"}, {"users_config", ch + "users.xml"},
                              {"default_profile", "default"}, {"mark_cache_size", "5368709"}})
      config += "<" + key + ">" + value + "</" + key + ">";
    dir.write("ch/config.xml", config + "</yandex>\n");
    dir.write("conf/password", "s3cret\n");
    writeConfig("BatchRows=100\n");
    startServer();
    store = std::make_unique<linux_platform::LocalStore>(dir.sub("state"), logger, clock);
    ASSERT_TRUE(store->usable());
  }
  void TearDown() override {
    if (store) store->close();
    stopServer();
  }

  void writeConfig(const std::string& extra) {
    dir.write("conf/forwarder.conf", "URL=http://127.0.0.1:" + std::to_string(port) +
                                         "/\nUser=fleet\nPasswordFile=password\nDatabase=fleet\n" + extra);
  }
  void startServer() {
    server = std::make_unique<itest::ChildProcess>();
    server->start({server_path, "--config-file=" + dir.sub("ch/config.xml")}, {}, dir.sub("ch/stdout.log"));
    for (int i = 0; i < 300 && query("SELECT 1") != "1\n"; ++i) std::this_thread::sleep_for(50ms);
    ASSERT_EQ(query("SELECT 1"), "1\n") << "clickhouse-server did not start";
  }
  void stopServer() {  // as abruptly as it can end
    if (server) server->signal(SIGKILL);
    server.reset();
  }
  // The answer, or "ERROR ..." when the status is not 200.
  std::string query(const std::string& sql) {
    forwarder::ForwarderConfig c{.url = "http://127.0.0.1:" + std::to_string(port) + "/", .user = "fleet",
                                 .password = "s3cret"};
    std::string answer, error;
    return forwarder::ClickHouseClient(c, [] { return false; }).post("", sql, &error, &answer) ? answer : "ERROR " + error;
  }
  long long count(const std::string& table, bool final) {
    auto text = query("SELECT count() FROM fleet." + table + (final ? " FINAL" : ""));
    return text.starts_with("ERROR") ? -1 : std::stoll(text);
  }

  bool startForwarder(itest::ChildProcess& p, std::vector<std::string> args, Env env = {}) {
    env.merge(Env{{"CONFIGURATION_DIRECTORY", dir.sub("conf")}, {"STATE_DIRECTORY", dir.sub("state")},
                  {"VIREO_FORWARDER_DEVICE", "test-device"}, {"JOURNAL_STREAM", ""}});
    args.insert(args.begin(), VIREO_FORWARDER_PATH);
    return p.start(args, env, dir.sub("forwarder.log"));
  }
  int runOnce(Env env = {}) {
    EXPECT_TRUE(store->flush(5s));
    itest::ChildProcess p;
    return startForwarder(p, {"--once"}, std::move(env)) ? p.waitExit(60s).value_or(-1) : -1;
  }
  std::string forwarderLog() const { return (std::stringstream() << std::ifstream(dir.sub("forwarder.log")).rdbuf()).str(); }
  Json status() const {
    Json s = Json::parse(std::ifstream(dir.sub("state/forwarder.json")), nullptr, false);
    return s.is_object() ? s : Json::object();
  }

  // Rows of every table; payloads with quotes, newlines and non-ASCII text.
  void writeRows(int n) {
    for (int i = 0; i < n; ++i) {
      const double at = static_cast<double>(std::time(nullptr)) + i / 1000.0;
      Dictionary payload{{"i", Value(i)}, {"text", Value(std::string("\"quoted\"\nline\tü ✓ ") + std::to_string(i))}};
      auto session = store->insertTelemetrySession(Dictionary{{"client_type", Value(std::string("app"))}},
                                                   Dictionary{{"client_name", Value(std::string("x"))}}, at);
      ASSERT_TRUE(session);
      store->setBackends(*session, i % 2 ? std::optional<std::vector<std::string>>({"local"}) : std::nullopt);
      store->insertTelemetryMessage(session, nullptr, nullptr, 1, 2, payload, at);
      Dictionary info{{"session_id", Value(std::string("one-shot"))}};
      store->insertTelemetryMessage(std::nullopt, &info, &info, 3, 4, payload, at);
      store->insertAnalyticsEvent("event.name", payload, at);
      store->insertEnergyEvent(i, "energy", payload, at);
    }
    ASSERT_TRUE(store->flush(5s));
  }

  // Every local row once in FINAL, column for column, device and version aside.
  void expectSameRows() {
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open_v2(dir.sub("state/vireo.db").c_str(), &db, SQLITE_OPEN_READONLY, nullptr), SQLITE_OK);
    for (const char* table : kTables) {
      std::vector<std::string> local, remote;
      sqlite3_stmt* s = nullptr;
      sqlite3_prepare_v2(db, (std::string("SELECT * FROM ") + table + " ORDER BY id").c_str(), -1, &s, nullptr);
      while (sqlite3_step(s) == SQLITE_ROW) {
        Json row = Json::object();
        for (int i = 0; i < sqlite3_column_count(s); ++i) {
          const char* name = sqlite3_column_name(s, i);
          switch (sqlite3_column_type(s, i)) {
            case SQLITE_NULL: row[name] = nullptr; break;
            case SQLITE_INTEGER: row[name] = std::to_string(sqlite3_column_int64(s, i)); break;
            case SQLITE_FLOAT: row[name] = sqlite3_column_double(s, i); break;
            default: row[name] = reinterpret_cast<const char*>(sqlite3_column_text(s, i));
          }
        }
        local.push_back(row.dump());
      }
      sqlite3_finalize(s);
      std::istringstream lines(query(std::string("SELECT * FROM fleet.") + table +
                                     " FINAL ORDER BY id FORMAT JSONEachRow"));
      for (std::string line; std::getline(lines, line);) {
        Json row = Json::parse(line);
        EXPECT_EQ(row["device"], "test-device");
        row.erase("device");
        row.erase("version");
        // 64-bit integers come quoted, so numbers are the REAL columns, whole ones printed without a point.
        for (auto& value : row) if (value.is_number()) value = value.get<double>();
        remote.push_back(row.dump());
      }
      EXPECT_EQ(remote.size(), local.size()) << table;
      for (std::size_t i = 0; i < std::min(remote.size(), local.size()); ++i) {
        if (remote[i] != local[i]) {
          ADD_FAILURE() << table << ": " << remote[i] << " instead of " << local[i];
          break;
        }
      }
    }
    sqlite3_close(db);
  }

  testing::TempDir dir;
  testing::RecordingLogger logger;
  testing::FakeClock clock;
  std::unique_ptr<linux_platform::LocalStore> store;
  const std::string server_path = serverPath();
  int port = 0;
  std::unique_ptr<itest::ChildProcess> server;
};

// Nothing leaves while reporting is disabled; then every row arrives intact, once
// even when the forwarder dies between send and cursor, and changes to rows already
// sent show in FINAL.
TEST_F(ForwarderTest, RowsArriveIntactOnceOnlyWithConsentAndSessionChangesShowInFinal) {
  writeRows(150);
  dir.write("conf/com.orvane.vireo.conf", "disable_reporting = Yes\n");
  ASSERT_EQ(runOnce(), 0) << forwarderLog();
  EXPECT_EQ(query("SELECT count() FROM system.tables WHERE database = 'fleet'"), "0\n");
  EXPECT_EQ(status()["consent"], false);
  EXPECT_EQ(status()["tables"]["energy_events"]["backlog"], 150);
  dir.write("conf/com.orvane.vireo.conf", "disable_reporting = off\n");
  // The process dies after the server took a batch and before its cursor is stored:
  // the batch goes again and collapses.
  ASSERT_EQ(runOnce({{"VIREO_FORWARDER_EXIT_AFTER_SEND", "1"}}), 70) << forwarderLog();
  EXPECT_EQ(count("telemetry_sessions", false), 100);
  ASSERT_EQ(runOnce(), 0) << forwarderLog();
  expectSameRows();
  EXPECT_LE(count("telemetry_sessions", false), 250);  // less once a background merge collapsed them
  query("OPTIMIZE TABLE fleet.telemetry_sessions FINAL");
  EXPECT_EQ(count("telemetry_sessions", false), 150);
  const double flushedAt = static_cast<double>(std::time(nullptr)) + 0.25;
  for (std::int64_t id = 1; id <= 150; id += 7) {
    store->setBackends(id, std::vector<std::string>{"local", "late"});
    store->setFlushed(id, flushedAt);
  }
  ASSERT_EQ(runOnce(), 0) << forwarderLog();
  expectSameRows();
  EXPECT_EQ(query("SELECT count() FROM fleet.telemetry_sessions FINAL WHERE flushed_at = " +
                  std::to_string(flushedAt) + " AND version > 0"),
            "22\n");
  const Json s = status();
  EXPECT_EQ(s["consent"], true);
  EXPECT_EQ(s["tables"]["telemetry_messages"]["cursor"], 300);
  for (const char* t : {"telemetry_sessions", "telemetry_messages", "analytics_events", "energy_events", "store_changes"})
    EXPECT_EQ(s["tables"][t]["backlog"], 0) << t;
  EXPECT_TRUE(s["last_error"].is_null());

  // The disk quota's counts go as they grow, the latest one per table in FINAL.
  auto dropped = [&](const std::string& sql) {
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(dir.sub("state/vireo.db").c_str(), &db), SQLITE_OK);
    sqlite3_busy_timeout(db, 5000);
    EXPECT_EQ(sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sqlite3_errmsg(db);
    sqlite3_close(db);
    ASSERT_EQ(runOnce(), 0) << forwarderLog();
  };
  const std::string finalDropped = "SELECT tbl, forwarded, unforwarded FROM fleet.store_dropped FINAL ORDER BY tbl";
  dropped("INSERT INTO store_dropped VALUES ('analytics_events', 5, 2), ('energy_events', 0, 0)");
  EXPECT_EQ(query(finalDropped), "analytics_events\t5\t2\n");
  dropped("INSERT OR REPLACE INTO store_dropped VALUES ('analytics_events', 9, 2), ('energy_events', 0, 3)");
  EXPECT_EQ(query(finalDropped), "analytics_events\t9\t2\nenergy_events\t0\t3\n");
  EXPECT_EQ(status()["dropped"]["energy_events"]["unforwarded"], 3);
}

// Server killed and restarted under a running forwarder: rows written meanwhile
// arrive; plain count() holds at most one batch the server took unanswered.
TEST_F(ForwarderTest, BacklogFromAnOutageArrivesOnce) {
  writeConfig("BatchRows=100\nInterval=1\n");
  writeRows(50);
  itest::ChildProcess forwarder;
  ASSERT_TRUE(startForwarder(forwarder, {}));
  auto waitFor = [&](long long analytics) {
    for (int i = 0; i < 300 && count("analytics_events", true) != analytics; ++i) std::this_thread::sleep_for(100ms);
    return count("analytics_events", true);
  };
  ASSERT_EQ(waitFor(50), 50) << forwarderLog();
  stopServer();
  writeRows(400);
  for (std::int64_t id = 1; id <= 50; ++id) store->setFlushed(id, static_cast<double>(std::time(nullptr)));
  ASSERT_TRUE(store->flush(5s));
  auto failedWithBacklog = [&] {
    const Json s = status();
    return s["last_error"].is_string() && s["tables"]["analytics_events"]["backlog"] > 0;
  };
  for (int i = 0; i < 200 && !failedWithBacklog(); ++i) std::this_thread::sleep_for(50ms);
  EXPECT_TRUE(failedWithBacklog()) << status().dump();
  startServer();
  ASSERT_EQ(waitFor(450), 450) << forwarderLog();
  for (int i = 0; i < 100 && status()["tables"]["store_changes"]["backlog"] != 0; ++i) std::this_thread::sleep_for(100ms);
  forwarder.signal(SIGTERM);
  EXPECT_EQ(forwarder.waitExit(20s), 0);
  expectSameRows();
  for (const char* table : kTables) EXPECT_LE(count(table, false) - count(table, true), 100) << table;
}

}  // namespace
}  // namespace vireo
