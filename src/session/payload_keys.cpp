#include "session/payload_keys.h"

#include <string>

#include "base/value_pack.h"

namespace vireo {

Dictionary cleanPayloadKeys(const Dictionary& payload) {
  Dictionary cleaned;
  cleaned.reserve(payload.size());
  for (const auto& [key, value] : payload) {
    const std::string* text = key.asString();
    if (!text || text->find(' ') == std::string::npos) {
      cleaned.set(key, value);
      continue;
    }
    std::string replaced = *text;
    for (char& c : replaced)
      if (c == ' ') c = '_';
    cleaned.set(Value(std::move(replaced)), value);
  }
  return cleaned;
}

std::size_t payloadFootprint(const Value& value) {
  std::string packed = packValue(value);
  packed.shrink_to_fit();
  return packedFootprint(packed);
}

}  // namespace vireo
