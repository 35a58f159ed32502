// The energy-log service over the local store: energy_events rows.
#pragma once

#include <memory>
#include <string_view>

#include "platform/event_sinks.h"
#include "platform/linux/store/store.h"

namespace vireo::linux_platform {

class LocalEnergyLogService : public EnergyLogService {
 public:
  explicit LocalEnergyLogService(std::shared_ptr<LocalStore> store);

  void logEvent(int client, std::string_view name, const Dictionary& event) override;

 private:
  const std::shared_ptr<LocalStore> store_;
};

}  // namespace vireo::linux_platform
