// Device properties from device.conf in the configuration directory.
#pragma once

#include <string>

#include "platform/device.h"

namespace vireo::linux_platform {

class DevicePropertiesFile : public DeviceProperties {
 public:
  explicit DevicePropertiesFile(std::string configurationDirectory);

  // Read on every call: the file is small and an integrator may edit it at any time.
  // Nothing when the file or the key is absent (or an integer does not parse), so
  // that the caller applies its default.
  std::optional<bool> boolAnswer(std::string_view key) override;
  std::optional<std::int32_t> intAnswer(std::string_view key) override;

 private:
  std::optional<std::string> value(std::string_view key) const;

  const std::string path_;
};

}  // namespace vireo::linux_platform
