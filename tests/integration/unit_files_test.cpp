// The service units as systemd reads them: no complaint from the verifier, and
// the system unit's sandbox rated SAFE.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

namespace vireo::itest {
namespace {

namespace fs = std::filesystem;

class UnitFilesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!fs::exists("/usr/bin/systemd-analyze")) GTEST_SKIP() << "systemd-analyze is not installed";
    if (run("systemd-analyze security --help").output.find("--offline") == std::string::npos)
      GTEST_SKIP() << "this systemd-analyze has no --offline";
    char tmpl[] = "/tmp/vireo-units-XXXXXX";
    ASSERT_TRUE(mkdtemp(tmpl));
    dir_ = tmpl;
    fs::create_directories(dir_ + "/user");
    fs::create_directories(dir_ + "/xdg");
  }
  void TearDown() override {
    std::error_code ec;
    if (!dir_.empty()) fs::remove_all(dir_, ec);
  }

  struct Result {
    int status;
    std::string output;
  };
  // Runs a shell command; output is what it wrote to stdout and stderr.
  static Result run(const std::string& command) {
    Result result{-1, {}};
    FILE* p = popen((command + " 2>&1").c_str(), "r");
    if (!p) return result;
    char buffer[4096];
    for (std::size_t n; (n = fread(buffer, 1, sizeof buffer, p)) > 0;) result.output.append(buffer, n);
    result.status = pclose(p);
    return result;
  }
  // The unit as installed, with ExecStart pointing at the built daemon (which
  // the verifier wants to exist).
  std::string configure(const std::string& source, const std::string& target) {
    std::stringstream in;
    in << std::ifstream(std::string(VIREO_DATA_DIR "/") + source).rdbuf();
    std::string text = in.str();
    const std::string bindir = fs::path(VIREO_DAEMON_PATH).parent_path();
    for (auto p = text.find("@VIREO_BINDIR@"); p != std::string::npos; p = text.find("@VIREO_BINDIR@"))
      text.replace(p, 14, bindir);
    const std::string path = dir_ + "/" + target;
    std::ofstream(path) << text;
    return path;
  }

  std::string dir_;
};

TEST_F(UnitFilesTest, VerifyCleanAndSystemUnitRatedSafe) {
  const std::string system = configure("vireo-reportingd.service.in", "vireo-reportingd.service");
  const std::string user = configure("user/vireo-reportingd.service.in", "user/vireo-reportingd.service");

  Result verify = run("systemd-analyze verify --man=no " + system);
  EXPECT_EQ(verify.status, 0);
  EXPECT_EQ(verify.output, "");
  // A user manager of its own: nothing from the caller's home directory.
  verify = run("env -u XDG_CONFIG_HOME -u XDG_DATA_HOME HOME=" + dir_ + " XDG_RUNTIME_DIR=" + dir_ +
               "/xdg systemd-analyze --user verify --man=no " + user);
  EXPECT_EQ(verify.status, 0);
  EXPECT_EQ(verify.output, "");

  Result security = run("systemd-analyze security --offline=yes " + system);
  const std::string marker = "Overall exposure level for vireo-reportingd.service: ";
  auto at = security.output.find(marker);
  ASSERT_NE(at, std::string::npos) << security.output;
  double exposure = std::strtod(security.output.c_str() + at + marker.size(), nullptr);
  EXPECT_LE(exposure, 2.0) << security.output;
}

}  // namespace
}  // namespace vireo::itest
