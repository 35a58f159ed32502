#include "platform/dbus/send_message_arguments.h"

#include <cstring>

#include "platform/dbus/value_codec.h"

namespace vireo::dbus {

int readSendMessageArguments(sd_bus_message* m, SendMessageArguments* out, sd_bus_error* error) {
  int r = readDictionary(m, &out->payload, error);
  if (r < 0) return r;
  int addressed = 0;
  if ((r = sd_bus_message_read(m, "uqb", &out->category, &out->type, &addressed)) < 0) return r;
  const void* ids = nullptr;
  std::size_t size = 0;
  if ((r = sd_bus_message_read_array(m, 'x', &ids, &size)) < 0) return r;
  out->reporterIDs.reset();
  if (addressed) {
    out->reporterIDs.emplace(size / sizeof(std::int64_t));
    if (size) std::memcpy(out->reporterIDs->data(), ids, size);
  }
  return 1;
}

}  // namespace vireo::dbus
