// Value <-> sd_bus_message conversion for the client library and the load tools.
// Writing: a Dictionary goes out as a{sv}; each value as a variant of its natural
// D-Bus type. Reading follows the service's rules (signedness kept, ay is data,
// dictionaries of any basic key type, other arrays and structs as arrays, variants
// unwrapped, fds and more than 16 nested containers refused).
#pragma once

#include <systemd/sd-bus.h>

#include <cstdint>
#include <string>
#include <vector>

#include "base/value.h"

namespace vireo::client::marshal {

inline constexpr int kMaxDepth = 16;

// All return a negative errno on failure, >= 0 on success.
int appendVariant(sd_bus_message* m, const Value& v);
int appendDictionary(sd_bus_message* m, const Dictionary& d);  // a{sv}
int appendInt64Array(sd_bus_message* m, const std::vector<std::int64_t>& ids);  // ax

// Reads the complete value at the current position. On a refused value returns
// -EINVAL and fills why; depth counts the containers already entered.
int readValue(sd_bus_message* m, Value& out, std::string* why, int depth = 0);
// Reads an a{..} at the current position into a Dictionary.
int readDictionary(sd_bus_message* m, Dictionary& out, std::string* why);

}  // namespace vireo::client::marshal
