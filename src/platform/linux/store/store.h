// The local SQLite store behind the telemetry, analytics and energy-log services.
//
// Producers hand rows over to a bounded in-memory queue and never touch the disk;
// one writer thread takes everything queued and commits it in one transaction
// (group commit), at least every commit interval while rows are pending, or at
// once when a flush asks for it.
#pragma once

#include <sqlite3.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "base/value.h"
#include "platform/clock.h"
#include "platform/logger.h"
#include "platform/linux/paths.h"

namespace vireo::linux_platform {

class LocalStore {
 public:
  struct Options {
    // Memory the pending rows may take before producers are refused.
    std::size_t maxPendingBytes = 64u << 20;
    // Longest time a handed-over row waits for its commit.
    std::chrono::milliseconds commitInterval{100};
    // Pause before the one retry of a failed batch.
    std::chrono::milliseconds retryDelay{50};
    // How long a write waits for another process's lock on the file.
    std::chrono::milliseconds busyTimeout{5000};
  };

  // Opens (creating it and its directory) STATE/vireo.db. A store that cannot be
  // opened is logged and stays unusable: every insert is refused.
  LocalStore(const std::string& stateDirectory, Logger& logger, Clock& clock, Options options);
  LocalStore(const std::string& stateDirectory, Logger& logger, Clock& clock)
      : LocalStore(stateDirectory, logger, clock, Options{}) {}
  static std::shared_ptr<LocalStore> open(const ServiceDirectories& directories, Logger& logger, Clock& clock);
  ~LocalStore();

  LocalStore(const LocalStore&) = delete;
  LocalStore& operator=(const LocalStore&) = delete;

  static constexpr const char* kFileName = "vireo.db";

  bool usable() const { return usable_.load(std::memory_order_acquire); }
  const std::string& path() const { return path_; }
  Logger& logger() const { return logger_; }
  double now() const { return unixSeconds(clock_.now()); }

  // Each insert returns false (or nothing) when the store is unusable, closed or
  // its queue is full; the row is then not recorded.
  std::optional<std::int64_t> insertTelemetrySession(const Dictionary& sessionInfo, const Dictionary& userInfo,
                                                     double createdAt);
  // backends absent stores NULL.
  bool setBackends(std::int64_t sessionId, const std::optional<std::vector<std::string>>& backends);
  bool setFlushed(std::int64_t sessionId, double flushedAt);
  // session absent makes a one-shot row, which alone carries session and user info.
  bool insertTelemetryMessage(std::optional<std::int64_t> session, const Dictionary* sessionInfo,
                              const Dictionary* userInfo, std::int64_t category, std::int64_t type,
                              const Dictionary& payload, double sentAt);
  bool insertAnalyticsEvent(std::string_view name, const Dictionary& payload, double at);
  bool insertEnergyEvent(std::int64_t client, std::string_view name, const Dictionary& payload, double at);

  // Waits until everything handed over so far is committed (or dropped after a
  // failed retry). True when it all got there and the last write succeeded.
  bool flush(std::chrono::milliseconds timeout);
  // Commits everything and stops the writer; later inserts are refused. Idempotent.
  void close();

  static std::string jsonObject(const Dictionary& d);

 private:
  struct Row;

  bool openDatabase(const std::string& stateDirectory);
  bool prepareStatements();
  bool enqueue(Row&& row);
  void writerLoop();
  bool writeBatch(const std::vector<Row>& batch);
  bool writeRow(const Row& row);
  bool exec(const char* sql);
  void logError(const char* function, const char* what);
  void finalizeDatabase();

  Logger& logger_;
  Clock& clock_;
  const Options options_;
  std::string path_;
  std::atomic<bool> usable_{false};
  std::atomic<std::int64_t> nextSessionId_{1};

  // Owned by the writer thread once it runs (and by the constructor before).
  sqlite3* db_ = nullptr;
  sqlite3_stmt* statements_[6] = {};

  // mutex_ guards the queue and everything below it down to the writer thread.
  std::mutex mutex_;
  std::condition_variable wake_;      // the writer: rows, flush requests, stop
  std::condition_variable processed_; // flush() waiters
  std::vector<Row> queue_;
  std::size_t queueBytes_ = 0;
  std::chrono::steady_clock::time_point firstPending_{};
  std::uint64_t enqueued_ = 0;   // rows handed over, ever
  std::uint64_t processedRows_ = 0; // rows committed or dropped
  std::uint64_t flushTarget_ = 0;
  bool lastWriteOk_ = true;
  bool overflowLogged_ = false;
  bool stopping_ = false;
  bool closed_ = false;
  std::thread writer_;
};

}  // namespace vireo::linux_platform
