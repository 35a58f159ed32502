#include "platform/linux/device_properties.h"

#include <limits>

#include "platform/linux/key_file.h"

namespace vireo::linux_platform {

DevicePropertiesFile::DevicePropertiesFile(std::string configurationDirectory)
    : path_(std::move(configurationDirectory) + "/device.conf") {}

std::optional<std::string> DevicePropertiesFile::value(std::string_view key) const {
  auto file = readKeyFile(path_);
  if (!file) return std::nullopt;
  auto it = file->find(key);
  if (it == file->end()) return std::nullopt;
  return it->second;
}

std::optional<bool> DevicePropertiesFile::boolAnswer(std::string_view key) {
  auto text = value(key);
  if (!text) return std::nullopt;
  return parseBoolean(*text);
}

std::optional<std::int32_t> DevicePropertiesFile::intAnswer(std::string_view key) {
  auto text = value(key);
  if (!text) return std::nullopt;
  auto number = parseInteger(*text);
  if (!number || *number < std::numeric_limits<std::int32_t>::min() ||
      *number > std::numeric_limits<std::int32_t>::max()) {
    return std::nullopt;
  }
  return static_cast<std::int32_t>(*number);
}

}  // namespace vireo::linux_platform
