// The local SQLite store behind the telemetry, analytics and energy-log services.
//
// Producers hand rows over to a bounded in-memory queue and never touch the disk;
// one writer thread takes everything queued and commits it in one transaction as
// soon as it is idle, so rows that arrive during a commit go into the next one
// (group commit). A write the database refuses (locked, full, I/O) is retried with
// a growing pause and nothing is dropped while the process lives; a row the
// database refuses on its own (a constraint, too big) is dropped alone.
#pragma once

#include <sqlite3.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "base/mutex.h"
#include "base/value.h"
#include "platform/clock.h"
#include "platform/logger.h"
#include "platform/linux/paths.h"

namespace vireo::linux_platform {

// What a live status view shows of the store, read in one piece.
struct StoreStatus {
  std::uint64_t pendingRows = 0;    // handed over, not yet committed
  std::uint64_t pendingBytes = 0;
  std::uint64_t refusedRows = 0;    // refused at insert: queue full, or closed/unusable store
  std::uint64_t droppedBadRows = 0; // rows the database refused on their own
  std::uint64_t writeErrors = 0;    // failed write attempts (each retried)
  std::uint64_t quotaDroppedRows = 0;  // rows the disk quota deleted since the start
  std::string lastError;            // of the last failed attempt or dropped row, "" if none
  bool usable = false;
};

class LocalStore {
 public:
  struct Options {
    // Memory and rows the pending (not yet committed) rows may take before
    // producers are refused.
    std::size_t maxPendingBytes = 64u << 20;
    std::size_t maxPendingRows = 100000;
    // Pause after a failed write, doubled after each further failure up to the maximum.
    std::chrono::milliseconds retryDelay{50};
    std::chrono::milliseconds maxRetryDelay{2000};
    // How long a write waits for another process's lock on the file.
    std::chrono::milliseconds busyTimeout{5000};
    // How long close() keeps retrying a failing write before it drops the rows
    // (a write already waiting on a lock may add up to busyTimeout).
    std::chrono::milliseconds closeTimeout{5000};
    // Group commit: a row that finds the writer idle waits this long for others to
    // join its transaction (unless groupRows are already waiting), so that a steady
    // trickle of rows costs a commit every few milliseconds rather than one per row.
    std::chrono::microseconds groupWindow{2000};
    std::size_t groupRows = 256;
    // After this long without rows the writer hands SQLite's page cache back.
    std::chrono::milliseconds releaseCacheAfter{500};
    // The disk quota (store_quota.h): pages in use past it make the writer delete
    // rows after its commit. 0: none.
    std::int64_t maxStoreBytes = 0;
  };

  // Opens (creating it and its directory) STATE/vireo.db. A store that cannot be
  // opened is logged and stays unusable: every insert is refused.
  LocalStore(const std::string& stateDirectory, Logger& logger, Clock& clock, Options options);
  LocalStore(const std::string& stateDirectory, Logger& logger, Clock& clock)
      : LocalStore(stateDirectory, logger, clock, Options{}) {}
  static std::shared_ptr<LocalStore> open(const ServiceDirectories& directories, Logger& logger, Clock& clock,
                                          Options options);
  static std::shared_ptr<LocalStore> open(const ServiceDirectories& directories, Logger& logger, Clock& clock) {
    return open(directories, logger, clock, Options{});
  }
  ~LocalStore();

  LocalStore(const LocalStore&) = delete;
  LocalStore& operator=(const LocalStore&) = delete;

  static constexpr const char* kFileName = "vireo.db";

  bool usable() const { return usable_.load(std::memory_order_acquire); }
  const std::string& path() const { return path_; }
  Logger& logger() const { return logger_; }
  double now() const { return unixSeconds(clock_.now()); }

  // Each insert returns false (or nothing) when the store is unusable, closed or
  // its queue is full; the row is then not recorded. A row accepted is committed
  // unless the database refuses that row itself or close() gives up on a failing disk.
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

  // Rows handed over so far: a mark for flush(timeout, since).
  std::uint64_t handedOver() const;
  // Waits until every row handed over before the call is committed or dropped.
  // True only when they all got there; rows handed over before the mark since are
  // not looked at (a caller passes the mark taken at its previous flush).
  bool flush(std::chrono::milliseconds timeout, std::uint64_t since = 0);
  // Commits everything and stops the writer; later inserts are refused. Retries a
  // failing write for Options::closeTimeout, then drops what is left. Idempotent.
  void close();

  StoreStatus status() const;

  static std::string jsonObject(const Dictionary& d);

 private:
  struct Row;

  bool openDatabase(const std::string& stateDirectory);
  bool prepareStatements();
  bool enqueue(Row&& row);
  bool refuse();
  void writerLoop();
  bool writeBatch(std::vector<Row>& batch, std::string* error, std::string* badError);
  int writeRow(const Row& row, std::string* error);
  void finishBatch(std::vector<Row>& batch, bool dropAll) VIREO_REQUIRES(mutex_);
  void noteDropped(std::uint64_t first, std::uint64_t last) VIREO_REQUIRES(mutex_);
  bool droppedAfter(std::uint64_t since, std::uint64_t upTo) const VIREO_REQUIRES(mutex_);
  void enforceQuota();
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
  // Rows are numbered from 1 in the order they are handed over and processed
  // (committed or dropped) in that order.
  mutable Mutex mutex_;
  std::condition_variable wake_;      // the writer: rows, stop
  std::condition_variable processed_; // flush() waiters
  std::vector<Row> queue_ VIREO_GUARDED_BY(mutex_);
  std::chrono::steady_clock::time_point queuedSince_ VIREO_GUARDED_BY(mutex_);  // when queue_ last became non-empty            // not yet taken by the writer
  std::uint64_t pendingRows_ VIREO_GUARDED_BY(mutex_) = 0;     // queue_ and the writer's batch
  std::uint64_t pendingBytes_ VIREO_GUARDED_BY(mutex_) = 0;
  std::uint64_t enqueued_ VIREO_GUARDED_BY(mutex_) = 0;        // rows handed over, ever
  std::uint64_t processedRows_ VIREO_GUARDED_BY(mutex_) = 0;   // rows committed or dropped, ever
  std::vector<std::pair<std::uint64_t, std::uint64_t>> dropped_ VIREO_GUARDED_BY(mutex_);  // recent ranges of dropped row numbers
  std::uint64_t forgottenDrops_ VIREO_GUARDED_BY(mutex_) = 0;  // the last row number of ranges no longer in dropped_
  std::uint64_t refusedRows_ VIREO_GUARDED_BY(mutex_) = 0;
  std::uint64_t droppedBadRows_ VIREO_GUARDED_BY(mutex_) = 0;
  std::uint64_t writeErrors_ VIREO_GUARDED_BY(mutex_) = 0;
  std::uint64_t quotaDroppedRows_ VIREO_GUARDED_BY(mutex_) = 0;
  std::string lastError_ VIREO_GUARDED_BY(mutex_);
  bool overflowing_ VIREO_GUARDED_BY(mutex_) = false;  // refusing since the queue last went below half its limits
  bool stopping_ VIREO_GUARDED_BY(mutex_) = false;
  bool closed_ VIREO_GUARDED_BY(mutex_) = false;
  std::chrono::steady_clock::time_point giveUpAt_ VIREO_GUARDED_BY(mutex_){};  // set by close()
  std::thread writer_;
};

}  // namespace vireo::linux_platform
