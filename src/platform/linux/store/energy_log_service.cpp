#include "platform/linux/store/energy_log_service.h"

#include <utility>

namespace vireo::linux_platform {

LocalEnergyLogService::LocalEnergyLogService(std::shared_ptr<LocalStore> store) : store_(std::move(store)) {}

void LocalEnergyLogService::logEvent(int client, std::string_view name, const Dictionary& event) {
  // Nothing is reported back to the caller; an unusable store has logged already.
  store_->insertEnergyEvent(client, name, event, store_->now());
}

}  // namespace vireo::linux_platform
