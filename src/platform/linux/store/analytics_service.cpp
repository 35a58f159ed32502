#include "platform/linux/store/analytics_service.h"

#include <fnmatch.h>

#include <utility>

#include "platform/linux/key_file.h"

namespace vireo::linux_platform {

LocalAnalyticsService::LocalAnalyticsService(std::shared_ptr<LocalStore> store, std::string configurationDirectory)
    : store_(std::move(store)), configurationDirectory_(std::move(configurationDirectory)) {
  reload();
}

void LocalAnalyticsService::reload() {
  std::vector<std::string> patterns;
  if (auto file = readKeyFile(configurationDirectory_ + "/analytics.conf")) {
    if (auto it = file->find("Exclude"); it != file->end()) patterns = splitList(it->second);
  }
  MutexLock lock(mutex_);
  exclude_ = std::move(patterns);
}

bool LocalAnalyticsService::wants(std::string_view name) const {
  const std::string text(name);
  MutexLock lock(mutex_);
  for (const auto& pattern : exclude_) {
    if (::fnmatch(pattern.c_str(), text.c_str(), 0) == 0) return false;
  }
  return true;
}

void LocalAnalyticsService::sendEventLazy(std::string_view name, const std::function<Dictionary()>& payload) {
  if (!payload || !wants(name)) return;
  store_->insertAnalyticsEvent(name, payload(), store_->now());
}

}  // namespace vireo::linux_platform
