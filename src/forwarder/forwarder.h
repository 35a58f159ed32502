// One forwarding pass: every table's rows past its cursor, then the change log,
// sent as batches back to back until nothing is left, then the counts of rows the
// disk quota deleted, and the state forwarder.json shows.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "forwarder/clickhouse.h"
#include "forwarder/config.h"
#include "forwarder/forward_store.h"
#include "platform/logger.h"

namespace vireo::forwarder {

class Forwarder {
 public:
  struct Hooks {
    std::function<bool()> cancelled;  // SIGTERM: stop between batches and during a transfer
    std::function<bool()> consent;    // false while the suite says disable_reporting
    bool exitAfterFirstSend = false;  // tests: end the process after a 200, before its cursor is stored
  };

  Forwarder(ForwarderConfig config, std::string device, std::string storePath, Logger& logger, Hooks hooks);

  enum class Result { Done, Failed, Stopped };
  // Sends everything there is; Failed leaves the rest for the next pass.
  Result pass();
  // Deletes forwarded rows older than KeepForwarded (none when it is 0).
  void prune();
  // Writes the status file atomically. consent as last seen, nextAttempt when the
  // next pass is due (Unix seconds, 0 for none).
  void writeStatus(const std::string& path, bool consent, double nextAttempt);

  std::uint64_t failedAttempts() const { return failures_; }

 private:
  Result fail(const std::string& error);
  // False when there is no store yet, or (with error) when it cannot be opened.
  bool openStore(std::string* error);
  bool sendBatch(const char* table, const Batch& batch, std::string* error);
  // The disk quota's dropped counts, when they grew since they were last sent.
  bool sendDropped(std::string* error);

  const ForwarderConfig config_;
  const std::string device_;
  const std::string storePath_;
  Logger& logger_;
  const Hooks hooks_;
  ClickHouseClient client_;
  std::unique_ptr<ForwardStore> store_;
  bool schemaReady_ = false;
  bool reportedNoStore_ = false;

  std::map<std::string, std::uint64_t> sent_;  // rows sent since start, per table
  std::uint64_t pruned_ = 0;
  double lastSuccess_ = 0;
  std::string lastError_;
  double lastErrorAt_ = 0;
  std::uint64_t failures_ = 0;  // consecutive failed passes
};

}  // namespace vireo::forwarder
