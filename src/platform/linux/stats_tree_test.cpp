#include "platform/linux/stats_tree.h"
#include "fakes/temp_dir.h"

#include <cerrno>
#include <filesystem>
#include <utility>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace vireo::linux_platform {
namespace {

namespace fs = std::filesystem;
using ::testing::ElementsAre;
using ::testing::Pair;

using testing::TempDir;

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

// A group selects its subgroups too; a subgroup alone selects it in every group, in
// path order. Not channels: files below a subgroup, a writer's dot-file temporaries,
// files without a group.
TEST(StatsTreeLibrary, SelectsByGroupSubgroupOrBoth) {
  TempDir dir;
  for (const char* path : {"Orvane/rx", "Orvane/dsp/tx", "A/MCA/drops", "B/MCA/drops", "A/MCA/deeper/z",
                           "Haptics/.on.tmp", "toplevel"})
    dir.write(std::string("stats/") + path, path[0] == 'B' ? "5" : "4");
  StatsTreeLibrary library(dir.sub("stats"));
  auto count = [&](std::optional<std::string> group) {
    std::optional<DriverStatsError> error;
    return library.channelCount(*library.copyChannelsInGroup(group, std::nullopt, 0, &error));
  };
  EXPECT_EQ(count(std::nullopt), 4);
  EXPECT_EQ(count("Orvane"), 2);
  auto mca = subscribe(library, std::nullopt, "MCA");
  EXPECT_THAT(valuesOf(library, *sample(library, mca)), ElementsAre(Pair("drops", 4), Pair("drops", 5)));

  // An absent tree: an empty set and no error.
  StatsTreeLibrary absent(dir.sub("none"));
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
  const fs::path stats = fs::path(dir.path()) / "stats", counters = fs::path(dir.path()) / "counters";
  for (auto [path, text] : {std::pair{"stats/Speaker/a", "10\n"}, {"stats/Speaker/bad", "n/a\n"},
                            {"stats/Speaker/gone", "5\n"}, {"stats/Speaker/big", "-9223372036854775807"},
                            {"counters/real", "7\n"}, {"counters/hw/x", "3\n"}})
    dir.write(path, text);
  fs::create_symlink(counters / "real", stats / "Speaker/linked");
  fs::create_symlink(counters / "later", stats / "Speaker/pending");  // its counter does not exist yet
  fs::create_symlink(counters / "hw", stats / "Speaker/hw");           // a symlinked subgroup
  StatsTreeLibrary library(stats.string());
  auto s = subscribe(library, "Speaker", std::nullopt);

  auto before = sample(library, s);
  EXPECT_THAT(valuesOf(library, *before),
              ElementsAre(Pair("a", 10), Pair("big", -INT64_MAX), Pair("gone", 5), Pair("x", 3), Pair("linked", 7)));

  // "new" is not part of the set fixed at the start.
  for (auto [path, text] : {std::pair{"stats/Speaker/a", "4\n"}, {"stats/Speaker/bad", "12\n"},
                            {"stats/Speaker/new", "1\n"}, {"counters/real", "9\n"}, {"counters/later", "2\n"},
                            {"stats/Speaker/big", "9223372036854775807"}})
    dir.write(path, text);
  fs::remove(stats / "Speaker/gone");
  auto after = sample(library, s);
  EXPECT_THAT(valuesOf(library, *after), ElementsAre(Pair("a", 4), Pair("bad", 12), Pair("big", INT64_MAX), Pair("x", 3),
                                                     Pair("linked", 9), Pair("pending", 2)));

  // Deltas (per channel, saturated, a missing earlier value taken as zero) are the fuzz
  // target's property. Missing or foreign arguments are refused with an error, never a crash.
  std::optional<DriverStatsError> error;
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
