// The analytics event service and the energy-log service.
#pragma once

#include <functional>
#include <string_view>

#include "base/value.h"

namespace vireo {

class AnalyticsService {
 public:
  virtual ~AnalyticsService() = default;
  // Calls payload only when the service wants the event, and records what it returns.
  virtual void sendEventLazy(std::string_view name, const std::function<Dictionary()>& payload) = 0;
};

class EnergyLogService {
 public:
  virtual ~EnergyLogService() = default;
  // Logs a registered event for a client number.
  virtual void logEvent(int client, std::string_view name, const Dictionary& event) = 0;
};

}  // namespace vireo
