// The driver-statistics tree: the input lays out a small tree (groups, subgroups, counter
// files, symlinks live and dangling, dot files, entries too deep or too shallow) with
// arbitrary counter text; the library scans it, samples it twice (counters rewritten in
// between) and takes deltas. The scan must find channels only where the layout puts them,
// each sample must hold what parseStatsCounter makes of the file, and deltas must be the
// saturated differences.
#include <fuzzer/FuzzedDataProvider.h>
#include <unistd.h>

#include <climits>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "fuzz_support.h"
#include "platform/linux/stats_tree.h"

namespace vireo::fuzz {
namespace {

namespace fs = std::filesystem;
using namespace vireo::linux_platform;

// Names: a few fixed ones so that entries collide and nest, or arbitrary bytes made
// into a valid file name.
std::string name(FuzzedDataProvider& in) {
  static const char* const kNames[] = {"a", "b", "mic", ".hidden", "x y", "0"};
  if (in.ConsumeBool()) return kNames[in.ConsumeIntegralInRange<std::size_t>(0, std::size(kNames) - 1)];
  std::string s = in.ConsumeRandomLengthString(12);
  for (char& c : s)
    if (c == '/' || c == '\0') c = '_';
  if (s.empty() || s == "." || s == "..") s = "n";
  return s;
}

void layOut(FuzzedDataProvider& in, const fs::path& root) {
  std::error_code ec;
  const int entries = in.ConsumeIntegralInRange<int>(0, 10);
  for (int i = 0; i < entries; ++i) {
    const int kind = in.ConsumeIntegralInRange<int>(0, 6);
    fs::path at = root / name(in);
    if (kind != 4) at /= name(in);               // 4: a file at the top, not a channel
    if (kind == 1 || kind == 5) at /= name(in);  // in a subgroup
    if (kind == 5) at /= name(in);               // below a subgroup: too deep to be a channel
    fs::create_directories(at.parent_path(), ec);
    switch (kind) {
      case 2:  // dangling symlink: a counter that is not there yet
        fs::create_symlink(root / "missing" / name(in), at, ec);
        break;
      case 3:  // symlink to wherever the input says, inside the tree
        fs::create_symlink(root / name(in) / name(in), at, ec);
        break;
      case 6:
        fs::create_directories(at, ec);
        break;
      default:
        writeFile(at.string(), in.ConsumeRandomLengthString(160));
        break;
    }
  }
}

// What the library should find in a file, read independently of it.
std::optional<std::int64_t> expectedCounter(const StatsTreeChannel& channel) {
  std::error_code ec;
  if (!fs::is_regular_file(channel.path, ec)) return std::nullopt;
  std::string text = readFile(channel.path);
  if (text.size() > 128) return std::nullopt;
  return parseStatsCounter(text);
}

using Samples = std::vector<std::pair<std::string, std::int64_t>>;

Samples collect(StatsTreeLibrary& library, const DriverSampleSet& set) {
  Samples out;
  library.iterate(set, [&](const DriverChannel& channel) {
    auto channelName = library.channelName(channel);
    FUZZ_CHECK(channelName.has_value());
    out.emplace_back(*channelName, library.simpleIntegerValue(channel));
    return DriverIterate::Continue;
  });
  return out;
}

// What each channel's file holds, less the earlier values (a channel missing from them
// starts at 0), saturated.
Samples expectedSamples(const std::vector<StatsTreeChannel>& channels,
                        const std::vector<std::optional<std::int64_t>>& earlier = {}) {
  Samples out;
  for (std::size_t i = 0; i < channels.size(); ++i) {
    const std::int64_t before = i < earlier.size() ? earlier[i].value_or(0) : 0;
    const auto later = expectedCounter(channels[i]);
    std::int64_t d = 0;
    if (!later) continue;
    if (__builtin_sub_overflow(*later, before, &d)) d = before < 0 ? INT64_MAX : INT64_MIN;
    out.emplace_back(channels[i].name, d);
  }
  return out;
}

void checkScan(const StatsTreeLibrary& library, const fs::path& root) {
  const auto& channels = library.channels();
  for (std::size_t i = 0; i < channels.size(); ++i) {
    const StatsTreeChannel& c = channels[i];
    if (i > 0) FUZZ_CHECK(channels[i - 1].relativePath < c.relativePath);
    FUZZ_CHECK(!c.group.empty() && c.group.front() != '.');
    FUZZ_CHECK(!c.name.empty() && c.name.front() != '.');
    const std::string expected = c.group + "/" + (c.subGroup ? *c.subGroup + "/" : "") + c.name;
    FUZZ_CHECK(c.relativePath == expected);
    FUZZ_CHECK(fs::path(c.path) == root / c.relativePath);
    if (c.subGroup) FUZZ_CHECK(!c.subGroup->empty() && c.subGroup->front() != '.');
  }
}

}  // namespace
}  // namespace vireo::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace vireo;
  using namespace vireo::fuzz;
  FuzzedDataProvider in(data, size);
  const fs::path root = fs::path(scratchDirectory()) / "stats";
  std::error_code ec;
  fs::remove_all(root, ec);
  fs::create_directory(root, ec);
  layOut(in, root);

  StatsTreeLibrary library(root.string());
  checkScan(library, root);
  const auto& channels = library.channels();
  if (tracing())
    for (const StatsTreeChannel& c : channels) std::fprintf(stderr, "channel %s\n", c.relativePath.c_str());

  std::optional<DriverStatsError> error;
  auto all = library.copyChannelsInGroup(std::nullopt, std::nullopt, 0, &error);
  FUZZ_CHECK(all && library.channelCount(*all) == static_cast<std::int32_t>(channels.size()));
  if (!channels.empty()) {
    const StatsTreeChannel& pick = channels[in.ConsumeIntegralInRange<std::size_t>(0, channels.size() - 1)];
    auto group = library.copyChannelsInGroup(pick.group, pick.subGroup, 0, &error);
    std::int32_t inGroup = 0;
    // No subgroup selects the whole group, subgroups included.
    for (const StatsTreeChannel& c : channels)
      inGroup += c.group == pick.group && (!pick.subGroup || c.subGroup == pick.subGroup);
    FUZZ_CHECK(group && library.channelCount(*group) == inGroup);
  }

  std::unique_ptr<DriverSubscribedChannels> subscribed;
  DriverSubscriptionHandle subscription = library.createSubscription(*all, &subscribed);
  FUZZ_CHECK(subscription && subscribed);
  auto first = library.createSamples(subscription, *subscribed, &error);
  FUZZ_CHECK(first);
  const auto firstValues = collect(library, *first);
  FUZZ_CHECK(firstValues == expectedSamples(channels));

  std::vector<std::optional<std::int64_t>> before;
  for (const StatsTreeChannel& c : channels) before.push_back(expectedCounter(c));

  // Counters move (or turn into garbage) between two samples.
  for (const StatsTreeChannel& c : channels)
    if (in.ConsumeBool()) writeFile(c.path, in.ConsumeRandomLengthString(40));
  auto copied = subscribed->copy();
  auto second = library.createSamples(subscription, *copied, &error);
  FUZZ_CHECK(second);
  const auto secondValues = collect(library, *second);
  FUZZ_CHECK(secondValues == expectedSamples(channels));

  auto fromNothing = library.createSamplesDelta(nullptr, *second, &error);
  FUZZ_CHECK(fromNothing && collect(library, *fromNothing) == secondValues);
  auto none = library.createSamplesDelta(second.get(), *second->copy(), &error);
  FUZZ_CHECK(none);
  for (const auto& [channelName, value] : collect(library, *none)) FUZZ_CHECK(value == 0);

  // The delta pairs samples by path.
  auto delta = library.createSamplesDelta(first.get(), *second, &error);
  const Samples expectedDelta = expectedSamples(channels, before);
  FUZZ_CHECK(delta && collect(library, *delta) == expectedDelta);
  if (tracing())
    for (const auto& [channelName, value] : expectedDelta)
      std::fprintf(stderr, "delta %s %lld\n", channelName.c_str(), static_cast<long long>(value));
  fs::remove_all(root, ec);
  return 0;
}
