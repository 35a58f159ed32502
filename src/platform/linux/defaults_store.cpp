#include "platform/linux/defaults_store.h"

#include "platform/linux/key_file.h"

namespace vireo::linux_platform {

SuiteFileDefaultsStore::SuiteFileDefaultsStore(std::string configurationDirectory)
    : directory_(std::move(configurationDirectory)) {}

std::string SuiteFileDefaultsStore::suitePath(std::string_view suite) const {
  if (suite.empty() || suite.find('/') != std::string_view::npos || suite == "." || suite == "..") return {};
  return directory_ + "/" + std::string(suite) + ".conf";
}

std::optional<std::string> SuiteFileDefaultsStore::stringForKey(std::string_view suite, std::string_view key) {
  auto path = suitePath(suite);
  if (path.empty()) return std::nullopt;
  auto file = readKeyFile(path);  // a missing file is an empty suite
  if (!file) return std::nullopt;
  auto it = file->find(key);
  if (it == file->end()) return std::nullopt;
  return it->second;
}

bool SuiteFileDefaultsStore::boolForKey(std::string_view suite, std::string_view key) {
  auto text = stringForKey(suite, key);
  return text && parseBoolean(*text);
}

}  // namespace vireo::linux_platform
