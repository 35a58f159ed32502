#include "platform/linux/stats_tree.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <filesystem>
#include <system_error>
#include <utility>

namespace vireo::linux_platform {

namespace fs = std::filesystem;

namespace {

using ChannelList = std::vector<StatsTreeChannel>;

class TreeChannelSet final : public DriverChannelSet {
 public:
  explicit TreeChannelSet(ChannelList c) : channels(std::move(c)) {}
  const ChannelList channels;
};

// Shared: copies of the description all name the same fixed channel list.
class TreeSubscribedChannels final : public DriverSubscribedChannels {
 public:
  explicit TreeSubscribedChannels(std::shared_ptr<const ChannelList> c) : channels(std::move(c)) {}
  std::unique_ptr<DriverSubscribedChannels> copy() const override {
    return std::make_unique<TreeSubscribedChannels>(channels);
  }
  const std::shared_ptr<const ChannelList> channels;
};

struct TreeSample {
  std::string relativePath;
  std::string name;
  std::int64_t value = 0;
};

// Samples sorted by relative path, so deltas can walk two sets side by side and
// iteration order does not depend on the file system.
class TreeSampleSet final : public DriverSampleSet {
 public:
  std::unique_ptr<DriverSampleSet> copy() const override { return std::make_unique<TreeSampleSet>(*this); }
  std::vector<TreeSample> samples;
};

class TreeChannelView final : public DriverChannel {
 public:
  explicit TreeChannelView(const TreeSample& s) : sample(s) {}
  const TreeSample& sample;
};

void setError(std::optional<DriverStatsError>* error, int code) {
  if (error) *error = DriverStatsError{code};
}

bool isBlank(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r' || c == '\v' || c == '\f'; }

// Counter files are tiny; anything longer than this is not a counter.
constexpr std::size_t kMaxCounterFile = 128;

std::optional<std::int64_t> readCounter(const std::string& path) {
  // Non-blocking, and regular files only: a symlink swapped for a FIFO must not stall sampling.
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
  if (fd < 0) return std::nullopt;
  struct stat st {};
  if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
    ::close(fd);
    return std::nullopt;
  }
  char buffer[kMaxCounterFile + 1];
  std::size_t length = 0;
  while (length < sizeof buffer) {
    ssize_t n = ::read(fd, buffer + length, sizeof buffer - length);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      ::close(fd);
      return std::nullopt;
    }
    if (n == 0) break;
    length += static_cast<std::size_t>(n);
  }
  ::close(fd);
  if (length > kMaxCounterFile) return std::nullopt;
  return parseStatsCounter(std::string_view(buffer, length));
}

// A channel is a regular file, or a symlink whose counter is not there yet (the
// device may appear later; until then the channel is skipped at each sample).
enum class EntryKind { Channel, Directory, Other };

EntryKind kindOf(const fs::path& path) {
  std::error_code ec;
  fs::file_status st = fs::status(path, ec);
  if (!ec) {
    if (fs::is_directory(st)) return EntryKind::Directory;
    if (fs::is_regular_file(st)) return EntryKind::Channel;
    return EntryKind::Other;
  }
  std::error_code linkEc;
  if (fs::is_symlink(fs::symlink_status(path, linkEc)) && !linkEc) return EntryKind::Channel;
  return EntryKind::Other;
}

// Names in a directory, without dot files (editors' and atomic writers' temporaries).
// Returns the errno of a failed listing, 0 otherwise.
int listDirectory(const fs::path& directory, std::vector<std::string>* names) {
  std::error_code ec;
  fs::directory_iterator it(directory, ec);
  if (ec) return ec.value();
  for (; it != fs::directory_iterator(); it.increment(ec)) {
    std::string name = it->path().filename().string();
    if (!name.empty() && name.front() != '.') names->push_back(std::move(name));
  }
  return ec ? ec.value() : 0;
}

}  // namespace

std::optional<std::int64_t> parseStatsCounter(std::string_view text) {
  while (!text.empty() && isBlank(text.front())) text.remove_prefix(1);
  while (!text.empty() && isBlank(text.back())) text.remove_suffix(1);
  if (text.empty()) return std::nullopt;
  std::int64_t value = 0;
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (ec != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return value;
}

struct StatsTreeLibrary::Subscription {
  std::size_t channelCount = 0;
};

StatsTreeLibrary::StatsTreeLibrary(std::string statsDirectory) : directory_(std::move(statsDirectory)) {
  const fs::path root(directory_);
  std::error_code ec;
  fs::file_status rootStatus = fs::status(root, ec);
  // An absent tree is a device without driver statistics, not a failure.
  if (ec || !fs::exists(rootStatus)) {
    if (ec && ec != std::errc::no_such_file_or_directory) scanError_ = ec.value();
    return;
  }
  if (!fs::is_directory(rootStatus)) {
    scanError_ = ENOTDIR;
    return;
  }
  auto noteError = [this](int error) {
    if (error != 0 && scanError_ == 0) scanError_ = error;
  };
  auto addChannel = [this](const fs::path& path, std::string relative, const std::string& group,
                           std::optional<std::string> subGroup, std::string name) {
    channels_.push_back(StatsTreeChannel{std::move(relative), group, std::move(subGroup), std::move(name),
                                         path.string()});
  };

  std::vector<std::string> groups;
  noteError(listDirectory(root, &groups));
  for (const std::string& group : groups) {
    const fs::path groupPath = root / group;
    if (kindOf(groupPath) != EntryKind::Directory) continue;
    std::vector<std::string> entries;
    noteError(listDirectory(groupPath, &entries));
    for (const std::string& entry : entries) {
      const fs::path entryPath = groupPath / entry;
      switch (kindOf(entryPath)) {
        case EntryKind::Channel:
          addChannel(entryPath, group + "/" + entry, group, std::nullopt, entry);
          break;
        case EntryKind::Directory: {
          std::vector<std::string> names;
          noteError(listDirectory(entryPath, &names));
          for (const std::string& name : names) {
            const fs::path channelPath = entryPath / name;
            if (kindOf(channelPath) == EntryKind::Channel)
              addChannel(channelPath, group + "/" + entry + "/" + name, group, entry, name);
          }
          break;
        }
        case EntryKind::Other:
          break;
      }
    }
  }
  std::sort(channels_.begin(), channels_.end(),
            [](const StatsTreeChannel& a, const StatsTreeChannel& b) { return a.relativePath < b.relativePath; });
}

StatsTreeLibrary::~StatsTreeLibrary() = default;

std::unique_ptr<DriverChannelSet> StatsTreeLibrary::copyChannelsInGroup(const std::optional<std::string>& group,
                                                                        const std::optional<std::string>& subGroup,
                                                                        std::uint64_t /*options*/,
                                                                        std::optional<DriverStatsError>* error) {
  ChannelList selected;
  for (const StatsTreeChannel& channel : channels_) {
    if (group && channel.group != *group) continue;
    if (subGroup && channel.subGroup != *subGroup) continue;
    selected.push_back(channel);
  }
  if (scanError_ != 0) setError(error, scanError_);
  return std::make_unique<TreeChannelSet>(std::move(selected));
}

std::int32_t StatsTreeLibrary::channelCount(const DriverChannelSet& channels) {
  const auto* set = dynamic_cast<const TreeChannelSet*>(&channels);
  if (!set) return 0;
  return static_cast<std::int32_t>(std::min<std::size_t>(set->channels.size(), INT32_MAX));
}

DriverSubscriptionHandle StatsTreeLibrary::createSubscription(const DriverChannelSet& channels,
                                                              std::unique_ptr<DriverSubscribedChannels>* subscribed) {
  const auto* set = dynamic_cast<const TreeChannelSet*>(&channels);
  if (!set) {
    if (subscribed) subscribed->reset();
    return nullptr;
  }
  if (subscribed)
    *subscribed = std::make_unique<TreeSubscribedChannels>(std::make_shared<const ChannelList>(set->channels));
  auto subscription = std::make_unique<Subscription>();
  subscription->channelCount = set->channels.size();
  MutexLock lock(subscriptionsLock_);
  subscriptions_.push_back(std::move(subscription));
  return subscriptions_.back().get();
}

std::unique_ptr<DriverSampleSet> StatsTreeLibrary::createSamples(DriverSubscriptionHandle subscription,
                                                                 const DriverSubscribedChannels& subscribed,
                                                                 std::optional<DriverStatsError>* error) {
  const auto* channels = dynamic_cast<const TreeSubscribedChannels*>(&subscribed);
  if (!subscription || !channels || !channels->channels) {
    setError(error, EINVAL);
    return nullptr;
  }
  auto samples = std::make_unique<TreeSampleSet>();
  samples->samples.reserve(channels->channels->size());
  for (const StatsTreeChannel& channel : *channels->channels) {
    if (auto value = readCounter(channel.path))
      samples->samples.push_back(TreeSample{channel.relativePath, channel.name, *value});
  }
  return samples;
}

std::unique_ptr<DriverSampleSet> StatsTreeLibrary::createSamplesDelta(const DriverSampleSet* earlier,
                                                                      const DriverSampleSet& later,
                                                                      std::optional<DriverStatsError>* error) {
  const auto* after = dynamic_cast<const TreeSampleSet*>(&later);
  const auto* before = earlier ? dynamic_cast<const TreeSampleSet*>(earlier) : nullptr;
  if (!after || (earlier && !before)) {
    setError(error, EINVAL);
    return nullptr;
  }
  auto delta = std::make_unique<TreeSampleSet>();
  delta->samples.reserve(after->samples.size());
  static const std::vector<TreeSample> kNoSamples;
  const std::vector<TreeSample>& base = before ? before->samples : kNoSamples;
  auto from = base.begin();
  const auto fromEnd = base.end();
  for (const TreeSample& sample : after->samples) {
    while (from != fromEnd && from->relativePath < sample.relativePath) ++from;
    std::int64_t start = (from != fromEnd && from->relativePath == sample.relativePath) ? from->value : 0;
    std::int64_t difference = 0;
    // Counters near the int64 limits must not overflow; saturate instead.
    if (__builtin_sub_overflow(sample.value, start, &difference)) difference = start < 0 ? INT64_MAX : INT64_MIN;
    delta->samples.push_back(TreeSample{sample.relativePath, sample.name, difference});
  }
  return delta;
}

void StatsTreeLibrary::iterate(const DriverSampleSet& samples,
                               const std::function<DriverIterate(const DriverChannel&)>& visitor) {
  const auto* set = dynamic_cast<const TreeSampleSet*>(&samples);
  if (!set) return;
  for (const TreeSample& sample : set->samples) {
    if (visitor(TreeChannelView(sample)) == DriverIterate::Stop) break;
  }
}

std::optional<std::string> StatsTreeLibrary::channelName(const DriverChannel& channel) {
  const auto* view = dynamic_cast<const TreeChannelView*>(&channel);
  if (!view) return std::nullopt;
  return view->sample.name;
}

std::int64_t StatsTreeLibrary::simpleIntegerValue(const DriverChannel& channel) {
  const auto* view = dynamic_cast<const TreeChannelView*>(&channel);
  return view ? view->sample.value : 0;
}

}  // namespace vireo::linux_platform
