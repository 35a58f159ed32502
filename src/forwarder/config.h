// forwarder.conf: where and how vireo-forwarder sends the store's rows.
#pragma once

#include <chrono>
#include <optional>
#include <string>

#include "platform/linux/key_file.h"

namespace vireo::forwarder {

struct ForwarderConfig {
  static constexpr const char* kFileName = "forwarder.conf";

  std::string url;       // ClickHouse's HTTP interface
  std::string user;      // empty: no authentication
  std::string password;  // the content of PasswordFile=, without its final newline
  std::string database = "vireo";
  long long batchRows = 5000;
  std::chrono::seconds interval{60};
  std::chrono::seconds keepForwarded{7 * 24 * 3600};  // 0: never prune
};

// Reads the keys of forwarder.conf; a relative PasswordFile= is taken from the
// configuration directory. Nothing, with the reason in error, for a value that is
// missing or invalid.
std::optional<ForwarderConfig> parseForwarderConfig(const linux_platform::KeyFile& keys,
                                                    const std::string& configurationDirectory, std::string* error);

}  // namespace vireo::forwarder
