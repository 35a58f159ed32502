#include "platform/dbus/send_message_arguments.h"

#include <cerrno>
#include <cstring>

namespace vireo::dbus {

int readSendMessageArguments(sd_bus_message* m, SendMessageArguments* out, sd_bus_error* error,
                             const DecodeLimits& limits) {
  int r = readDictionary(m, &out->payload, error, limits);
  if (r < 0) return r;
  int addressed = 0;
  if ((r = sd_bus_message_read(m, "uqb", &out->category, &out->type, &addressed)) < 0) return r;
  const void* ids = nullptr;
  std::size_t size = 0;
  if ((r = sd_bus_message_read_array(m, 'x', &ids, &size)) < 0) return r;
  const std::size_t count = size / sizeof(std::int64_t);
  if (count > limits.maxReporterIDs) {
    sd_bus_error_setf(error, kLimitsExceeded, "more than MaxReporterIDsPerCall=%zu reporter IDs",
                      limits.maxReporterIDs);
    return -ENOBUFS;
  }
  out->reporterIDs.reset();
  if (addressed) {
    out->reporterIDs.emplace(count);
    if (size) std::memcpy(out->reporterIDs->data(), ids, size);
  }
  return 1;
}

}  // namespace vireo::dbus
