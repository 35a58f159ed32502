#include "platform/linux/limits_file.h"

#include <array>
#include <utility>

#include "platform/linux/key_file.h"

namespace vireo::linux_platform {

ServiceLimits readLimitsFile(const std::string& path, std::vector<std::string>* problems) {
  ServiceLimits limits;
  const std::array<std::pair<const char*, std::size_t*>, 8> keys{{
      {"MaxPayloadBytes", &limits.maxPayloadBytes},
      {"MaxPayloadEntries", &limits.maxPayloadEntries},
      {"MaxReporterIDsPerCall", &limits.maxReporterIDsPerCall},
      {"MaxSessionsPerClient", &limits.maxSessionsPerClient},
      {"MaxClients", &limits.maxClients},
      {"MaxHeldStartsPerClient", &limits.maxHeldStartsPerClient},
      {"MaxKeptBytesPerSession", &limits.maxKeptBytesPerSession},
      {"MaxQueuedRows", &limits.maxQueuedRows},
  }};
  auto file = readKeyFile(path);
  if (!file) return limits;
  for (const auto& [key, text] : *file) {
    std::size_t* field = nullptr;
    for (const auto& [name, target] : keys)
      if (key == name) field = target;
    if (!field) {
      if (problems) problems->push_back("unknown key " + key);
      continue;
    }
    auto number = parseInteger(text);
    if (!number || *number < 1) {
      if (problems) problems->push_back(key + "=" + text + " is not a positive whole number; keeping " +
                                        std::to_string(*field));
      continue;
    }
    *field = static_cast<std::size_t>(*number);
  }
  return limits;
}

}  // namespace vireo::linux_platform
