// The store and the three services over it, as the daemon builds them. The logger
// and the clock must outlive this bundle; close() at shutdown commits every row.
#pragma once

#include <memory>

#include "platform/linux/paths.h"
#include "platform/linux/store/analytics_service.h"
#include "platform/linux/store/energy_log_service.h"
#include "platform/linux/store/store.h"
#include "platform/linux/store/telemetry_service.h"

namespace vireo::linux_platform {

struct LocalStoreServices {
  // options carries the limits (limits.conf MaxQueuedRows is Options::maxPendingRows).
  LocalStoreServices(const ServiceDirectories& directories, Logger& logger, Clock& clock,
                     LocalStore::Options options = {})
      : store(LocalStore::open(directories, logger, clock, options)),
        telemetry(store, directories.configuration),
        analytics(store, directories.configuration),
        energyLog(store) {}

  // Commits what is queued and stops the writer; later rows are refused.
  void close() { store->close(); }

  std::shared_ptr<LocalStore> store;
  LocalTelemetryService telemetry;
  LocalAnalyticsService analytics;
  LocalEnergyLogService energyLog;
};

}  // namespace vireo::linux_platform
