// The key=value files of the configuration directory: the defaults suite,
// device.conf, telemetry.conf and analytics.conf.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace vireo::linux_platform {

using KeyFile = std::map<std::string, std::string, std::less<>>;

// Parses "key=value" lines; '#' starts a comment line; blanks around keys and values
// are dropped; a later line wins. Lines without '=' are ignored.
KeyFile parseKeyFile(std::string_view text);
// Nothing when the file cannot be read (missing included).
std::optional<KeyFile> readKeyFile(const std::string& path);
// Writes the file atomically (temporary file, fsync, rename), keeping other lines.
bool writeKeyFile(const std::string& path, const KeyFile& entries, std::string* error);

// 1 yes true on are true; everything else is false. Case-insensitive.
bool parseBoolean(std::string_view text);
std::optional<long long> parseInteger(std::string_view text);
// Splits a comma-separated list, trimming blanks and dropping empty items.
std::vector<std::string> splitList(std::string_view text);

}  // namespace vireo::linux_platform
