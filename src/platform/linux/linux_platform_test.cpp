#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <optional>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/defaults_store.h"
#include "platform/linux/device_properties.h"
#include "platform/linux/diagnostic_files.h"
#include "platform/linux/key_file.h"
#include "platform/linux/linux_logger.h"
#include "platform/linux/paths.h"
#include "platform/linux/process_table.h"
#include "platform/linux/system_clock.h"

namespace vireo::linux_platform {
namespace {

namespace fs = std::filesystem;

class TempDir {
 public:
  TempDir() {
    std::string pattern = (fs::temp_directory_path() / "vireo-linux-XXXXXX").string();
    path_ = ::mkdtemp(pattern.data()) ? pattern : std::string();
  }
  ~TempDir() {
    std::error_code ec;
    fs::remove_all(path_, ec);
  }
  const std::string& path() const { return path_; }
  void write(const std::string& name, const std::string& text) const {
    fs::create_directories(fs::path(path_ + "/" + name).parent_path());
    std::ofstream(path_ + "/" + name, std::ios::binary) << text;
  }

 private:
  std::string path_;
};

std::string readAll(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

// Sets an environment variable for one scope and restores it afterwards.
class ScopedEnv {
 public:
  ScopedEnv(const char* name, const char* value) : name_(name) {
    if (const char* old = std::getenv(name)) old_ = old;
    if (value) {
      ::setenv(name, value, 1);
    } else {
      ::unsetenv(name);
    }
  }
  ~ScopedEnv() {
    if (old_) {
      ::setenv(name_, old_->c_str(), 1);
    } else {
      ::unsetenv(name_);
    }
  }

 private:
  const char* name_;
  std::optional<std::string> old_;
};

TEST(KeyFile, ParsesCommentsBlanksAndLaterLinesWin) {
  auto file = parseKeyFile(
      "# a comment\n"
      "\n"
      "  Enabled =  yes  \r\n"
      "no equals sign\n"
      " = orphan value\n"
      "Path=/a=b\n"
      "Enabled=off\n"
      "Empty=\n"
      "Last=1");
  EXPECT_EQ(file.size(), 4u);
  EXPECT_EQ(file["Enabled"], "off");
  EXPECT_EQ(file["Path"], "/a=b");
  EXPECT_EQ(file["Empty"], "");
  EXPECT_EQ(file["Last"], "1");
  EXPECT_FALSE(readKeyFile("/nonexistent/vireo/none.conf"));
}

TEST(KeyFile, BooleansAndIntegers) {
  for (const char* yes : {"1", "yes", "YES", "True", "on", "ON", " On "}) EXPECT_TRUE(parseBoolean(yes)) << yes;
  for (const char* no : {"0", "no", "false", "off", "", "2", "yess", "enabled"}) EXPECT_FALSE(parseBoolean(no)) << no;
  EXPECT_EQ(parseInteger(" 42 "), 42);
  EXPECT_EQ(parseInteger("-7"), -7);
  EXPECT_EQ(parseInteger("+3"), 3);
  EXPECT_FALSE(parseInteger("4x"));
  EXPECT_FALSE(parseInteger(""));
  EXPECT_FALSE(parseInteger("99999999999999999999"));
  EXPECT_EQ(splitList(" a, ,b ,,c"), (std::vector<std::string>{"a", "b", "c"}));
}

TEST(KeyFile, WriteReplacesTheFileAtomically) {
  TempDir dir;
  std::string path = dir.path() + "/suite.conf";
  dir.write("suite.conf", "old=1\n");
  std::string error;
  ASSERT_TRUE(writeKeyFile(path, {{"a", "1"}, {"b", "two words"}}, &error)) << error;
  EXPECT_EQ(readAll(path), "a=1\nb=two words\n");
  EXPECT_FALSE(writeKeyFile(dir.path() + "/missing/x.conf", {}, &error));
  EXPECT_FALSE(error.empty());
}

TEST(ServiceDirectories, VariablesNameTheFirstOfTheirPaths) {
  ScopedEnv c("CONFIGURATION_DIRECTORY", "/etc/one:/etc/two");
  ScopedEnv s("STATE_DIRECTORY", "/var/lib/st");
  ScopedEnv l("LOGS_DIRECTORY", "/var/log/lg:/x");
  ScopedEnv r("RUNTIME_DIRECTORY", "/run/rt");
  auto d = ServiceDirectories::fromEnvironment();
  EXPECT_EQ(d.configuration, "/etc/one");
  EXPECT_EQ(d.state, "/var/lib/st");
  EXPECT_EQ(d.logs, "/var/log/lg");
  EXPECT_EQ(d.runtime, "/run/rt");
}

// Reads what the logger wrote into a pipe.
class Pipe {
 public:
  Pipe() { EXPECT_EQ(::pipe2(fds_, O_CLOEXEC), 0); }
  ~Pipe() {
    ::close(fds_[0]);
    if (fds_[1] >= 0) ::close(fds_[1]);
  }
  int writeEnd() const { return fds_[1]; }
  std::string drain() {
    ::close(fds_[1]);
    fds_[1] = -1;
    std::string out;
    char buf[4096];
    ssize_t n;
    while ((n = ::read(fds_[0], buf, sizeof buf)) > 0) out.append(buf, static_cast<size_t>(n));
    return out;
  }

 private:
  int fds_[2] = {-1, -1};
};

TEST(LinuxLogger, StreamLinesCarryPriorityLocationAndText) {
  Pipe pipe;
  int logLine = 0;
  {
    LinuxLogger logger("", LinuxLogger::Output::Stream, pipe.writeEnd());
    logger.write(LogScope::Server, LogLevel::Default, "file.cpp", 12, "-[X y]", "text");
    logger.write(LogScope::Session, LogLevel::Error, "a.cpp", 1, "f", "bad 100%");
    logger.write(LogScope::Driver, LogLevel::Info, "b.cpp", 2, "g", "");
    logLine = __LINE__ + 1;
    VR_LOG(logger, LogScope::DefaultLog, LogLevel::Debug, "-[Z w]", "n=%d", 5);
  }
  EXPECT_EQ(pipe.drain(),
            "<5>file.cpp:12:-[X y]: text\n"
            "<3>a.cpp:1:f: bad 100%\n"
            "<6>b.cpp:2:g: \n"
            "<7>linux_platform_test.cpp:" +
                std::to_string(logLine) + ":-[Z w]: n=5\n");
}

TEST(LinuxLogger, LinesFromManyThreadsNeverInterleave) {
  Pipe pipe;
  ASSERT_EQ(::fcntl(pipe.writeEnd(), F_SETPIPE_SZ, 1 << 20) >= 0, true);
  LinuxLogger logger("", LinuxLogger::Output::Stream, pipe.writeEnd());
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      std::string body(200, static_cast<char>('a' + t));
      for (int i = 0; i < 200; ++i) logger.write(LogScope::Session, LogLevel::Info, "t.cpp", t, "f", body);
    });
  }
  for (auto& th : threads) th.join();
  std::istringstream lines(pipe.drain());
  std::string line;
  int count = 0;
  while (std::getline(lines, line)) {
    ++count;
    ASSERT_EQ(line.size(), std::string("<6>t.cpp:0:f: ").size() + 200) << line;
    char c = line.back();
    EXPECT_EQ(line.find_first_not_of(c, line.size() - 200), std::string::npos);
  }
  EXPECT_EQ(count, 800);
}

TEST(LinuxLogger, VerboseScopesFromTheList) {
  LinuxLogger none("", LinuxLogger::Output::Stream);
  LinuxLogger some(" reporting_session_verbose , reporting_driver_verbose,bogus", LinuxLogger::Output::Stream);
  LinuxLogger all("all", LinuxLogger::Output::Stream);
  for (auto scope : {LogScope::Server, LogScope::Session, LogScope::Driver}) {
    EXPECT_FALSE(none.verbose(scope));
    EXPECT_TRUE(all.verbose(scope));
  }
  EXPECT_FALSE(some.verbose(LogScope::Server));
  EXPECT_TRUE(some.verbose(LogScope::Session));
  EXPECT_TRUE(some.verbose(LogScope::Driver));
  {
    ScopedEnv v("VIREO_VERBOSE", "reporting_server_verbose");
    EXPECT_TRUE(LinuxLogger::fromEnvironment()->verbose(LogScope::Server));
  }
}

TEST(LinuxLogger, JournalStreamMustNameTheDescriptor) {
  TempDir dir;
  dir.write("f", "");
  int fd = ::open((dir.path() + "/f").c_str(), O_RDONLY | O_CLOEXEC);
  ASSERT_GE(fd, 0);
  struct stat st {};
  ASSERT_EQ(::fstat(fd, &st), 0);
  std::string match = std::to_string(st.st_dev) + ":" + std::to_string(st.st_ino);
  EXPECT_TRUE(LinuxLogger::journalStreamMatches(match.c_str(), fd));
  EXPECT_FALSE(LinuxLogger::journalStreamMatches((match + "1").c_str(), fd));
  EXPECT_FALSE(LinuxLogger::journalStreamMatches((match + "x").c_str(), fd));
  EXPECT_FALSE(LinuxLogger::journalStreamMatches("", fd));
  EXPECT_FALSE(LinuxLogger::journalStreamMatches(nullptr, fd));
  ::close(fd);
}

TEST(ProcessTable, NamesOfSelfAndOthers) {
  ProcfsProcessTable table;
  EXPECT_EQ(table.selfPid(), ::getpid());
  auto self = table.selfName();
  ASSERT_TRUE(self);
  EXPECT_EQ(*self, std::string("linux_platform_test").substr(0, 15));
  EXPECT_EQ(table.shortName(::getpid()), self);
  EXPECT_FALSE(table.shortName(0));
  EXPECT_FALSE(table.shortName(-5));
  EXPECT_FALSE(table.shortName(0x7fffffff));
}

TEST(ProcessTable, NamesAreShortAndValidUtf8) {
  TempDir proc;
  proc.write("42/comm", "caf\xC3\xA9\xFF\n");
  proc.write("43/comm", "abcdefghijklmnopqrstuvwxyz\n");
  ProcfsProcessTable table(proc.path());
  EXPECT_EQ(table.shortName(42), "caf\xC3\xA9\xEF\xBF\xBD");
  EXPECT_EQ(table.shortName(43), "abcdefghijklmnop");
  EXPECT_FALSE(table.shortName(44));

  EXPECT_EQ(validUtf8("plain"), "plain");
  EXPECT_EQ(validUtf8("\xE2\x82\xAC \xF0\x9F\x90\xA6"), "\xE2\x82\xAC \xF0\x9F\x90\xA6");
  EXPECT_EQ(validUtf8("\xC0\xAF"), "\xEF\xBF\xBD\xEF\xBF\xBD");  // overlong
  EXPECT_EQ(validUtf8("\xED\xA0\x80"), "\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD");  // surrogate
  EXPECT_EQ(validUtf8("a\xE2\x82"), "a\xEF\xBF\xBD\xEF\xBF\xBD");  // cut short
  EXPECT_EQ(validUtf8(std::string("a\0b", 3)), "a\xEF\xBF\xBD" "b");
}

TEST(DeviceProperties, AnswersFromDeviceConf) {
  TempDir dir;
  DevicePropertiesFile device(dir.path());
  EXPECT_FALSE(device.boolAnswer("InternalBuild"));  // no file: the caller's default
  EXPECT_FALSE(device.intAnswer("DeviceClassNumber"));

  dir.write("device.conf", "# integrator settings\nInternalBuild = Yes\nDeviceClassNumber=7\n");
  EXPECT_EQ(device.boolAnswer("InternalBuild"), true);
  EXPECT_EQ(device.intAnswer("DeviceClassNumber"), 7);
  EXPECT_FALSE(device.boolAnswer("Other"));

  dir.write("device.conf", "InternalBuild=nope\nDeviceClassNumber=4294967296\n");  // read again on each call
  EXPECT_EQ(device.boolAnswer("InternalBuild"), false);
  EXPECT_FALSE(device.intAnswer("DeviceClassNumber"));
}

TEST(DefaultsStore, SuiteIsAFileInTheConfigurationDirectory) {
  TempDir dir;
  SuiteFileDefaultsStore store(dir.path());
  EXPECT_FALSE(store.stringForKey("com.orvane.vireo", "key"));
  EXPECT_FALSE(store.boolForKey("com.orvane.vireo", "key"));

  dir.write("com.orvane.vireo.conf", "flag = ON\ntext= some words \nzero=0\n");
  EXPECT_EQ(store.stringForKey("com.orvane.vireo", "text"), "some words");
  EXPECT_TRUE(store.boolForKey("com.orvane.vireo", "flag"));
  EXPECT_FALSE(store.boolForKey("com.orvane.vireo", "zero"));
  EXPECT_FALSE(store.boolForKey("com.orvane.vireo", "text"));
  EXPECT_FALSE(store.stringForKey("other", "flag"));
  EXPECT_FALSE(store.stringForKey("../etc/passwd", "root"));
  EXPECT_EQ(store.suitePath("s"), dir.path() + "/s.conf");
}

TEST(DiagnosticFiles, CreatesDirectoriesAndReplacesFilesAtomically) {
  TempDir dir;
  LinuxDiagnosticFiles files(dir.path() + "/log");
  EXPECT_EQ(files.logDirectory(), dir.path() + "/log");

  std::string nested = dir.path() + "/log/Audio/Reporting";
  Error error;
  ASSERT_TRUE(files.createDirectory(nested, 0777, &error)) << error.description;
  EXPECT_TRUE(fs::is_directory(nested));
  EXPECT_TRUE(files.createDirectory(nested + "/", 0777, &error));  // already there

  std::string path = nested + "/summary.json";
  ASSERT_TRUE(files.writeAtomically(path, "first", &error));
  ASSERT_TRUE(files.writeAtomically(path, "[\n  {}\n]", &error));
  EXPECT_EQ(readAll(path), "[\n  {}\n]");
  struct stat st {};
  ASSERT_EQ(::stat(path.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0644u);
  EXPECT_EQ(std::distance(fs::directory_iterator(nested), fs::directory_iterator{}), 1);  // no temporaries left

  dir.write("plain", "x");
  Error blocked;
  EXPECT_FALSE(files.createDirectory(dir.path() + "/plain/sub", 0777, &blocked));
  EXPECT_EQ(blocked.description, std::strerror(ENOTDIR));
  EXPECT_EQ(blocked.code, ENOTDIR);
  Error missing;
  EXPECT_FALSE(files.writeAtomically(dir.path() + "/nowhere/f.json", "x", &missing));
  EXPECT_EQ(missing.description, std::strerror(ENOENT));
}

TEST(SystemRandom, StaysBelowItsBound) {
  SystemRandom random;
  std::set<std::uint32_t> seen;
  for (int i = 0; i < 2000; ++i) {
    auto v = random.uniformBelow(60);
    ASSERT_LT(v, 60u);
    seen.insert(v);
  }
  EXPECT_GT(seen.size(), 50u);
  EXPECT_EQ(random.uniformBelow(1), 0u);
  EXPECT_EQ(random.uniformBelow(0), 0u);
}

}  // namespace
}  // namespace vireo::linux_platform
