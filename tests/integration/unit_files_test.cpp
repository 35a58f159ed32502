// The service units as systemd reads them: no complaint from the verifier, and
// the system unit's sandbox rated SAFE.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include "../fakes/temp_dir.h"

namespace vireo::itest {
namespace {

namespace fs = std::filesystem;

// Status and what the command wrote to stdout and stderr.
std::pair<int, std::string> run(const std::string& command) {
  std::string output;
  FILE* p = popen((command + " 2>&1").c_str(), "r");
  if (!p) return {-1, output};
  char buffer[4096];
  for (std::size_t n; (n = fread(buffer, 1, sizeof buffer, p)) > 0;) output.append(buffer, n);
  return {pclose(p), output};
}

TEST(UnitFilesTest, VerifyCleanAndSystemUnitRatedSafe) {
  if (!fs::exists("/usr/bin/systemd-analyze")) GTEST_SKIP() << "systemd-analyze is not installed";
  if (run("systemd-analyze security --help").second.find("--offline") == std::string::npos)
    GTEST_SKIP() << "this systemd-analyze has no --offline";
  testing::TempDir dir;
  // The unit as installed, with ExecStart pointing at the built daemon (which the verifier wants to exist).
  auto configure = [&](const std::string& name) {
    std::stringstream in;
    in << std::ifstream(std::string(VIREO_DATA_DIR "/") + name + ".in").rdbuf();
    std::string text = in.str();
    const std::string bindir = fs::path(VIREO_DAEMON_PATH).parent_path();
    for (auto p = text.find("@VIREO_BINDIR@"); p != std::string::npos; p = text.find("@VIREO_BINDIR@"))
      text.replace(p, 14, bindir);
    dir.write(name, text);
    return dir.sub(name);
  };
  const std::string system = configure("vireo-reportingd.service");
  EXPECT_EQ(run("systemd-analyze verify --man=no " + system), std::pair(0, std::string()));
  // A user manager of its own: nothing from the caller's home directory.
  fs::create_directories(dir.sub("xdg"));
  EXPECT_EQ(run("env -u XDG_CONFIG_HOME -u XDG_DATA_HOME HOME=" + dir.path() + " XDG_RUNTIME_DIR=" + dir.sub("xdg") +
                " systemd-analyze --user verify --man=no " + configure("user/vireo-reportingd.service")),
            std::pair(0, std::string()));

  const std::string security = run("systemd-analyze security --offline=yes " + system).second;
  const std::string marker = "Overall exposure level for vireo-reportingd.service: ";
  auto at = security.find(marker);
  ASSERT_NE(at, std::string::npos) << security;
  EXPECT_LE(std::strtod(security.c_str() + at + marker.size(), nullptr), 2.0) << security;
}

}  // namespace
}  // namespace vireo::itest
