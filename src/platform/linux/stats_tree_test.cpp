#include "platform/linux/stats_tree.h"
#include "fakes/temp_dir.h"

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

using testing::TempDir;

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
  const std::pair<const char*, std::optional<std::int64_t>> cases[] = {
      {"42\n", 42}, {"  -7 \r\n", -7}, {"9223372036854775807", INT64_MAX}, {"", std::nullopt},
      {" \n", std::nullopt}, {"12abc", std::nullopt}, {"1 2", std::nullopt}, {"0x10", std::nullopt},
      {"9223372036854775808", std::nullopt}};
  for (const auto& [text, value] : cases) EXPECT_EQ(parseStatsCounter(text), value) << text;
}

TEST(StatsTreeLibrary, SelectsByGroupSubgroupOrBoth) {
  TempDir dir;
  const fs::path stats = fs::path(dir.path()) / "stats";
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

  // An absent tree: an empty set and no error.
  StatsTreeLibrary absent((fs::path(dir.path()) / "none").string());
  std::optional<DriverStatsError> error;
  auto set = absent.copyChannelsInGroup("Speaker", std::nullopt, 0, &error);
  ASSERT_TRUE(set);
  EXPECT_EQ(absent.channelCount(*set), 0);
  EXPECT_FALSE(error);
}

// Sample sets and descriptions of another library.
struct ForeignSamples final : DriverSampleSet {
  std::unique_ptr<DriverSampleSet> copy() const override { return std::make_unique<ForeignSamples>(); }
};
struct ForeignChannels final : DriverSubscribedChannels {
  std::unique_ptr<DriverSubscribedChannels> copy() const override { return std::make_unique<ForeignChannels>(); }
};

TEST(StatsTreeLibrary, ReadsFilesAgainButKeepsTheChannelSetOfTheStart) {
  TempDir dir;
  const fs::path stats = fs::path(dir.path()) / "stats";
  const fs::path counters = fs::path(dir.path()) / "counters";
  writeFile(stats / "Speaker/a", "10\n");
  writeFile(stats / "Speaker/bad", "n/a\n");
  writeFile(stats / "Speaker/gone", "5\n");
  writeFile(stats / "Speaker/big", "-9223372036854775807");
  writeFile(counters / "real", "7\n");
  fs::create_symlink(counters / "real", stats / "Speaker/linked");
  fs::create_symlink(counters / "later", stats / "Speaker/pending");  // its counter does not exist yet
  writeFile(counters / "hw/x", "3\n");
  fs::create_symlink(counters / "hw", stats / "Speaker/hw");           // a symlinked subgroup
  StatsTreeLibrary library(stats.string());
  auto s = subscribe(library, "Speaker", std::nullopt);

  auto before = sample(library, s);
  EXPECT_THAT(valuesOf(library, *before),
              ElementsAre(Pair("a", 10), Pair("big", -INT64_MAX), Pair("gone", 5), Pair("x", 3), Pair("linked", 7)));

  writeFile(stats / "Speaker/a", "4\n");
  writeFile(stats / "Speaker/bad", "12\n");
  writeFile(stats / "Speaker/new", "1\n");  // not part of the set fixed at start
  fs::remove(stats / "Speaker/gone");
  writeFile(counters / "real", "9\n");
  writeFile(counters / "later", "2\n");
  writeFile(stats / "Speaker/big", "9223372036854775807");
  auto after = sample(library, s);
  EXPECT_THAT(valuesOf(library, *after), ElementsAre(Pair("a", 4), Pair("bad", 12), Pair("big", INT64_MAX), Pair("x", 3),
                                                     Pair("linked", 9), Pair("pending", 2)));

  // Deltas go per channel, saturate, and take a missing earlier value as zero.
  std::optional<DriverStatsError> error;
  auto delta = library.createSamplesDelta(before.get(), *after, &error);
  ASSERT_TRUE(delta);
  EXPECT_FALSE(error);
  EXPECT_THAT(valuesOf(library, *delta), ElementsAre(Pair("a", -6), Pair("bad", 12), Pair("big", INT64_MAX),
                                                     Pair("x", 0), Pair("linked", 2), Pair("pending", 2)));
  auto absolute = library.createSamplesDelta(nullptr, *after, &error);
  ASSERT_TRUE(absolute);
  EXPECT_FALSE(error);
  EXPECT_EQ(valuesOf(library, *absolute), valuesOf(library, *after));

  // Missing or foreign arguments are refused with an error, never a crash.
  EXPECT_EQ(library.createSamples(nullptr, *s.channels, &error), nullptr);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, EINVAL);
  error.reset();
  EXPECT_EQ(library.createSamples(s.handle, ForeignChannels(), &error), nullptr);
  EXPECT_TRUE(error);
  error.reset();
  ForeignSamples foreign;
  EXPECT_EQ(library.createSamplesDelta(&foreign, *after, &error), nullptr);
  EXPECT_TRUE(error);
  EXPECT_TRUE(valuesOf(library, foreign).empty());
}

}  // namespace
}  // namespace vireo::linux_platform
