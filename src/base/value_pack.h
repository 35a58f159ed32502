// A compact byte form of a Value, for what is kept in memory for a long time (a
// session's payloads until its summary): a tag byte per value, varint lengths and
// integers, raw doubles. A 20-entry payload packs to about its compact JSON size,
// against some 3 KB as a tree of values.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "base/value.h"

namespace vireo {

void packValue(std::string& out, const Value& value);
inline std::string packValue(const Value& value) {
  std::string out;
  packValue(out, value);
  return out;
}

// What a packed value costs in memory: its bytes and the string that holds them.
inline std::size_t packedFootprint(const std::string& packed) { return sizeof(std::string) + packed.capacity(); }

// Reads one value from the front of in and advances it; nothing when in does not
// hold a packed value (only packValue's output is ever read back).
std::optional<Value> unpackValue(std::string_view& in);

}  // namespace vireo
