// vireoctl against the running service: sequences on one connection, exit codes,
// the defaults suite with its notification, and the store queries.
#include <unistd.h>

#include <sstream>

#include "service_fixture.h"

namespace vireo::itest {
namespace {

struct CtlRun {
  int status = -1;
  std::string out;   // standard output
  std::string text;  // standard error
};

class CtlTest : public ServiceTest {
 protected:
  CtlRun ctl(std::vector<std::string> args, const std::string& input = "") {
    std::string inputFile = dir_ + "/ctl-input";
    std::string errFile = dir_ + "/ctl-stderr";
    writeFile(inputFile, input);
    ::unlink(errFile.c_str());
    std::vector<std::string> argv{"/bin/sh", "-c", "exec \"$0\" \"$@\" < " + inputFile, VIREOCTL_PATH};
    argv.insert(argv.end(), args.begin(), args.end());
    ChildProcess p;
    int fd = -1;
    CtlRun run;
    if (!p.start(argv,
                 {{"DBUS_SESSION_BUS_ADDRESS", busAddress_}, {"VIREO_BUS", "session"},
                  {"CONFIGURATION_DIRECTORY", configDir_}, {"STATE_DIRECTORY", stateDir_}},
                 errFile, &fd))
      return run;
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
  bool answered = false;
  for (const auto& l : lines) answered = answered || (l.contains("answered") && l["answered"] == true);
  EXPECT_TRUE(answered) << r.out;
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
  nlohmann::json rowsJson;
  ASSERT_TRUE(eventually(
      [&] {
        rowsJson = nlohmann::json::parse(ctl({"messages", "--json", "--since", "2000-01-01T00:00:00Z"}).out, nullptr,
                                         false);
        for (const auto& row : rowsJson)
          if (row["category"] == 2) return true;
        return false;
      },
      15s));
  for (const auto& row : rowsJson) {
    if (row["category"] != 2) continue;
    EXPECT_EQ(row["payload"]["n"], 7);
    EXPECT_EQ(row["payload"]["x"], 1.5);
  }
  auto sessions = nlohmann::json::parse(ctl({"sessions", "--json", "--limit", "1"}).out, nullptr, false);
  ASSERT_TRUE(sessions.is_array());
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_TRUE(sessions[0]["user_info"].is_object());
  EXPECT_EQ(ctl({"analytics", "--session", "1"}).status, 2);

  // The defaults suite with its notification switches reporting off and on.
  ASSERT_EQ(ctl({"defaults", "write", "disable_reporting", "true"}).status, 0);
  EXPECT_EQ(ctl({"defaults", "read", "disable_reporting"}).out, "true\n");
  ASSERT_EQ(ctl({"notify", "com.orvane.vireo.reporting"}).status, 0);
  EXPECT_TRUE(eventually([&] { return (r = ctl({"send", "3", "1", "k=1"})).status == 1; }));
  EXPECT_NE(r.text.find("com.orvane.audio.reporting.ReportingDisabled"), std::string::npos) << r.text;
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

}  // namespace
}  // namespace vireo::itest
