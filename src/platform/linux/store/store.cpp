#include "platform/linux/store/store.h"

#include <malloc.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <iterator>
#include <utility>

#include "platform/linux/store/change_log.h"
#include "platform/linux/store/store_quota.h"

namespace vireo::linux_platform {

namespace {

// The published schema, word for word; IF NOT EXISTS lets every start run it.
constexpr const char* kSchema = R"sql(
CREATE TABLE IF NOT EXISTS telemetry_sessions (
  id           INTEGER PRIMARY KEY,
  session_info TEXT NOT NULL,   -- client_type, client_version, session_id, batch_event, hierarchy_token
  user_info    TEXT NOT NULL,   -- client_name, service_name, then the session's own entries
  backends     TEXT,            -- JSON array of backend names found, NULL when none were found
  created_at   REAL NOT NULL,   -- Unix time, seconds
  flushed_at   REAL
);
CREATE TABLE IF NOT EXISTS telemetry_messages (
  id           INTEGER PRIMARY KEY,
  session      INTEGER REFERENCES telemetry_sessions(id),  -- NULL for a one-shot message
  session_info TEXT,            -- one-shot messages only
  user_info    TEXT,            -- one-shot messages only
  category     INTEGER NOT NULL,
  type         INTEGER NOT NULL,
  payload      TEXT NOT NULL,
  sent_at      REAL NOT NULL
);
CREATE TABLE IF NOT EXISTS analytics_events (
  id INTEGER PRIMARY KEY, name TEXT NOT NULL, payload TEXT NOT NULL, at REAL NOT NULL);
CREATE TABLE IF NOT EXISTS energy_events (
  id INTEGER PRIMARY KEY, client INTEGER NOT NULL, name TEXT NOT NULL,
  payload TEXT NOT NULL, at REAL NOT NULL);
)sql";

enum Statement { kInsertSession, kSetBackends, kSetFlushed, kInsertMessage, kInsertAnalytics, kInsertEnergy, kCount };

constexpr const char* kStatementSql[kCount] = {
    "INSERT INTO telemetry_sessions (id, session_info, user_info, backends, created_at, flushed_at) "
    "VALUES (?1, ?2, ?3, NULL, ?4, NULL)",
    "UPDATE telemetry_sessions SET backends = ?2 WHERE id = ?1",
    "UPDATE telemetry_sessions SET flushed_at = ?2 WHERE id = ?1",
    "INSERT INTO telemetry_messages (session, session_info, user_info, category, type, payload, sent_at) "
    "VALUES (?1, ?2, ?3, ?4, ?5, ?6, ?7)",
    "INSERT INTO analytics_events (name, payload, at) VALUES (?1, ?2, ?3)",
    "INSERT INTO energy_events (client, name, payload, at) VALUES (?1, ?2, ?3, ?4)",
};

// mkdir -p, each new directory with mode 0755.
bool makeDirectories(const std::string& path, std::string* error) {
  if (path.empty()) {
    *error = "no state directory";
    return false;
  }
  std::size_t pos = 0;
  while (pos != std::string::npos) {
    pos = path.find('/', pos + 1);
    std::string part = path.substr(0, pos);
    if (part.empty() || part == "/") continue;
    if (::mkdir(part.c_str(), 0755) == 0) {
      ::chmod(part.c_str(), 0755);  // not narrowed by the umask
    } else if (errno != EEXIST) {
      *error = part + ": " + std::strerror(errno);
      return false;
    }
  }
  struct stat st {};
  if (::stat(path.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    *error = path + ": not a directory";
    return false;
  }
  return true;
}

int bindText(sqlite3_stmt* s, int index, const std::string& text) {
  return sqlite3_bind_text64(s, index, text.data(), text.size(), SQLITE_STATIC, SQLITE_UTF8);
}

// Errors that belong to the row being written, not to the database: retrying
// cannot help that row, and its batch-mates can be written without it.
bool aboutTheRow(int rc) {
  switch (rc & 0xff) {
    case SQLITE_CONSTRAINT:
    case SQLITE_TOOBIG:
    case SQLITE_MISMATCH:
    case SQLITE_RANGE:
      return true;
    default:
      return false;
  }
}

// Remembered drops: enough for every flush of a normal run, bounded when a
// client keeps sending rows the database refuses.
constexpr std::size_t kMaxDropRanges = 256;

}  // namespace

// One handed-over row or update, its JSON already written by the producer.
struct LocalStore::Row {
  enum class Kind : std::uint8_t { Session, Backends, Flushed, Message, Analytics, Energy };
  Kind kind = Kind::Message;
  bool hasId = false;     // Message: belongs to a session (else one-shot, with info); Backends: not NULL
  std::int64_t id = 0;    // the session's row id
  std::int64_t a = 0;     // category or client
  std::int64_t b = 0;     // type
  double at = 0;
  std::string t1, t2, t3; // JSON columns and names, per kind
  std::uint64_t number = 0;  // its place in the order rows were handed over, from 1
  std::size_t size = 0;      // bytes() when handed over
  bool bad = false;          // refused by the database itself: never written

  std::size_t bytes() const { return sizeof(Row) + t1.capacity() + t2.capacity() + t3.capacity(); }
};

LocalStore::LocalStore(const std::string& stateDirectory, Logger& logger, Clock& clock, Options options)
    : logger_(logger), clock_(clock), options_(options) {
  if (!openDatabase(stateDirectory)) {
    finalizeDatabase();
    closed_ = true;
    return;
  }
  usable_.store(true, std::memory_order_release);
  writer_ = std::thread([this] { writerLoop(); });
}

std::shared_ptr<LocalStore> LocalStore::open(const ServiceDirectories& directories, Logger& logger, Clock& clock,
                                             Options options) {
  return std::make_shared<LocalStore>(directories.state, logger, clock, options);
}

LocalStore::~LocalStore() { close(); }

void LocalStore::logError(const char* function, const char* what) {
  VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, function, "%s: %s (%s)", path_.c_str(), what,
         db_ ? sqlite3_errmsg(db_) : "no database");
}

bool LocalStore::openDatabase(const std::string& stateDirectory) {
  std::string error;
  path_ = stateDirectory + "/" + kFileName;
  if (!makeDirectories(stateDirectory, &error)) {
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, "LocalStore::open", "cannot create %s: %s",
           stateDirectory.c_str(), error.c_str());
    return false;
  }
  // The connection is used by one thread at a time (constructor, then writer).
  int rc = sqlite3_open_v2(path_.c_str(), &db_, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX,
                           nullptr);
  if (rc != SQLITE_OK) {
    logError("LocalStore::open", "cannot open the store");
    return false;
  }
  sqlite3_busy_timeout(db_, static_cast<int>(options_.busyTimeout.count()));
  sqlite3_stmt* mode = nullptr;
  if (sqlite3_prepare_v2(db_, "PRAGMA journal_mode=WAL", -1, &mode, nullptr) != SQLITE_OK ||
      sqlite3_step(mode) != SQLITE_ROW) {
    sqlite3_finalize(mode);
    logError("LocalStore::open", "cannot read the store");
    return false;
  }
  const char* journal = reinterpret_cast<const char*>(sqlite3_column_text(mode, 0));
  if (!journal || std::strcmp(journal, "wal") != 0) {
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, "LocalStore::open", "%s: WAL mode refused, using %s",
           path_.c_str(), journal ? journal : "?");
  }
  sqlite3_finalize(mode);
  // A commit reaches the WAL in the page cache, which outlives the process; the WAL is
  // synced at each checkpoint. Syncing at every commit would cost a disk flush per
  // batch on the message path for the last moments before a power cut only.
  if (!exec("PRAGMA synchronous=NORMAL") || !exec("BEGIN IMMEDIATE")) {
    logError("LocalStore::open", "cannot set up the store");
    return false;
  }
  if (!exec(kSchema) || !exec(kChangeLogSchema) || !exec("COMMIT")) {
    logError("LocalStore::open", "cannot create the schema");
    exec("ROLLBACK");
    return false;
  }
  if (!prepareStatements()) {
    logError("LocalStore::open", "cannot prepare statements");
    return false;
  }
  sqlite3_stmt* maxId = nullptr;
  if (sqlite3_prepare_v2(db_, "SELECT COALESCE(MAX(id), 0) FROM telemetry_sessions", -1, &maxId, nullptr) !=
          SQLITE_OK ||
      sqlite3_step(maxId) != SQLITE_ROW) {
    sqlite3_finalize(maxId);
    logError("LocalStore::open", "cannot read the session ids");
    return false;
  }
  nextSessionId_.store(sqlite3_column_int64(maxId, 0) + 1);
  sqlite3_finalize(maxId);
  return true;
}

bool LocalStore::prepareStatements() {
  for (int i = 0; i < kCount; ++i) {
    if (sqlite3_prepare_v3(db_, kStatementSql[i], -1, SQLITE_PREPARE_PERSISTENT, &statements_[i], nullptr) !=
        SQLITE_OK)
      return false;
  }
  return true;
}

bool LocalStore::exec(const char* sql) { return sqlite3_exec(db_, sql, nullptr, nullptr, nullptr) == SQLITE_OK; }

void LocalStore::finalizeDatabase() {
  for (auto*& s : statements_) {
    sqlite3_finalize(s);
    s = nullptr;
  }
  if (db_) {
    sqlite3_close(db_);
    db_ = nullptr;
  }
}

std::string LocalStore::jsonObject(const Dictionary& d) {
  std::string json;
  return appendJson(json, d, JsonMode::Lenient, false) ? json : std::string("{}");
}

bool LocalStore::refuse() {
  MutexLock lock(mutex_);
  ++refusedRows_;
  return false;
}

bool LocalStore::enqueue(Row&& row) {
  if (!usable()) return refuse();
  row.size = row.bytes();
  bool wake = false;
  bool logOverflow = false;
  std::uint64_t rows = 0;
  std::uint64_t bytes = 0;
  {
    MutexLock lock(mutex_);
    if (stopping_) {
      ++refusedRows_;
      return false;
    }
    if (pendingRows_ + 1 > options_.maxPendingRows || pendingBytes_ + row.size > options_.maxPendingBytes) {
      ++refusedRows_;
      if (overflowing_) return false;
      overflowing_ = logOverflow = true;
      rows = pendingRows_;
      bytes = pendingBytes_;
    } else {
      row.number = ++enqueued_;
      ++pendingRows_;
      pendingBytes_ += row.size;
      if (queue_.empty()) queuedSince_ = std::chrono::steady_clock::now();
      queue_.push_back(std::move(row));
      // The writer sleeps on an empty queue or while a group gathers; while it writes
      // or pauses after a failure it picks the rows up by itself.
      wake = queue_.size() == 1 || queue_.size() == options_.groupRows;
    }
  }
  if (logOverflow) {
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, "LocalStore::enqueue",
           "%s: writer queue full, refusing rows (%llu rows, %llu bytes pending)", path_.c_str(),
           static_cast<unsigned long long>(rows), static_cast<unsigned long long>(bytes));
    return false;
  }
  if (wake) wake_.notify_one();
  return true;
}

std::optional<std::int64_t> LocalStore::insertTelemetrySession(const Dictionary& sessionInfo,
                                                               const Dictionary& userInfo, double createdAt) {
  if (!usable()) return refuse(), std::nullopt;
  Row row;
  row.kind = Row::Kind::Session;
  row.id = nextSessionId_.fetch_add(1);
  row.t1 = jsonObject(sessionInfo);
  row.t2 = jsonObject(userInfo);
  row.at = createdAt;
  const std::int64_t id = row.id;
  if (!enqueue(std::move(row))) return std::nullopt;
  return id;
}

bool LocalStore::setBackends(std::int64_t sessionId, const std::optional<std::vector<std::string>>& backends) {
  Row row;
  row.kind = Row::Kind::Backends;
  row.id = sessionId;
  if (backends) {
    Array names;
    names.reserve(backends->size());
    for (const auto& name : *backends) names.emplace_back(name);
    row.hasId = true;
    row.t1 = toJson(Value(std::move(names)), JsonMode::Lenient).value_or("[]");
  }
  return enqueue(std::move(row));
}

bool LocalStore::setFlushed(std::int64_t sessionId, double flushedAt) {
  Row row;
  row.kind = Row::Kind::Flushed;
  row.id = sessionId;
  row.at = flushedAt;
  return enqueue(std::move(row));
}

bool LocalStore::insertTelemetryMessage(std::optional<std::int64_t> session, const Dictionary* sessionInfo,
                                        const Dictionary* userInfo, std::int64_t category, std::int64_t type,
                                        const Dictionary& payload, double sentAt) {
  if (!usable()) return refuse();
  Row row;
  row.kind = Row::Kind::Message;
  row.hasId = session.has_value();
  row.id = session.value_or(0);
  if (!session) {
    row.t1 = sessionInfo ? jsonObject(*sessionInfo) : "{}";
    row.t2 = userInfo ? jsonObject(*userInfo) : "{}";
  }
  row.a = category;
  row.b = type;
  row.t3 = jsonObject(payload);
  row.at = sentAt;
  return enqueue(std::move(row));
}

bool LocalStore::insertAnalyticsEvent(std::string_view name, const Dictionary& payload, double at) {
  if (!usable()) return refuse();
  Row row;
  row.kind = Row::Kind::Analytics;
  row.t1 = std::string(name);
  row.t2 = jsonObject(payload);
  row.at = at;
  return enqueue(std::move(row));
}

bool LocalStore::insertEnergyEvent(std::int64_t client, std::string_view name, const Dictionary& payload,
                                   double at) {
  if (!usable()) return refuse();
  Row row;
  row.kind = Row::Kind::Energy;
  row.a = client;
  row.t1 = std::string(name);
  row.t2 = jsonObject(payload);
  row.at = at;
  return enqueue(std::move(row));
}

std::uint64_t LocalStore::handedOver() const {
  MutexLock lock(mutex_);
  return enqueued_;
}

bool LocalStore::flush(std::chrono::milliseconds timeout, std::uint64_t since) {
  if (!usable()) return false;
  MutexLock lock(mutex_);
  const std::uint64_t target = enqueued_;
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (processedRows_ < target)
    if (lock.waitUntil(processed_, deadline) == std::cv_status::timeout && processedRows_ < target) return false;
  return !droppedAfter(since, target);
}

StoreStatus LocalStore::status() const {
  MutexLock lock(mutex_);
  return StoreStatus{pendingRows_, pendingBytes_,     refusedRows_, droppedBadRows_,
                     writeErrors_, quotaDroppedRows_, lastError_,  usable()};
}

void LocalStore::close() {
  {
    MutexLock lock(mutex_);
    if (closed_) return;
    closed_ = true;
    stopping_ = true;
    giveUpAt_ = std::chrono::steady_clock::now() + options_.closeTimeout;
  }
  wake_.notify_all();
  if (writer_.joinable()) writer_.join();
  usable_.store(false, std::memory_order_release);
  finalizeDatabase();
}

void LocalStore::noteDropped(std::uint64_t first, std::uint64_t last) {
  if (!dropped_.empty() && dropped_.back().second + 1 == first) {
    dropped_.back().second = last;
    return;
  }
  dropped_.emplace_back(first, last);
  if (dropped_.size() > kMaxDropRanges) {
    // A flush reaching back this far is told it lost rows, which it may have.
    const auto half = dropped_.begin() + kMaxDropRanges / 2;
    forgottenDrops_ = std::prev(half)->second;
    dropped_.erase(dropped_.begin(), half);
  }
}

bool LocalStore::droppedAfter(std::uint64_t since, std::uint64_t upTo) const {
  if (forgottenDrops_ > since) return true;
  return std::ranges::any_of(dropped_, [&](const auto& r) { return r.second > since && r.first <= upTo; });
}

void LocalStore::finishBatch(std::vector<Row>& batch, bool dropAll) {
  std::uint64_t bytes = 0;
  for (const Row& row : batch) {
    bytes += row.size;
    if (row.bad) ++droppedBadRows_;
    if (row.bad || dropAll) noteDropped(row.number, row.number);
  }
  processedRows_ = batch.back().number;
  pendingRows_ -= batch.size();
  pendingBytes_ -= bytes;
  batch.clear();
  if (overflowing_ && pendingRows_ <= options_.maxPendingRows / 2 && pendingBytes_ <= options_.maxPendingBytes / 2)
    overflowing_ = false;
  processed_.notify_all();
}

void LocalStore::writerLoop() {
  // Rows taken from the queue and not yet committed; after a failure the next
  // attempt adds whatever arrived meanwhile, keeping the order.
  std::vector<Row> batch;
  std::string badError;        // why the first of the batch's bad rows was refused
  std::uint64_t failures = 0;  // consecutive failed attempts
  std::chrono::milliseconds delay{0};
  bool cacheHeld = false;  // pages cached since the last release
  MutexLock lock(mutex_);
  for (;;) {
    if (failures == 0) {
      // A writer that has gone quiet gives its page cache back: the rows it wrote
      // are in the file, and a burst of sends should not cost memory for ever.
      if (cacheHeld) {
        const auto quietUntil = std::chrono::steady_clock::now() + options_.releaseCacheAfter;
        while (!stopping_ && queue_.empty() && lock.waitUntil(wake_, quietUntil) == std::cv_status::no_timeout) {
        }
      }
      if (cacheHeld && !stopping_ && queue_.empty()) {
        // So are the row vectors, which keep the capacity of the largest burst.
        std::vector<Row>().swap(queue_);
        std::vector<Row>().swap(batch);
        lock.unlock();
        sqlite3_db_release_memory(db_);
        // glibc keeps what is freed. Quiet store, quiet daemon: the payloads a stopped
        // session kept for its summary and the cache just let go go back to the system.
        malloc_trim(0);
        lock.lock();
        cacheHeld = false;
      }
      while (!stopping_ && queue_.empty()) lock.wait(wake_);
      const auto until = queuedSince_ + options_.groupWindow;
      while (!stopping_ && queue_.size() < options_.groupRows &&
             lock.waitUntil(wake_, until) == std::cv_status::no_timeout) {
      }
    } else {
      // Only close() cuts the pause short, for one attempt at once.
      const bool wasStopping = stopping_;
      const auto until = std::chrono::steady_clock::now() + delay;
      while (stopping_ == wasStopping && lock.waitUntil(wake_, until) == std::cv_status::no_timeout) {
      }
    }
    if (batch.empty()) {
      batch.swap(queue_);
    } else {
      std::move(queue_.begin(), queue_.end(), std::back_inserter(batch));
      queue_.clear();
    }
    if (batch.empty()) break;  // stopping, all written
    const bool giveUp = stopping_ && std::chrono::steady_clock::now() >= giveUpAt_;
    lock.unlock();

    std::string error;
    const bool ok = writeBatch(batch, &error, &badError);
    cacheHeld = true;
    if (ok && options_.maxStoreBytes > 0) enforceQuota();
    if (ok) {
      if (const auto bad = std::ranges::count(batch, true, &Row::bad); bad > 0) {
        VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, "LocalStore::writerLoop",
               "%s: dropping %zu of %zu rows, refused by the database (%s)", path_.c_str(),
               static_cast<std::size_t>(bad), batch.size(), badError.c_str());
      }
      if (failures > 0) {
        VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Default, "LocalStore::writerLoop",
               "%s: written after %llu failed attempts", path_.c_str(), static_cast<unsigned long long>(failures));
      }
      failures = 0;
    } else if (giveUp) {
      VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, "LocalStore::writerLoop",
             "%s: write failed again, dropping %zu rows (%s)", path_.c_str(), batch.size(), error.c_str());
      failures = 0;
    } else {
      if (failures == 0) {
        VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, "LocalStore::writerLoop",
               "%s: write failed, retrying until it succeeds (%s)", path_.c_str(), error.c_str());
      }
      ++failures;
      delay = failures == 1 ? options_.retryDelay : std::min(delay * 2, options_.maxRetryDelay);
    }

    lock.lock();
    if (!ok) {
      ++writeErrors_;
      lastError_ = error;
    }
    if (ok || giveUp) {
      if (!badError.empty()) lastError_ = badError;
      badError.clear();
      finishBatch(batch, !ok);
    }
  }
}

void LocalStore::enforceQuota() {
  const QuotaPass pass = enforceStoreQuota(db_, options_.maxStoreBytes);
  const std::uint64_t deleted = pass.forwarded + pass.unforwarded;
  if (deleted == 0 && pass.error.empty()) return;
  {
    MutexLock lock(mutex_);
    quotaDroppedRows_ += deleted;
    if (!pass.error.empty()) lastError_ = pass.error;
  }
  VR_LOG(logger_, LogScope::DefaultLog, pass.error.empty() ? LogLevel::Default : LogLevel::Error,
         "LocalStore::enforceQuota",
         "%s: %lld bytes in use, over MaxStoreBytes=%lld: deleted %llu rows already forwarded and %llu not "
         "forwarded, %lld bytes in use now%s%s",
         path_.c_str(), static_cast<long long>(pass.usedBefore), static_cast<long long>(options_.maxStoreBytes),
         static_cast<unsigned long long>(pass.forwarded), static_cast<unsigned long long>(pass.unforwarded),
         static_cast<long long>(pass.usedAfter), pass.error.empty() ? "" : "; stopped: ", pass.error.c_str());
}

bool LocalStore::writeBatch(std::vector<Row>& batch, std::string* error, std::string* badError) {
  auto fail = [&] {
    *error = sqlite3_errmsg(db_);
    if (!sqlite3_get_autocommit(db_)) exec("ROLLBACK");
    return false;
  };
  for (;;) {
    if (!exec("BEGIN IMMEDIATE")) return fail();
    bool restart = false;
    for (Row& row : batch) {
      if (row.bad) continue;
      const int rc = writeRow(row, error);
      if (rc == SQLITE_DONE) continue;
      if (!aboutTheRow(rc)) {
        if (!sqlite3_get_autocommit(db_)) exec("ROLLBACK");
        return false;
      }
      row.bad = true;
      if (badError->empty()) *badError = *error;
      // Such an error normally undoes only its own statement; should it have
      // ended the transaction, start over without the row.
      if (sqlite3_get_autocommit(db_)) {
        restart = true;
        break;
      }
    }
    if (restart) continue;
    if (exec("COMMIT")) return true;
    return fail();
  }
}

int LocalStore::writeRow(const Row& row, std::string* error) {
  sqlite3_stmt* s = nullptr;
  int rc = SQLITE_OK;
  // The first failed bind stands for the row: its text may be over the length limit.
  auto bound = [&rc](int r) {
    if (rc == SQLITE_OK) rc = r;
  };
  switch (row.kind) {
    case Row::Kind::Session:
      s = statements_[kInsertSession];
      bound(sqlite3_bind_int64(s, 1, row.id));
      bound(bindText(s, 2, row.t1));
      bound(bindText(s, 3, row.t2));
      bound(sqlite3_bind_double(s, 4, row.at));
      break;
    case Row::Kind::Backends:
      s = statements_[kSetBackends];
      bound(sqlite3_bind_int64(s, 1, row.id));
      bound(row.hasId ? bindText(s, 2, row.t1) : sqlite3_bind_null(s, 2));
      break;
    case Row::Kind::Flushed:
      s = statements_[kSetFlushed];
      bound(sqlite3_bind_int64(s, 1, row.id));
      bound(sqlite3_bind_double(s, 2, row.at));
      break;
    case Row::Kind::Message:
      s = statements_[kInsertMessage];
      // A session's message; otherwise a one-shot one, which alone carries the info.
      if (row.hasId) {
        bound(sqlite3_bind_int64(s, 1, row.id));
        bound(sqlite3_bind_null(s, 2));
        bound(sqlite3_bind_null(s, 3));
      } else {
        bound(sqlite3_bind_null(s, 1));
        bound(bindText(s, 2, row.t1));
        bound(bindText(s, 3, row.t2));
      }
      bound(sqlite3_bind_int64(s, 4, row.a));
      bound(sqlite3_bind_int64(s, 5, row.b));
      bound(bindText(s, 6, row.t3));
      bound(sqlite3_bind_double(s, 7, row.at));
      break;
    case Row::Kind::Analytics:
      s = statements_[kInsertAnalytics];
      bound(bindText(s, 1, row.t1));
      bound(bindText(s, 2, row.t2));
      bound(sqlite3_bind_double(s, 3, row.at));
      break;
    case Row::Kind::Energy:
      s = statements_[kInsertEnergy];
      bound(sqlite3_bind_int64(s, 1, row.a));
      bound(bindText(s, 2, row.t1));
      bound(bindText(s, 3, row.t2));
      bound(sqlite3_bind_double(s, 4, row.at));
      break;
  }
  if (rc == SQLITE_OK) rc = sqlite3_step(s);
  if (rc != SQLITE_DONE) *error = sqlite3_errmsg(db_);
  sqlite3_reset(s);
  return rc;
}

}  // namespace vireo::linux_platform
