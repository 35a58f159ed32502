#include "forwarder/clickhouse.h"

#include <curl/curl.h>

#include <memory>

namespace vireo::forwarder {

namespace {

std::string_view trim(std::string_view s) {
  auto b = s.find_first_not_of(" \t\r\n");
  if (b == std::string_view::npos) return {};
  return s.substr(b, s.find_last_not_of(" \t\r\n") - b + 1);
}

void replaceAll(std::string& text, std::string_view from, std::string_view to) {
  for (auto at = text.find(from); at != std::string::npos; at = text.find(from, at + to.size()))
    text.replace(at, from.size(), to);
}

size_t collect(char* data, size_t size, size_t count, void* out) {
  auto* text = static_cast<std::string*>(out);
  // Answers are error texts and counts; a server answering at length is cut short.
  constexpr std::size_t kMaxAnswer = 16u << 20;
  text->append(data, std::min(size * count, kMaxAnswer - std::min(kMaxAnswer, text->size())));
  return size * count;
}

int progress(void* cancelled, curl_off_t, curl_off_t, curl_off_t, curl_off_t) {
  return (*static_cast<std::function<bool()>*>(cancelled))() ? 1 : 0;
}

constexpr const char* kTables[] = {"telemetry_sessions", "telemetry_messages", "analytics_events", "energy_events",
                                   "store_dropped"};

}  // namespace

std::vector<std::string> schemaStatements(std::string_view script, std::string_view database) {
  std::string code;
  while (!script.empty()) {
    auto nl = script.find('\n');
    auto line = script.substr(0, nl);
    script = nl == std::string_view::npos ? std::string_view{} : script.substr(nl + 1);
    if (trim(line).starts_with("--")) continue;
    code.append(line).push_back('\n');
  }
  const std::string name(database);
  replaceAll(code, "EXISTS vireo.", "EXISTS " + name + ".");
  replaceAll(code, "EXISTS vireo;", "EXISTS " + name + ";");
  std::vector<std::string> out;
  std::string_view rest = code;
  while (!rest.empty()) {
    auto semicolon = rest.find(';');
    if (auto statement = trim(rest.substr(0, semicolon)); !statement.empty()) out.emplace_back(statement);
    rest = semicolon == std::string_view::npos ? std::string_view{} : rest.substr(semicolon + 1);
  }
  return out;
}

ClickHouseClient::ClickHouseClient(const ForwarderConfig& config, std::function<bool()> cancelled)
    : config_(config), cancelled_(std::move(cancelled)), curl_(curl_easy_init()) {}

ClickHouseClient::~ClickHouseClient() {
  if (curl_) curl_easy_cleanup(curl_);
}

bool ClickHouseClient::post(std::string_view query, std::string_view body, std::string* error, std::string* answer) {
  if (!curl_) {
    *error = "cannot set up libcurl";
    return false;
  }
  std::string url = config_.url;
  if (!query.empty()) {
    std::unique_ptr<char, decltype(&curl_free)> escaped(
        curl_easy_escape(curl_, query.data(), static_cast<int>(query.size())), curl_free);
    url += url.find('?') == std::string::npos ? "?query=" : "&query=";
    url += escaped ? escaped.get() : "";
  }
  std::string received;
  char curlError[CURL_ERROR_SIZE] = {};
  curl_easy_reset(curl_);  // keeps the connection
  curl_easy_setopt(curl_, CURLOPT_URL, url.c_str());
  curl_easy_setopt(curl_, CURLOPT_POST, 1L);
  curl_easy_setopt(curl_, CURLOPT_POSTFIELDS, body.data());
  curl_easy_setopt(curl_, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(body.size()));
  curl_easy_setopt(curl_, CURLOPT_NOSIGNAL, 1L);
  curl_easy_setopt(curl_, CURLOPT_CONNECTTIMEOUT, 10L);
  // A batch may be large on a slow link; a stalled one is given up after a minute.
  curl_easy_setopt(curl_, CURLOPT_LOW_SPEED_LIMIT, 1L);
  curl_easy_setopt(curl_, CURLOPT_LOW_SPEED_TIME, 60L);
  curl_easy_setopt(curl_, CURLOPT_ERRORBUFFER, curlError);
  curl_easy_setopt(curl_, CURLOPT_WRITEFUNCTION, collect);
  curl_easy_setopt(curl_, CURLOPT_WRITEDATA, &received);
  curl_easy_setopt(curl_, CURLOPT_NOPROGRESS, 0L);
  curl_easy_setopt(curl_, CURLOPT_XFERINFOFUNCTION, progress);
  curl_easy_setopt(curl_, CURLOPT_XFERINFODATA, &cancelled_);
  curl_easy_setopt(curl_, CURLOPT_PROTOCOLS_STR, "http,https");
  curl_easy_setopt(curl_, CURLOPT_USERAGENT, "vireo-forwarder");
  if (!config_.user.empty()) {
    curl_easy_setopt(curl_, CURLOPT_HTTPAUTH, CURLAUTH_BASIC);
    curl_easy_setopt(curl_, CURLOPT_USERNAME, config_.user.c_str());
    curl_easy_setopt(curl_, CURLOPT_PASSWORD, config_.password.c_str());
  }
  const CURLcode rc = curl_easy_perform(curl_);
  if (rc != CURLE_OK) {
    *error = config_.url + ": " + (curlError[0] ? curlError : curl_easy_strerror(rc));
    return false;
  }
  long status = 0;
  curl_easy_getinfo(curl_, CURLINFO_RESPONSE_CODE, &status);
  if (status != 200) {
    auto text = trim(received);
    *error = config_.url + ": HTTP " + std::to_string(status) + (text.empty() ? "" : ": ") +
             std::string(text.substr(0, text.find('\n')));
    return false;
  }
  if (answer) *answer = std::move(received);
  return true;
}

bool ClickHouseClient::ensureSchema(std::string* error) {
  std::string names;
  for (const char* table : kTables) names += std::string(names.empty() ? "'" : ", '") + table + "'";
  std::string answer;
  if (!post("", "SELECT count() FROM system.tables WHERE database = '" + config_.database + "' AND name IN (" +
                    names + ")",
            error, &answer))
    return false;
  if (trim(answer) == std::to_string(std::size(kTables))) return true;
  for (const auto& statement : schemaStatements(kClickHouseSchema, config_.database)) {
    if (!post("", statement, error)) return false;
  }
  return true;
}

}  // namespace vireo::forwarder
