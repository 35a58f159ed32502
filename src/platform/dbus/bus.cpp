#include "platform/dbus/bus.h"

#include <cstring>

namespace vireo::dbus {

std::string describeError(const sd_bus_error* error, int r) {
  if (error && sd_bus_error_is_set(error))
    return std::string(error->name) + ": " + (error->message ? error->message : "");
  return std::strerror(r < 0 ? -r : r);
}

}  // namespace vireo::dbus
