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

}  // namespace vireo
