#include "forwarder/config.h"

#include <fstream>
#include <sstream>

namespace vireo::forwarder {

namespace {

using linux_platform::KeyFile;

bool integerKey(const KeyFile& keys, const char* key, long long min, long long max, long long* out,
                std::string* error) {
  auto it = keys.find(key);
  if (it == keys.end()) return true;
  auto value = linux_platform::parseInteger(it->second);
  if (!value || *value < min || *value > max) {
    *error = std::string(key) + "=" + it->second + ": expected a whole number from " + std::to_string(min) +
             " to " + std::to_string(max);
    return false;
  }
  *out = *value;
  return true;
}

// The name goes into SQL text: ClickHouse's plain identifiers only.
bool plainIdentifier(const std::string& name) {
  if (name.empty() || (name[0] >= '0' && name[0] <= '9')) return false;
  for (char c : name) {
    if (!((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_')) return false;
  }
  return true;
}

}  // namespace

std::optional<ForwarderConfig> parseForwarderConfig(const KeyFile& keys, const std::string& configurationDirectory,
                                                    std::string* error) {
  ForwarderConfig c;
  auto text = [&](const char* key) {
    auto it = keys.find(key);
    return it == keys.end() ? std::string() : it->second;
  };
  c.url = text("URL");
  if (c.url.rfind("http://", 0) != 0 && c.url.rfind("https://", 0) != 0) {
    *error = c.url.empty() ? "URL= is missing" : "URL=" + c.url + ": expected an http:// or https:// address";
    return std::nullopt;
  }
  c.user = text("User");
  if (auto db = text("Database"); !db.empty()) c.database = db;
  if (!plainIdentifier(c.database)) {
    *error = "Database=" + c.database + ": expected letters, digits and underscores";
    return std::nullopt;
  }
  long long interval = c.interval.count();
  long long keep = c.keepForwarded.count();
  if (!integerKey(keys, "BatchRows", 1, 1000000, &c.batchRows, error) ||
      !integerKey(keys, "Interval", 1, 86400, &interval, error) ||
      !integerKey(keys, "KeepForwarded", 0, 100LL * 365 * 86400, &keep, error))
    return std::nullopt;
  c.interval = std::chrono::seconds(interval);
  c.keepForwarded = std::chrono::seconds(keep);
  if (auto file = text("PasswordFile"); !file.empty()) {
    if (file.front() != '/') file = configurationDirectory + "/" + file;
    std::ifstream in(file, std::ios::binary);
    if (!in) {
      *error = "PasswordFile=" + file + ": cannot be read";
      return std::nullopt;
    }
    std::ostringstream ss;
    ss << in.rdbuf();
    c.password = ss.str();
    while (!c.password.empty() && (c.password.back() == '\n' || c.password.back() == '\r')) c.password.pop_back();
  }
  return c;
}

}  // namespace vireo::forwarder
