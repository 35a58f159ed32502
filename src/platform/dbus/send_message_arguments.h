// The arguments of SendMessage (a{sv}uqbax), read the one way the daemon reads them.
#pragma once

#include <systemd/sd-bus.h>

#include <cstdint>
#include <optional>
#include <vector>

#include "base/value.h"
#include "platform/dbus/value_codec.h"

namespace vireo::dbus {

struct SendMessageArguments {
  Dictionary payload;
  std::uint32_t category = 0;
  std::uint16_t type = 0;
  // Absent when the message is not addressed: it is then broadcast.
  std::optional<std::vector<std::int64_t>> reporterIDs;
};

// Returns >0 on success, <0 with error set. The payload is read under limits'
// bytes and entries, the ax of reporter IDs (addressed or not) under
// maxReporterIDs; passing one fails with -ENOBUFS and kLimitsExceeded.
int readSendMessageArguments(sd_bus_message* m, SendMessageArguments* out, sd_bus_error* error,
                             const DecodeLimits& limits = {});

}  // namespace vireo::dbus
