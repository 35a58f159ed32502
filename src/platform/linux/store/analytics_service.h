// The analytics event service over the local store: analytics_events rows,
// except for the events that analytics.conf excludes.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "base/mutex.h"
#include "platform/event_sinks.h"
#include "platform/linux/store/store.h"

namespace vireo::linux_platform {

class LocalAnalyticsService : public AnalyticsService {
 public:
  // configurationDirectory holds analytics.conf, read here once.
  LocalAnalyticsService(std::shared_ptr<LocalStore> store, std::string configurationDirectory);

  void sendEventLazy(std::string_view name, const std::function<Dictionary()>& payload) override;

  // Re-reads Exclude= (comma-separated shell patterns).
  void reload();
  bool wants(std::string_view name) const;

 private:
  const std::shared_ptr<LocalStore> store_;
  const std::string configurationDirectory_;
  mutable Mutex mutex_;  // guards exclude_
  std::vector<std::string> exclude_ VIREO_GUARDED_BY(mutex_);
};

}  // namespace vireo::linux_platform
