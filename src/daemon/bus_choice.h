// Which bus the daemon serves on.
#pragma once

#include <string>

namespace vireo::daemon {

enum class BusKind { System, Session };

// VIREO_BUS (system|session) wins; then the bus that activated us
// (DBUS_STARTER_BUS_TYPE); then the system bus for root and the session bus for
// everyone else. Unknown values are ignored. A null pointer is an unset variable.
BusKind chooseBus(const char* vireoBus, const char* starterBusType, bool root);

const char* busKindName(BusKind kind);

}  // namespace vireo::daemon
