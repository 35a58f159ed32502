// vireoctl against the running service: sequences on one connection, exit codes,
// the defaults suite with its notification, the store queries and watch; and the
// README's trial run, pasted as scripts/run.sh prints it.
#include <poll.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "service_fixture.h"

namespace vireo::itest {
namespace {

namespace fs = std::filesystem;

// One line from fd, nothing when none came within the timeout (or at end of file).
std::optional<std::string> readLine(int fd, std::chrono::milliseconds timeout) {
  auto until = std::chrono::steady_clock::now() + timeout;
  std::string line;
  for (;;) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(until - std::chrono::steady_clock::now());
    pollfd p{fd, POLLIN, 0};
    if (left.count() <= 0 || ::poll(&p, 1, static_cast<int>(left.count())) <= 0) return std::nullopt;
    char c;
    if (::read(fd, &c, 1) != 1) return std::nullopt;
    if (c == '\n') return line;
    line += c;
  }
}

struct CtlRun {
  int status = -1;
  std::string out;   // standard output
  std::string text;  // standard error
};

class CtlTest : public ServiceTest {
 protected:
  CtlRun ctl(std::vector<std::string> args, const std::string& input = "",
             std::map<std::string, std::string> env = {}) {
    const std::string inputFile = dir_ + "/ctl-input", errFile = dir_ + "/ctl-stderr";
    writeFile(inputFile, input);
    ::unlink(errFile.c_str());
    std::vector<std::string> argv{"/bin/sh", "-c", "exec \"$0\" \"$@\" < " + inputFile, VIREOCTL_PATH};
    argv.insert(argv.end(), args.begin(), args.end());
    ChildProcess p;
    int fd = -1;
    CtlRun run;
    env.merge(std::map<std::string, std::string>{{"DBUS_SESSION_BUS_ADDRESS", busAddress_},
                                                 {"VIREO_BUS", "session"},
                                                 {"CONFIGURATION_DIRECTORY", configDir_},
                                                 {"STATE_DIRECTORY", stateDir_}});
    if (!p.start(argv, env, errFile, &fd)) return run;
    char buf[4096];
    ssize_t n;
    while ((n = ::read(fd, buf, sizeof buf)) > 0) run.out.append(buf, static_cast<size_t>(n));
    ::close(fd);
    run.status = p.waitExit(30s).value_or(-1);
    run.text = readFile(errFile);
    return run;
  }
  static std::vector<nlohmann::json> jsonLines(const std::string& out) {
    std::vector<nlohmann::json> lines;
    std::istringstream in(out);
    for (std::string line; std::getline(in, line);) lines.push_back(nlohmann::json::parse(line, nullptr, false));
    return lines;
  }
};

TEST_F(CtlTest, SequencesScriptsStoreQueriesAndTheReportingSwitch) {
  // A sequence runs on one connection, so the start is answered by the stop.
  auto r = ctl({"--json", "create", "5", "--", "set-service-type", "5", "2", "--", "service-type", "5", "--", "start",
                "5", "--", "send", "--to", "5", "0x40000003", "1", "buffer size=512", "--", "list", "--", "stop", "5",
                "--", "valid", "5"});
  ASSERT_EQ(r.status, 0) << r.text;
  auto lines = jsonLines(r.out);
  ASSERT_GE(lines.size(), 8u) << r.out;
  EXPECT_EQ(lines[2]["serviceType"], 2);
  EXPECT_EQ(lines[3]["pending"], true);
  EXPECT_EQ(lines[5]["reporterIDs"], nlohmann::json::array({5}));
  EXPECT_TRUE(std::ranges::any_of(lines, [](auto& l) { return l.contains("answered") && l["answered"] == true; }))
      << r.out;
  EXPECT_EQ(lines.back()["serviceType"], 2);

  r = ctl({"-"}, "create 9  # first\nstart 9\nsleep 0.1\nstop 9\nwait-start 9 5\nlist\n");
  EXPECT_EQ(r.status, 0) << r.text;
  EXPECT_NE(r.out.find("start 9: answered true"), std::string::npos) << r.out;
  EXPECT_NE(r.out.find("list: 9"), std::string::npos) << r.out;
  EXPECT_EQ(ctl({"create"}).status, 2);
  EXPECT_EQ(ctl({"send", "0x1ffffffff", "1"}).status, 2);
  EXPECT_EQ(ctl({"script"}, "create 1\nbogus\n").status, 2);
  EXPECT_EQ(ctl({"wait-start", "3", "0.1"}).status, 1);

  // Store queries embed the JSON columns.
  ASSERT_EQ(ctl({"create", "4", "--", "start", "4", "--", "send", "--to", "4", "0x08000002", "3", "n=7", "x=1.5",
                 "--", "stop", "4"})
                .status,
            0);
  nlohmann::json row;
  ASSERT_TRUE(eventually([&] {
    auto out = ctl({"messages", "--json", "--since", "2000-01-01T00:00:00Z"}).out;
    for (const auto& each : nlohmann::json::parse(out, nullptr, false))
      if (each["category"] == 2) return (row = each), true;
    return false;
  }, 15s));
  EXPECT_EQ(row["payload"]["n"], 7);
  EXPECT_EQ(row["payload"]["x"], 1.5);
  auto sessions = nlohmann::json::parse(ctl({"sessions", "--json", "--limit", "1"}).out, nullptr, false);
  ASSERT_TRUE(sessions.is_array() && sessions.size() == 1) << sessions;
  EXPECT_TRUE(sessions[0]["user_info"].is_object());
  EXPECT_EQ(ctl({"analytics", "--session", "1"}).status, 2);
  // The defaults suite with its notification switches reporting off and on.
  ASSERT_EQ(ctl({"defaults", "write", "disable_reporting", "true"}).status, 0);
  EXPECT_EQ(ctl({"defaults", "read", "disable_reporting"}).out, "true\n");
  ASSERT_EQ(ctl({"notify", "com.orvane.vireo.reporting"}).status, 0);
  EXPECT_TRUE(eventually([&] { return (r = ctl({"send", "3", "1", "k=1"})).status == 1; }));
  EXPECT_NE(r.text.find("com.orvane.audio.reporting.ReportingDisabled"), std::string::npos) << r.text;
  // With --json, standard output holds results only and the error is one JSON line.
  r = ctl({"--json", "ping", "--", "send", "3", "1", "k=1", "--", "ping"});
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(jsonLines(r.out).size(), 1u) << r.out;
  auto error = nlohmann::json::parse(r.text, nullptr, false);
  EXPECT_EQ(error["op"], "send") << r.text;
  EXPECT_EQ(error["error"]["code"], 1) << r.text;
  r = ctl({"--json", "defaults", "write", "a=b"});
  EXPECT_EQ(r.status, 2);
  EXPECT_EQ(nlohmann::json::parse(r.text, nullptr, false)["error"]["name"], "com.orvane.vireoctl.UsageError");
  ASSERT_EQ(ctl({"defaults", "delete", "disable_reporting"}).status, 0);
  EXPECT_EQ(ctl({"defaults", "read", "disable_reporting"}).status, 1);  // a missing key
  ASSERT_EQ(ctl({"defaults", "write", "device_name", "living", "room"}).status, 0);
  EXPECT_EQ(ctl({"defaults", "read", "device_name"}).out, "living room\n");
  ASSERT_EQ(ctl({"notify"}).status, 0);
  EXPECT_TRUE(eventually([&] { return ctl({"send", "3", "1", "k=1"}).status == 0; }));

  // The shell's interface orientation: only the known texts.
  EXPECT_EQ(ctl({"orientation", "left-up"}).status, 0);
  r = ctl({"orientation", "sideways"});
  EXPECT_EQ(r.status, 1);
  EXPECT_NE(r.text.find("org.freedesktop.DBus.Error.InvalidArgs"), std::string::npos) << r.text;
}

TEST_F(CtlTest, WatchPrintsRowsAsTheyLandUntilInterrupted) {
  ChildProcess watch;
  int fd = -1;
  ASSERT_TRUE(watch.start({VIREOCTL_PATH, "--json", "watch", "messages"},
                          {{"VIREO_BUS", "session"}, {"STATE_DIRECTORY", stateDir_}}, dir_ + "/watch-stderr", &fd));
  // Rows stored before its first look are history, so send until one shows up.
  std::optional<std::string> line;
  for (int i = 0; i < 40 && !line; ++i) {
    ASSERT_EQ(ctl({"create", "3", "--", "start", "3", "--", "send", "--to", "3", "0x20", "4", "n=" + std::to_string(i),
                   "--", "stop", "3"})
                  .status,
              0);
    line = readLine(fd, 500ms);
  }
  ASSERT_TRUE(line) << readFile(dir_ + "/watch-stderr");
  auto row = nlohmann::json::parse(*line, nullptr, false);
  EXPECT_EQ(row["table"], "messages") << *line;
  EXPECT_EQ(row["category"], 0x20) << *line;
  EXPECT_TRUE(row["payload"]["n"].is_number()) << *line;
  watch.signal(SIGINT);
  EXPECT_EQ(watch.waitExit(5s), 0);
  ::close(fd);
}

std::string slurp(const fs::path& path) {
  std::stringstream ss;
  ss << std::ifstream(path).rdbuf();
  return ss.str();
}

// The README's "Trying it" block, run verbatim in a fresh shell after the line
// scripts/run.sh printed, against the binaries this build made.
class ReadmeTryingIt : public ::testing::Test {
 protected:
  void SetUp() override {
    char tmpl[] = "/tmp/vireo-readme-XXXXXX";
    ASSERT_TRUE(mkdtemp(tmpl));
    dir_ = tmpl;
  }
  void TearDown() override {
    bus_.stop();
    std::error_code ec;
    if (!std::getenv("VIREO_KEEP_TEST_DIRS")) fs::remove_all(dir_, ec);
  }

  // uid 0: the test's own user, else that user through setpriv. existingBus: the user's
  // session bus; without one run.sh starts its own.
  void tryIt(uid_t uid, const std::string& existingBus) {
    const fs::path source = fs::path(__FILE__).parent_path().parent_path().parent_path();
    const std::string readme = slurp(source / "README.md");
    const auto open = readme.find("\n```sh\n", readme.find("\n## Trying it\n")) + 7;
    const std::string block = readme.substr(open, readme.find("\n```\n", open) + 1 - open);
    ASSERT_NE(block.find("$ctl"), std::string::npos) << "no Trying it block in README.md";
    const std::string home = dir_ + "/home", repo = dir_ + "/repo";
    fs::create_directories(home);
    fs::create_directories(repo + "/build/release/src/ctl");
    fs::create_symlink(VIREOCTL_PATH, repo + "/build/release/src/ctl/vireoctl");
    std::vector<std::string> as;
    if (uid != 0) {
      for (const auto& entry : fs::recursive_directory_iterator(dir_))
        ASSERT_EQ(::lchown(entry.path().c_str(), uid, uid), 0);
      ASSERT_EQ(::chown(dir_.c_str(), uid, uid), 0);
      as = {"/usr/bin/setpriv", "--reuid=" + std::to_string(uid), "--regid=" + std::to_string(uid), "--clear-groups"};
    }
    // A clean slate: nothing of the test's own bus or directories leaks in.
    std::map<std::string, std::string> env{
        {"HOME", home}, {"TMPDIR", dir_}, {"XDG_CONFIG_HOME", ""}, {"XDG_STATE_HOME", ""}, {"XDG_RUNTIME_DIR", ""},
        {"CONFIGURATION_DIRECTORY", ""}, {"STATE_DIRECTORY", ""}, {"LOGS_DIRECTORY", ""}, {"RUNTIME_DIRECTORY", ""},
        {"VIREO_BUS", ""}, {"DBUS_SESSION_BUS_ADDRESS", ""}, {"DBUS_STARTER_BUS_TYPE", ""}, {"JOURNAL_STREAM", ""},
        {"DBUS_SYSTEM_BUS_ADDRESS", "unix:path=" + dir_ + "/no-system-bus"}};
    auto runEnv = env;
    runEnv["DBUS_SESSION_BUS_ADDRESS"] = existingBus;
    runEnv["VIREO_RUN_NO_BUILD"] = "1";
    runEnv["VIREO_BUILD_DIR"] = fs::path(VIREOCTL_PATH).parent_path().parent_path().parent_path().string();

    auto argv = as;
    argv.insert(argv.end(), {"/bin/bash", (source / "scripts/run.sh").string()});
    ChildProcess run, shell;
    int fd = -1;
    ASSERT_TRUE(run.start(argv, runEnv, dir_ + "/run.log", &fd));
    auto line = readLine(fd, 60s);
    ASSERT_TRUE(line) << slurp(dir_ + "/run.log");
    EXPECT_EQ(line->rfind("export VIREO_BUS=session DBUS_SESSION_BUS_ADDRESS=", 0), 0u) << *line;
    const std::string bus = existingBus.empty() ? "unix:path=" + dir_ + "/vireo-bus." : existingBus;
    EXPECT_NE(line->find("'" + bus), std::string::npos) << *line;

    argv = as;
    argv.insert(argv.end(), {"/bin/bash", "-c", "set -e\ncd '" + repo + "'\n" + *line + "\n" + block});
    ASSERT_TRUE(shell.start(argv, env, dir_ + "/shell.log"));
    EXPECT_EQ(shell.waitExit(60s), 0);
    const std::string out = slurp(dir_ + "/shell.log");
    for (const char* expected : {"start 7: answered true", "\"buffer_size\": 512", "\"route\": \"speaker\"",
                                 "VR_Session_Summary_Event", "sessions:"})
      EXPECT_NE(out.find(expected), std::string::npos) << expected << " in:\n" << out;
    EXPECT_TRUE(fs::exists(home + "/.local/state/vireo/vireo.db"));  // the user's, root's too

    run.signal(SIGTERM);
    EXPECT_EQ(run.waitExit(20s), 0);
    EXPECT_EQ(readLine(fd, 1s), std::nullopt);  // exactly one line
    ::close(fd);
    for (const auto& entry : fs::directory_iterator(dir_))
      EXPECT_NE(entry.path().filename().string().rfind("vireo-bus.", 0), 0u) << "private bus left behind";
    if (HasFailure()) std::fprintf(stderr, "---- run.sh ----\n%s---- end ----\n", slurp(dir_ + "/run.log").c_str());
  }

  std::string dir_;
  ChildProcess bus_;
};

TEST_F(ReadmeTryingIt, WithTheUsersOwnSessionBus) {
  int fd = -1;
  ASSERT_TRUE(bus_.start({"/usr/bin/dbus-daemon", "--session", "--nofork", "--print-address",
                          "--address=unix:path=" + dir_ + "/user-bus"},
                         {}, dir_ + "/dbus-daemon.log", &fd));
  auto address = readLine(fd, 10s);
  ::close(fd);
  ASSERT_TRUE(address);
  tryIt(0, *address);
}

TEST_F(ReadmeTryingIt, AsAnUnprivilegedUserWithoutASessionBus) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to switch to another user";
  ChildProcess probe;  // a build under a private home is out of that user's reach
  ASSERT_TRUE(probe.start({"/usr/bin/setpriv", "--reuid=65534", "--regid=65534", "--clear-groups", "/usr/bin/test",
                           "-x", VIREOCTL_PATH, "-a", "-r", __FILE__},
                          {}, "/dev/null"));
  if (probe.waitExit(10s) != 0) GTEST_SKIP() << "the build is not readable by nobody";
  tryIt(65534, "");
}

}  // namespace
}  // namespace vireo::itest
