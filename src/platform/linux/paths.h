// The service directories: the systemd variables when set (first path of a
// colon-separated list), otherwise the root or the user fallbacks.
#pragma once

#include <string>

namespace vireo::linux_platform {

struct ServiceDirectories {
  std::string configuration;  // defaults suite, device.conf, telemetry.conf, analytics.conf
  std::string state;          // vireo.db
  std::string logs;           // Audio/Reporting/*.json
  std::string runtime;        // stats/

  static ServiceDirectories fromEnvironment();
};

}  // namespace vireo::linux_platform
