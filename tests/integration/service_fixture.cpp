#include "service_fixture.h"

#include <sqlite3.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

namespace vireo::itest {

namespace fs = std::filesystem;

std::string ServiceTest::startPrivateBus(ChildProcess& bus, const std::string& dir) {
  int fd = -1;
  if (!bus.start({"/usr/bin/dbus-daemon", "--session", "--nofork", "--print-address", "--address=unix:dir=" + dir},
                 {}, dir + "/dbus-daemon.log", &fd))
    return {};
  std::string address;
  char c;
  while (::read(fd, &c, 1) == 1 && c != '\n') address += c;
  ::close(fd);
  return address;
}

void ServiceTest::SetUp() {
  char tmpl[] = "/tmp/vireo-itest-XXXXXX";
  ASSERT_TRUE(mkdtemp(tmpl));
  dir_ = tmpl;
  configDir_ = dir_ + "/conf", stateDir_ = dir_ + "/state", logsDir_ = dir_ + "/logs", runtimeDir_ = dir_ + "/run";
  for (const auto& d : {configDir_, stateDir_, logsDir_, runtimeDir_}) fs::create_directories(d);
  daemonLog_ = dir_ + "/vireo-reportingd.log";
  busAddress_ = startPrivateBus(bus_, dir_);
  ASSERT_FALSE(busAddress_.empty()) << "dbus-daemon did not start";
  systemBusAddress_ = "unix:path=" + dir_ + "/no-system-bus";
  for (const auto& [name, text] : configurationFiles()) writeFile(configDir_ + "/" + name, text);
  daemonEnv_ = {
      {"CONFIGURATION_DIRECTORY", configDir_}, {"STATE_DIRECTORY", stateDir_}, {"LOGS_DIRECTORY", logsDir_},
      {"RUNTIME_DIRECTORY", runtimeDir_}, {"VIREO_BUS", "session"}, {"DBUS_SESSION_BUS_ADDRESS", busAddress_},
      {"DBUS_STARTER_BUS_TYPE", ""}, {"JOURNAL_STREAM", ""}};
  beforeDaemonStarts();
  if (HasFatalFailure()) return;
  daemonEnv_["DBUS_SYSTEM_BUS_ADDRESS"] = systemBusAddress_;  // beforeDaemonStarts may start one
  ASSERT_TRUE(daemon_.start({VIREO_DAEMON_PATH}, daemonEnv_, daemonLog_));
  auto probe = client::Client::connectAddress(busAddress_);
  ASSERT_TRUE(probe) << probe.error().message;
  bool up = eventually([&] { return bool((*probe)->ping()) || !daemon_.running(); }, 20s);
  ASSERT_TRUE(up && daemon_.running()) << "the daemon did not come up:\n" << log();
}

void ServiceTest::TearDown() {
  if (dir_.empty()) return;
  daemon_.stop();
  if (HasFailure()) std::fprintf(stderr, "---- daemon log ----\n%s---- end ----\n", log().c_str());
  bus_.stop();
  std::error_code ec;
  if (!std::getenv("VIREO_KEEP_TEST_DIRS")) fs::remove_all(dir_, ec);
}

std::unique_ptr<client::Client> ServiceTest::connect() {
  auto c = client::Client::connectAddress(busAddress_);
  EXPECT_TRUE(c) << c.error().message;
  if (!c) return nullptr;
  (*c)->setCallTimeout(10s);
  return std::move(*c);
}

client::StartHandle ServiceTest::startSession(client::Client& c, std::int64_t id, std::uint16_t type,
                                              const char* app) {
  EXPECT_EQ(*c.createReportingSession(id), true);
  EXPECT_EQ(*c.setServiceType(type, id), true);
  if (app) {
    EXPECT_EQ(*c.setConfiguration(Dictionary{{"HostApplicationDisplayID", app}}, id), true);
  }
  return c.startReportingSessionForID(id);
}

bool ServiceTest::answeredTrue(const client::StartHandle& start) {
  auto answer = start.waitFor(10s);
  return answer && answer->ok() && **answer;
}

void ServiceTest::writeFile(const std::string& path, const std::string& text) {
  fs::create_directories(fs::path(path).parent_path());
  std::string tmp = path + ".tmp";
  std::ofstream(tmp) << text;
  fs::rename(tmp, path);
}

std::string ServiceTest::readFile(const std::string& path) {
  std::stringstream ss;
  ss << std::ifstream(path).rdbuf();
  return ss.str();
}

bool ServiceTest::waitForLog(const std::string& text, std::chrono::milliseconds timeout) {
  return eventually([&] { return log().find(text) != std::string::npos; }, timeout);
}

// Text columns holding a JSON object or array come back parsed.
std::vector<nlohmann::json> ServiceTest::rows(const std::string& sql) {
  std::vector<nlohmann::json> out;
  sqlite3* db = nullptr;
  sqlite3_stmt* st = nullptr;
  if (sqlite3_open_v2((stateDir_ + "/vireo.db").c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK &&
      sqlite3_busy_timeout(db, 2000) == SQLITE_OK &&
      sqlite3_prepare_v2(db, sql.c_str(), -1, &st, nullptr) == SQLITE_OK) {
    while (sqlite3_step(st) == SQLITE_ROW) {
      nlohmann::json& row = out.emplace_back(nlohmann::json::object());
      for (int i = 0; i < sqlite3_column_count(st); ++i) {
        nlohmann::json& cell = row[sqlite3_column_name(st, i)];
        switch (sqlite3_column_type(st, i)) {
          case SQLITE_NULL: break;
          case SQLITE_INTEGER: cell = static_cast<std::int64_t>(sqlite3_column_int64(st, i)); break;
          case SQLITE_FLOAT: cell = sqlite3_column_double(st, i); break;
          default: {
            std::string text = reinterpret_cast<const char*>(sqlite3_column_text(st, i));
            cell = nlohmann::json::parse(text, nullptr, false);
            if (cell.is_discarded() || !(cell.is_object() || cell.is_array())) cell = text;
          }
        }
      }
    }
  }
  sqlite3_finalize(st);
  sqlite3_close(db);
  return out;
}

std::int64_t ServiceTest::count(const std::string& sql) {
  auto r = rows(sql);
  if (r.empty() || r[0].empty()) return -1;
  return r[0].begin()->get<std::int64_t>();
}

}  // namespace vireo::itest
