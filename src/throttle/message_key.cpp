// What counts as "the same message" for the throttle, and how long to hold one.
#include <algorithm>
#include <array>
#include <cfloat>
#include <cmath>
#include <limits>
#include <utility>

#include "throttle/block_throttle.h"
#include "vocabulary/reporting_utility.h"

namespace vireo {

namespace {

constexpr std::string_view kBlacklistKey = "_comparison_field_blacklist";
constexpr std::string_view kThrottleSecondsKey = "_throttle_seconds";
constexpr double kDefaultSleepTime = 0.5;
constexpr double kMaxSleepTime = 5.0;  // as logged; the check is on whole seconds
constexpr std::int64_t kMaxWholeSeconds = 4;

// Constant-initialised, so it exists before main and before any other static
// initialiser could ask for a key.
constexpr std::array<std::string_view, 5> kDefaultExcludedFields = {
    "systemuptime_sec", "processuptime_ms", "vrreporting_timestamp", kBlacklistKey, kThrottleSecondsKey};

// The text of a value inside a key. Like Value::text(), except that dictionaries
// list their entries sorted by the text of their keys, so two dictionaries holding
// the same entries in a different order give the same text. Doubles are the
// shortest form that reads back to the same value (0.5, 12 for 12.0).
void appendKeyText(std::string& out, const Value& v, bool nested) {
  if (const Array* array = v.asArray()) {
    out += '[';
    for (std::size_t i = 0; i < array->size(); ++i) {
      if (i) out += ", ";
      appendKeyText(out, (*array)[i], true);
    }
    out += ']';
  } else if (const Dictionary* dict = v.asDictionary()) {
    std::vector<std::pair<std::string, std::string>> entries;
    entries.reserve(dict->size());
    for (const auto& [k, value] : *dict) {
      auto& e = entries.emplace_back();
      appendKeyText(e.first, k, true);
      appendKeyText(e.second, value, true);
    }
    // Keys of different kinds may share a text (1 and 1u): the value decides then.
    std::sort(entries.begin(), entries.end());
    out += '{';
    for (std::size_t i = 0; i < entries.size(); ++i) {
      if (i) out += ", ";
      out += entries[i].first;
      out += ": ";
      out += entries[i].second;
    }
    out += '}';
  } else {
    v.appendText(out, nested);
  }
}

}  // namespace

std::span<const std::string_view> VRReportingBlockThrottle::defaultExcludedFields() { return kDefaultExcludedFields; }

std::string VRReportingBlockThrottle::buildMessageKey(const Dictionary& message, std::int64_t reporterID,
                                                      std::uint32_t category, std::uint32_t type) {
  // The client's own exclusions count only when they come as an array. String
  // names are sorted for lookup; other kinds can only match keys of their kind.
  std::vector<std::string_view> excludedNames(kDefaultExcludedFields.begin(), kDefaultExcludedFields.end());
  std::vector<const Value*> excludedOthers;
  const Value* volume = nullptr;
  const Value* volumeOperationTime = nullptr;
  for (const auto& [k, v] : message) {
    const std::string* name = k.asString();
    if (!name) continue;
    if (*name == kBlacklistKey) {
      if (const Array* blacklist = v.asArray()) {
        for (const Value& field : *blacklist) {
          if (const std::string* s = field.asString())
            excludedNames.push_back(*s);
          else
            excludedOthers.push_back(&field);
        }
      }
    } else if (*name == "Volume" && !v.isAbsent()) {
      volume = &v;
    } else if (*name == "VolumeOperationTime" && !v.isAbsent()) {
      volumeOperationTime = &v;
    }
  }
  // With its operation time, a volume report is compared by its keys only, so
  // successive level changes collapse into one delivery.
  if (volume && volumeOperationTime) {
    excludedNames.push_back("Volume");
    excludedNames.push_back("VolumeOperationTime");
  }
  std::sort(excludedNames.begin(), excludedNames.end());

  // Keys sorted by their text, byte by byte ("Route" < "Volume" < "_throttle_seconds").
  struct Field {
    std::string_view name;
    const Value* key;
    const Value* value;
  };
  // Texts of keys that are not strings. Reserved up front: fields point into it.
  std::vector<std::string> nonStringNames;
  nonStringNames.reserve(message.size());
  std::vector<Field> fields;
  fields.reserve(message.size());
  for (const auto& [k, v] : message) {
    if (const std::string* s = k.asString()) {
      fields.push_back({*s, &k, &v});
    } else {
      fields.push_back({nonStringNames.emplace_back(k.text()), &k, &v});
    }
  }
  // 5 and "5" share a text; their kind breaks the tie so that order never depends
  // on insertion order.
  std::sort(fields.begin(), fields.end(), [](const Field& a, const Field& b) {
    return a.name != b.name ? a.name < b.name : a.key->kind() < b.key->kind();
  });

  std::string key;
  key.reserve(64 + 24 * fields.size());
  for (const Field& f : fields) {
    bool excluded = f.key->asString() ? std::binary_search(excludedNames.begin(), excludedNames.end(), f.name)
                                      : std::any_of(excludedOthers.begin(), excludedOthers.end(),
                                                    [&](const Value* other) { return *other == *f.key; });
    key += f.name;
    key += '|';
    if (excluded)
      key += '^';
    else
      appendKeyText(key, *f.value, false);
    key += '|';
  }
  key += "reporterID|";
  key += std::to_string(static_cast<long long>(reporterID));
  key += '|';
  key += VRReportingCategoryName(category);
  key += '|';
  key += VRReportingTypeName(type);
  return key;
}

double VRReportingBlockThrottle::determineSleepTime(const Dictionary& message, Logger& logger) {
  static constexpr const char* kLabel = "+[VRReportingBlockThrottle determineSleepTime:]";
  const Value* time = message.find(kThrottleSecondsKey);
  if (!time || time->isAbsent()) return kDefaultSleepTime;
  if (!time->isNumber()) {
    VR_LOG(logger, LogScope::DefaultLog, LogLevel::Info, kLabel,
           "Rejecting non Numeral value of throttle time. {time=%s}", time->text().c_str());
    return kDefaultSleepTime;
  }
  // The bound applies to the whole-number part, so 4.99 passes and 5.0 does not.
  if (*time->toInt64() > kMaxWholeSeconds) {
    VR_LOG(logger, LogScope::DefaultLog, LogLevel::Info, kLabel,
           "Rejecting large throttle time. {time=%s, max=%f}", time->text().c_str(), kMaxSleepTime);
    return kDefaultSleepTime;
  }
  // Held in single precision on purpose: 2.3 becomes 2.2999999523162842. Values
  // below the float range become -inf (there is no lower bound; they fire at once).
  double seconds = *time->toDouble();
  if (seconds < -static_cast<double>(FLT_MAX)) return -std::numeric_limits<double>::infinity();
  return static_cast<double>(static_cast<float>(seconds));
}

}  // namespace vireo
