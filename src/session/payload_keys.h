// Payload key cleaning shared by session messages and single messages.
#pragma once

#include "base/value.h"

namespace vireo {

// A copy of payload whose string keys have every " " replaced by "_". Other keys,
// all values and nested dictionaries are kept; when two keys clean to the same
// text, the later entry wins.
Dictionary cleanPayloadKeys(const Dictionary& payload);

// What a value costs to keep packed in memory, in bytes; linear in its size.
std::size_t payloadFootprint(const Value& value);

}  // namespace vireo
