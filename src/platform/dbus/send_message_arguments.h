// The arguments of SendMessage (a{sv}uqbax), read the one way the daemon reads them.
#pragma once

#include <systemd/sd-bus.h>

#include <cstdint>
#include <optional>
#include <vector>

#include "base/value.h"

namespace vireo::dbus {

struct SendMessageArguments {
  Dictionary payload;
  std::uint32_t category = 0;
  std::uint16_t type = 0;
  // Absent when the message is not addressed: it is then broadcast.
  std::optional<std::vector<std::int64_t>> reporterIDs;
};

// Returns >0 on success, <0 with error set.
int readSendMessageArguments(sd_bus_message* m, SendMessageArguments* out, sd_bus_error* error);

}  // namespace vireo::dbus
