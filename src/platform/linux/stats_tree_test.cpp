#include "platform/linux/stats_tree.h"

#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <utility>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace vireo::linux_platform {
namespace {

namespace fs = std::filesystem;
using ::testing::ElementsAre;
using ::testing::Pair;

class TempDir {
 public:
  TempDir() {
    std::string pattern = (fs::temp_directory_path() / "vireo-stats-XXXXXX").string();
    if (::mkdtemp(pattern.data()) == nullptr) std::abort();
    path_ = pattern;
  }
  ~TempDir() {
    std::error_code ec;
    fs::remove_all(path_, ec);
  }
  const fs::path& path() const { return path_; }

 private:
  fs::path path_;
};

void writeFile(const fs::path& path, const std::string& text) {
  fs::create_directories(path.parent_path());
  std::ofstream(path, std::ios::trunc) << text;
}

using Values = std::vector<std::pair<std::string, std::int64_t>>;

Values valuesOf(StatsTreeLibrary& library, const DriverSampleSet& samples) {
  Values out;
  library.iterate(samples, [&](const DriverChannel& channel) {
    out.emplace_back(library.channelName(channel).value_or("<none>"), library.simpleIntegerValue(channel));
    return DriverIterate::Continue;
  });
  return out;
}

struct Subscribed {
  DriverSubscriptionHandle handle = nullptr;
  std::unique_ptr<DriverSubscribedChannels> channels;
};

Subscribed subscribe(StatsTreeLibrary& library, std::optional<std::string> group, std::optional<std::string> sub) {
  std::optional<DriverStatsError> error;
  auto set = library.copyChannelsInGroup(group, sub, 0, &error);
  EXPECT_FALSE(error);
  Subscribed s;
  s.handle = library.createSubscription(*set, &s.channels);
  return s;
}

std::unique_ptr<DriverSampleSet> sample(StatsTreeLibrary& library, const Subscribed& s) {
  std::optional<DriverStatsError> error;
  auto samples = library.createSamples(s.handle, *s.channels, &error);
  EXPECT_FALSE(error);
  return samples;
}

TEST(StatsCounterParse, AcceptsOneIntegerWithBlanksAround) {
  EXPECT_EQ(parseStatsCounter("42\n"), 42);
  EXPECT_EQ(parseStatsCounter("  -7 \r\n"), -7);
  EXPECT_EQ(parseStatsCounter("9223372036854775807"), INT64_MAX);
  EXPECT_EQ(parseStatsCounter(""), std::nullopt);
  EXPECT_EQ(parseStatsCounter(" \n"), std::nullopt);
  EXPECT_EQ(parseStatsCounter("12abc"), std::nullopt);
  EXPECT_EQ(parseStatsCounter("1 2"), std::nullopt);
  EXPECT_EQ(parseStatsCounter("0x10"), std::nullopt);
  EXPECT_EQ(parseStatsCounter("9223372036854775808"), std::nullopt);
}

TEST(StatsTreeLibrary, SelectsByGroupSubgroupOrBoth) {
  TempDir dir;
  const fs::path stats = dir.path() / "stats";
  writeFile(stats / "OrvaneTK4HB/rx", "1");
  writeFile(stats / "OrvaneTK4HB/dsp/tx", "2");
  writeFile(stats / "Speaker/x", "3");
  writeFile(stats / "A/MCA/drops", "4");
  writeFile(stats / "B/MCA/drops", "5");
  writeFile(stats / "Haptics/Stats/on", "6");
  writeFile(stats / "Haptics/Other/off", "7");
  writeFile(stats / "Haptics/.on.tmp", "8");   // an atomic writer's temporary
  writeFile(stats / "toplevel", "9");          // no group: not a channel
  writeFile(stats / "A/MCA/deeper/z", "10");   // below a subgroup: not a channel
  StatsTreeLibrary library(stats.string());

  auto count = [&](std::optional<std::string> group, std::optional<std::string> sub) {
    std::optional<DriverStatsError> error;
    auto set = library.copyChannelsInGroup(group, sub, 0, &error);
    EXPECT_FALSE(error);
    return library.channelCount(*set);
  };
  EXPECT_EQ(count("OrvaneTK4HB", std::nullopt), 2);
  EXPECT_EQ(count("Speaker", std::nullopt), 1);
  EXPECT_EQ(count(std::nullopt, "MCA"), 2);
  EXPECT_EQ(count("Haptics", "Stats"), 1);
  EXPECT_EQ(count("Haptics", std::nullopt), 2);
  EXPECT_EQ(count("Missing", std::nullopt), 0);
  EXPECT_EQ(count(std::nullopt, std::nullopt), 7);

  // Sorted by path, named by file name.
  auto mca = subscribe(library, std::nullopt, "MCA");
  EXPECT_THAT(valuesOf(library, *sample(library, mca)), ElementsAre(Pair("drops", 4), Pair("drops", 5)));
}

TEST(StatsTreeLibrary, AbsentTreeHasNoChannelsAndNoError) {
  TempDir dir;
  StatsTreeLibrary library((dir.path() / "stats").string());
  std::optional<DriverStatsError> error;
  auto set = library.copyChannelsInGroup("Speaker", std::nullopt, 0, &error);
  ASSERT_TRUE(set);
  EXPECT_EQ(library.channelCount(*set), 0);
  EXPECT_FALSE(error);
}

TEST(StatsTreeLibrary, ReadsFilesAgainButKeepsTheChannelSetOfTheStart) {
  TempDir dir;
  const fs::path stats = dir.path() / "stats";
  const fs::path counters = dir.path() / "counters";
  writeFile(stats / "Speaker/a", "10\n");
  writeFile(stats / "Speaker/bad", "n/a\n");
  writeFile(stats / "Speaker/gone", "5\n");
  writeFile(counters / "real", "7\n");
  fs::create_symlink(counters / "real", stats / "Speaker/linked");
  fs::create_symlink(counters / "later", stats / "Speaker/pending");  // its counter does not exist yet
  writeFile(counters / "hw/x", "3\n");
  fs::create_symlink(counters / "hw", stats / "Speaker/hw");           // a symlinked subgroup
  StatsTreeLibrary library(stats.string());
  auto s = subscribe(library, "Speaker", std::nullopt);

  EXPECT_THAT(valuesOf(library, *sample(library, s)),
              ElementsAre(Pair("a", 10), Pair("gone", 5), Pair("x", 3), Pair("linked", 7)));

  writeFile(stats / "Speaker/a", "4\n");
  writeFile(stats / "Speaker/bad", "12\n");
  writeFile(stats / "Speaker/new", "1\n");  // not part of the set fixed at start
  fs::remove(stats / "Speaker/gone");
  writeFile(counters / "real", "9\n");
  writeFile(counters / "later", "2\n");
  EXPECT_THAT(valuesOf(library, *sample(library, s)),
              ElementsAre(Pair("a", 4), Pair("bad", 12), Pair("x", 3), Pair("linked", 9), Pair("pending", 2)));
}

TEST(StatsTreeLibrary, DeltaSubtractsPerChannelAndTakesMissingEarlierAsZero) {
  TempDir dir;
  const fs::path stats = dir.path() / "stats";
  writeFile(stats / "G/up", "10");
  writeFile(stats / "G/down", "10");
  writeFile(stats / "G/late", "oops");
  writeFile(stats / "G/S/big", "-9223372036854775807");
  StatsTreeLibrary library(stats.string());
  auto s = subscribe(library, "G", std::nullopt);
  auto before = sample(library, s);

  writeFile(stats / "G/up", "15");
  writeFile(stats / "G/down", "4");
  writeFile(stats / "G/late", "6");
  writeFile(stats / "G/S/big", "9223372036854775807");
  auto after = sample(library, s);

  std::optional<DriverStatsError> error;
  auto delta = library.createSamplesDelta(before.get(), *after, &error);
  ASSERT_TRUE(delta);
  EXPECT_FALSE(error);
  EXPECT_THAT(valuesOf(library, *delta),
              ElementsAre(Pair("big", INT64_MAX), Pair("down", -6), Pair("late", 6), Pair("up", 5)));

  auto absolute = library.createSamplesDelta(nullptr, *after, &error);
  ASSERT_TRUE(absolute);
  EXPECT_FALSE(error);
  EXPECT_EQ(valuesOf(library, *absolute), valuesOf(library, *after));
}

// Sample sets and descriptions of another library are refused with an error, never crash.
class ForeignSamples final : public DriverSampleSet {
 public:
  std::unique_ptr<DriverSampleSet> copy() const override { return std::make_unique<ForeignSamples>(); }
};
class ForeignChannels final : public DriverSubscribedChannels {
 public:
  std::unique_ptr<DriverSubscribedChannels> copy() const override { return std::make_unique<ForeignChannels>(); }
};

TEST(StatsTreeLibrary, RefusesForeignOrMissingArguments) {
  TempDir dir;
  writeFile(dir.path() / "stats/G/c", "1");
  StatsTreeLibrary library((dir.path() / "stats").string());
  auto s = subscribe(library, "G", std::nullopt);
  ASSERT_NE(s.handle, nullptr);

  std::optional<DriverStatsError> error;
  EXPECT_EQ(library.createSamples(nullptr, *s.channels, &error), nullptr);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, EINVAL);

  error.reset();
  EXPECT_EQ(library.createSamples(s.handle, ForeignChannels(), &error), nullptr);
  EXPECT_TRUE(error);

  error.reset();
  auto samples = sample(library, s);
  ForeignSamples foreign;
  EXPECT_EQ(library.createSamplesDelta(&foreign, *samples, &error), nullptr);
  EXPECT_TRUE(error);
  EXPECT_TRUE(valuesOf(library, foreign).empty());
}

}  // namespace
}  // namespace vireo::linux_platform
