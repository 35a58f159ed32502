#include "service_fixture.h"

#include <fcntl.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>

extern char** environ;

namespace vireo::itest {

namespace fs = std::filesystem;

ChildProcess::~ChildProcess() { stop(); }

bool ChildProcess::start(const std::vector<std::string>& argv, const std::map<std::string, std::string>& env,
                         const std::string& outputFile, int* stdoutPipe) {
  // Built before the fork: the child only calls what is safe after forking a threaded process.
  std::map<std::string, std::string> merged;
  for (char** e = environ; *e; ++e)
    if (const char* eq = std::strchr(*e, '=')) merged.emplace(std::string(*e, eq - *e), eq + 1);
  for (const auto& [k, v] : env)
    if (v.empty()) merged.erase(k);
    else merged[k] = v;
  std::vector<std::string> argvCopy = argv, envStrings;
  for (const auto& [k, v] : merged) envStrings.push_back(k + "=" + v);
  std::vector<char*> args, envp;
  for (auto& s : argvCopy) args.push_back(s.data());
  for (auto& s : envStrings) envp.push_back(s.data());
  args.push_back(nullptr);
  envp.push_back(nullptr);

  int pipeFds[2] = {-1, -1};
  if (stdoutPipe && pipe2(pipeFds, O_CLOEXEC) != 0) return false;
  int out = ::open(outputFile.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
  if (out < 0) return false;
  pid_ = fork();
  if (pid_ == 0) {
    dup2(out, STDERR_FILENO);
    dup2(stdoutPipe ? pipeFds[1] : out, STDOUT_FILENO);
    int devnull = ::open("/dev/null", O_RDONLY);
    dup2(devnull, STDIN_FILENO);
    execve(args[0], args.data(), envp.data());
    _exit(127);
  }
  ::close(out);
  if (stdoutPipe) {
    ::close(pipeFds[1]);
    *stdoutPipe = pipeFds[0];
  }
  status_.reset();
  return pid_ > 0;
}

bool ChildProcess::running() { return pid_ > 0 && !waitExit(0ms).has_value(); }

std::optional<int> ChildProcess::waitExit(std::chrono::milliseconds timeout) {
  if (status_) return status_;
  if (pid_ <= 0) return std::nullopt;
  auto until = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    int st = 0;
    pid_t r = waitpid(pid_, &st, WNOHANG);
    if (r == pid_) {
      status_ = WIFEXITED(st) ? WEXITSTATUS(st) : 128 + WTERMSIG(st);
      return status_;
    }
    if (r < 0) return std::nullopt;
    if (std::chrono::steady_clock::now() >= until) return std::nullopt;
    std::this_thread::sleep_for(5ms);
  }
}

void ChildProcess::signal(int sig) {
  if (pid_ > 0 && !status_) ::kill(pid_, sig);
}

void ChildProcess::stop() {
  if (pid_ <= 0 || status_) return;
  signal(SIGTERM);
  if (!waitExit(10s)) {
    signal(SIGKILL);
    waitExit(5s);
  }
}

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
