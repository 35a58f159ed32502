#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/linux/diagnostic_files.h"
#include "platform/linux/key_file.h"
#include "platform/linux/linux_logger.h"
#include "platform/linux/process_table.h"
#include "fakes/temp_dir.h"

namespace vireo::linux_platform {
namespace {

namespace fs = std::filesystem;

using testing::TempDir;

std::string readAll(const std::string& path) {
  std::ostringstream ss;
  ss << std::ifstream(path, std::ios::binary).rdbuf();
  return ss.str();
}

TEST(KeyFile, ParsesAndConvertsValues) {
  auto file = parseKeyFile("# a comment\n\n  Enabled =  yes  \r\nno equals sign\n = orphan value\n"
                           "Path=/a=b\nEnabled=off\nEmpty=\nLast=1");
  EXPECT_EQ(file.size(), 4u);
  EXPECT_EQ(file["Enabled"], "off");
  EXPECT_EQ(file["Path"], "/a=b");
  EXPECT_EQ(file["Empty"], "");
  EXPECT_EQ(file["Last"], "1");
  EXPECT_FALSE(readKeyFile("/nonexistent/vireo/none.conf"));

  for (const char* yes : {"1", "YES", "True", " On "}) EXPECT_TRUE(parseBoolean(yes)) << yes;
  for (const char* no : {"0", "off", "", "2", "yess"}) EXPECT_FALSE(parseBoolean(no)) << no;
  const std::pair<const char*, std::optional<std::int64_t>> integers[] = {
      {" 42 ", 42}, {"-7", -7}, {"+3", 3}, {"4x", std::nullopt}, {"", std::nullopt},
      {"99999999999999999999", std::nullopt}};
  for (const auto& [text, value] : integers) EXPECT_EQ(parseInteger(text), value) << text;
  EXPECT_EQ(splitList(" a, ,b ,,c"), (std::vector<std::string>{"a", "b", "c"}));

  std::string error;
  EXPECT_FALSE(writeKeyFile("/nonexistent/vireo/x.conf", {}, &error));
  EXPECT_FALSE(error.empty());
}

// A memory file that stands in for stderr.
// Append mode: a memfd lacks the shared-offset locking of ordinary files, so
// concurrent writers would otherwise overwrite each other's lines.
struct MemFile {
  int fd = [] {
    int f = ::memfd_create("log", MFD_CLOEXEC);
    ::fcntl(f, F_SETFL, O_APPEND);
    return f;
  }();
  ~MemFile() { ::close(fd); }
  std::string text() const { return readAll("/proc/self/fd/" + std::to_string(fd)); }
};

TEST(LinuxLogger, StreamLinesCarryPriorityLocationAndText) {
  MemFile out;
  int logLine = 0;
  {
    LinuxLogger logger("", LinuxLogger::Output::Stream, out.fd);
    logger.write(LogScope::Server, LogLevel::Default, "file.cpp", 12, "-[X y]", "text");
    logger.write(LogScope::Session, LogLevel::Error, "a.cpp", 1, "f", "bad 100%");
    logger.write(LogScope::Driver, LogLevel::Info, "b.cpp", 2, "g", "");
    logLine = __LINE__ + 1;
    VR_LOG(logger, LogScope::DefaultLog, LogLevel::Debug, "-[Z w]", "n=%d", 5);
  }
  EXPECT_EQ(out.text(),
            "<5>file.cpp:12:-[X y]: text\n"
            "<3>a.cpp:1:f: bad 100%\n"
            "<6>b.cpp:2:g: \n"
            "<7>linux_platform_test.cpp:" +
                std::to_string(logLine) + ":-[Z w]: n=5\n");
}

TEST(LinuxLogger, LinesFromManyThreadsNeverInterleave) {
  MemFile out;
  LinuxLogger logger("", LinuxLogger::Output::Stream, out.fd);
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      std::string body(200, static_cast<char>('a' + t));
      for (int i = 0; i < 200; ++i) logger.write(LogScope::Session, LogLevel::Info, "t.cpp", t, "f", body);
    });
  }
  for (auto& th : threads) th.join();
  std::istringstream lines(out.text());
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

TEST(LinuxLogger, VerboseScopesAndTheJournalStreamCheck) {
  LinuxLogger none("", LinuxLogger::Output::Stream);
  LinuxLogger some(" reporting_session_verbose , reporting_driver_verbose,bogus", LinuxLogger::Output::Stream);
  LinuxLogger all("all", LinuxLogger::Output::Stream);
  for (auto scope : {LogScope::Server, LogScope::Session, LogScope::Driver}) {
    EXPECT_FALSE(none.verbose(scope));
    EXPECT_TRUE(all.verbose(scope));
    EXPECT_EQ(some.verbose(scope), scope != LogScope::Server);
  }

  // JOURNAL_STREAM must name exactly this descriptor's device and inode.
  MemFile file;
  struct stat st {};
  ASSERT_EQ(::fstat(file.fd, &st), 0);
  std::string match = std::to_string(st.st_dev) + ":" + std::to_string(st.st_ino);
  EXPECT_TRUE(LinuxLogger::journalStreamMatches(match.c_str(), file.fd));
  for (const std::string& wrong : {match + "1", match + "x", std::string()})
    EXPECT_FALSE(LinuxLogger::journalStreamMatches(wrong.c_str(), file.fd)) << wrong;
  EXPECT_FALSE(LinuxLogger::journalStreamMatches(nullptr, file.fd));
}

TEST(ProcessTable, NamesAreShortAndValidUtf8) {
  TempDir proc;
  proc.write("42/comm", "caf\xC3\xA9\xFF\n");
  proc.write("43/comm", "abcdefghijklmnopqrstuvwxyz\n");
  ProcfsProcessTable table(proc.path());
  EXPECT_EQ(table.shortName(42), "caf\xC3\xA9\xEF\xBF\xBD");
  EXPECT_EQ(table.shortName(43), "abcdefghijklmnop");
  EXPECT_FALSE(table.shortName(44));

  const std::string bad = "\xEF\xBF\xBD";  // the replacement character
  const std::pair<std::string, std::string> utf8[] = {
      {"\xE2\x82\xAC \xF0\x9F\x90\xA6", "\xE2\x82\xAC \xF0\x9F\x90\xA6"},
      {"\xC0\xAF", bad + bad},              // overlong
      {"\xED\xA0\x80", bad + bad + bad},      // surrogate
      {"a\xE2\x82", "a" + bad + bad},        // cut short
      {std::string("a\0b", 3), "a" + bad + "b"}};
  for (const auto& [in, out] : utf8) EXPECT_EQ(validUtf8(in), out);
}

// Summary files: replaced whole, readable by all, and a failure names its reason.
TEST(DiagnosticFiles, CreatesDirectoriesAndReplacesFilesAtomically) {
  TempDir dir;
  LinuxDiagnosticFiles files(dir.path() + "/log");
  const std::string nested = dir.path() + "/log/Audio/Reporting", path = nested + "/summary.json";
  Error error;
  ASSERT_TRUE(files.createDirectory(nested, 0777, &error)) << error.description;
  EXPECT_TRUE(files.createDirectory(nested + "/", 0777, &error));  // already there
  ASSERT_TRUE(files.writeAtomically(path, "first", &error));
  ASSERT_TRUE(files.writeAtomically(path, "[\n  {}\n]", &error));
  EXPECT_EQ(readAll(path), "[\n  {}\n]");
  struct stat st {};
  ASSERT_EQ(::stat(path.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0644u);
  EXPECT_EQ(std::distance(fs::directory_iterator(nested), fs::directory_iterator{}), 1);  // no temporaries left
  dir.write("plain", "x");
  EXPECT_FALSE(files.createDirectory(dir.path() + "/plain/sub", 0777, &error));
  EXPECT_EQ(error.description, std::strerror(ENOTDIR));
}

}  // namespace
}  // namespace vireo::linux_platform
