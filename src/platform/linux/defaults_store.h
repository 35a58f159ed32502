// The defaults suites: suite S is the key file "S.conf" in the configuration directory.
#pragma once

#include <string>

#include "platform/defaults.h"

namespace vireo::linux_platform {

class SuiteFileDefaultsStore : public DefaultsStore {
 public:
  explicit SuiteFileDefaultsStore(std::string configurationDirectory);

  // Read on every call, so an edit is seen at the next change notification.
  std::optional<std::string> stringForKey(std::string_view suite, std::string_view key) override;
  bool boolForKey(std::string_view suite, std::string_view key) override;

  // The file that holds suite; empty for a name that is not a plain file name.
  std::string suitePath(std::string_view suite) const;

 private:
  const std::string directory_;
};

}  // namespace vireo::linux_platform
