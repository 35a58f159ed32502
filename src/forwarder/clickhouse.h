// The ClickHouse HTTP interface through libcurl: one connection, kept alive between
// requests, basic authentication from forwarder.conf.
#pragma once

#include <functional>
#include <string>
#include <string_view>
#include <vector>

#include "forwarder/config.h"

typedef void CURL;

namespace vireo::forwarder {

// data/forwarder/clickhouse.sql, built in.
extern const char* const kClickHouseSchema;

// The statements of a schema script, comments dropped, with database in place of
// the script's database vireo.
std::vector<std::string> schemaStatements(std::string_view script, std::string_view database);

class ClickHouseClient {
 public:
  // cancelled is polled during a transfer, which it ends when it returns true.
  ClickHouseClient(const ForwarderConfig& config, std::function<bool()> cancelled);
  ~ClickHouseClient();
  ClickHouseClient(const ClickHouseClient&) = delete;
  ClickHouseClient& operator=(const ClickHouseClient&) = delete;

  // POSTs body, with query in the URL unless it is empty. True on HTTP 200 only;
  // otherwise error tells why. The answer's body goes to answer when given.
  bool post(std::string_view query, std::string_view body, std::string* error, std::string* answer = nullptr);

  // Creates the database and the tables unless they all exist already.
  bool ensureSchema(std::string* error);

 private:
  const ForwarderConfig& config_;
  const std::function<bool()> cancelled_;
  CURL* curl_ = nullptr;
};

}  // namespace vireo::forwarder
