#include "session/payload_keys.h"

#include <string>

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
  // Each node's own bookkeeping (value slot, container header, allocation) is about 32 bytes.
  constexpr std::size_t kNode = 32;
  if (const std::string* s = value.asString()) return kNode + s->size();
  if (const Data* d = value.asData()) return kNode + d->size();
  std::size_t total = kNode;
  if (const Array* a = value.asArray())
    for (const Value& v : *a) total += payloadFootprint(v);
  if (const Dictionary* d = value.asDictionary())
    for (const auto& [k, v] : *d) total += payloadFootprint(k) + payloadFootprint(v);
  return total;
}

}  // namespace vireo
