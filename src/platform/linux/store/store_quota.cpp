#include "platform/linux/store/store_quota.h"

#include <algorithm>
#include <cctype>
#include <limits>
#include <utility>

#include "platform/linux/key_file.h"
#include "platform/linux/store/sqlite_statement.h"

namespace vireo::linux_platform {

namespace {

struct Table {
  const char* name;
  const char* time;  // the column that says how old a row is
};
// Messages first: they are the bulk, and a session row explains the messages that follow it.
constexpr Table kTables[] = {{"telemetry_messages", "sent_at"},
                             {"analytics_events", "at"},
                             {"energy_events", "at"},
                             {"telemetry_sessions", "created_at"}};

using Statement = SqliteStatement;

// The first column of the first row, or 0 when there is none (or it is NULL).
std::optional<std::int64_t> scalar(Statement& s) {
  const int rc = s.step();
  if (rc == SQLITE_DONE) return 0;
  if (rc != SQLITE_ROW) return std::nullopt;
  return sqlite3_column_type(s.get(), 0) == SQLITE_NULL ? 0 : sqlite3_column_int64(s.get(), 0);
}
std::optional<std::int64_t> scalar(Statement&& s) { return scalar(s); }

std::optional<std::int64_t> pragma(sqlite3* db, const char* name) {
  return scalar(Statement(db, std::string("PRAGMA ") + name));
}

// One transaction; its body returns the rows it deleted, or nothing on failure.
template <class Body>
std::optional<std::uint64_t> transaction(sqlite3* db, Body body) {
  if (sqlite3_exec(db, "BEGIN IMMEDIATE", nullptr, nullptr, nullptr) != SQLITE_OK) return std::nullopt;
  std::optional<std::uint64_t> deleted = body();
  if (deleted && sqlite3_exec(db, "COMMIT", nullptr, nullptr, nullptr) == SQLITE_OK) return deleted;
  if (!sqlite3_get_autocommit(db)) sqlite3_exec(db, "ROLLBACK", nullptr, nullptr, nullptr);
  return std::nullopt;
}

// Deletes up to one chunk of table's oldest rows with id <= upTo (open sessions
// spared when asked) and counts them under column. Nothing on failure.
std::optional<std::uint64_t> deleteChunk(sqlite3* db, const Table& t, std::int64_t upTo, bool spareOpenSessions,
                                         const char* column) {
  const std::string name = t.name;
  const bool spare = spareOpenSessions && name == "telemetry_sessions";
  Statement del(db, "DELETE FROM " + name + " WHERE id IN (SELECT id FROM " + name + " WHERE id <= ?1" +
                        (spare ? " AND flushed_at IS NOT NULL" : "") + " ORDER BY id LIMIT ?2)");
  if (del.bind(1, upTo).bind(2, std::int64_t{kQuotaChunk}).step() != SQLITE_DONE) return std::nullopt;
  const auto n = static_cast<std::uint64_t>(sqlite3_changes(db));
  if (n == 0) return n;
  Statement count(db, std::string("INSERT INTO store_dropped (tbl, ") + column + ") VALUES (?1, ?2) " +
                          "ON CONFLICT (tbl) DO UPDATE SET " + column + " = " + column + " + excluded." + column);
  if (count.bind(1, t.name).bind(2, static_cast<std::int64_t>(n)).step() != SQLITE_DONE) return std::nullopt;
  return n;
}

std::optional<std::int64_t> newestId(sqlite3* db, const Table& t) {
  return scalar(Statement(db, std::string("SELECT MAX(id) FROM ") + t.name));
}

// A round of rows already sent: one chunk from each table.
std::optional<std::uint64_t> deleteForwarded(sqlite3* db) {
  return transaction(db, [&]() -> std::optional<std::uint64_t> {
    std::uint64_t deleted = 0;
    for (const Table& t : kTables) {
      Statement cursorOf(db, "SELECT value FROM forward_state WHERE name = ?1");
      auto cursor = scalar(cursorOf.bind(1, t.name));
      auto newest = newestId(db, t);
      if (!cursor || !newest) return std::nullopt;
      const std::int64_t upTo = std::min(*cursor, *newest - 1);
      if (upTo <= 0) continue;
      auto n = deleteChunk(db, t, upTo, true, "forwarded");
      if (!n) return std::nullopt;
      deleted += *n;
    }
    return deleted;
  });
}

// A chunk of the oldest rows left, from the table whose first row is oldest.
std::optional<std::uint64_t> deleteOldest(sqlite3* db) {
  return transaction(db, [&]() -> std::optional<std::uint64_t> {
    const Table* oldest = nullptr;
    double oldestTime = 0;
    std::int64_t oldestUpTo = 0;
    for (const Table& t : kTables) {
      auto newest = newestId(db, t);
      if (!newest) return std::nullopt;
      Statement first(db, std::string("SELECT id, ") + t.time + " FROM " + t.name + " ORDER BY id LIMIT 1");
      const int rc = first.step();
      if (rc == SQLITE_DONE) continue;
      if (rc != SQLITE_ROW) return std::nullopt;
      if (sqlite3_column_int64(first.get(), 0) >= *newest) continue;  // only the newest row is left
      const double time = sqlite3_column_double(first.get(), 1);
      if (!oldest || time < oldestTime) {
        oldest = &t;
        oldestTime = time;
        oldestUpTo = *newest - 1;
      }
    }
    if (!oldest) return 0;
    return deleteChunk(db, *oldest, oldestUpTo, false, "unforwarded");
  });
}

}  // namespace

std::int64_t storeUsedBytes(sqlite3* db) {
  auto pages = pragma(db, "page_count"), free = pragma(db, "freelist_count"), size = pragma(db, "page_size");
  if (!pages || !free || !size) return 0;
  return (*pages - *free) * *size;
}

QuotaPass enforceStoreQuota(sqlite3* db, std::int64_t maxBytes) {
  QuotaPass pass;
  pass.usedBefore = pass.usedAfter = storeUsedBytes(db);
  if (maxBytes <= 0 || pass.usedBefore <= maxBytes) return pass;
  const std::int64_t target = maxBytes / 10 * 9;
  bool forwardedLeft = true;
  while (pass.usedAfter > target) {
    std::optional<std::uint64_t> n;
    if (forwardedLeft) {
      n = deleteForwarded(db);
      if (n && *n == 0) {
        forwardedLeft = false;
        continue;
      }
      if (n) pass.forwarded += *n;
    } else {
      n = deleteOldest(db);
      if (n && *n == 0) break;  // nothing left but each table's newest row
      if (n) pass.unforwarded += *n;
    }
    if (!n) {
      pass.error = sqlite3_errmsg(db);
      break;
    }
    pass.usedAfter = storeUsedBytes(db);
  }
  return pass;
}

std::optional<std::int64_t> parseByteSize(std::string_view text) {
  while (!text.empty() && std::isspace(static_cast<unsigned char>(text.front()))) text.remove_prefix(1);
  while (!text.empty() && std::isspace(static_cast<unsigned char>(text.back()))) text.remove_suffix(1);
  std::int64_t unit = 1;
  if (!text.empty()) {
    switch (std::toupper(static_cast<unsigned char>(text.back()))) {
      case 'K': unit = std::int64_t{1} << 10; break;
      case 'M': unit = std::int64_t{1} << 20; break;
      case 'G': unit = std::int64_t{1} << 30; break;
      case 'T': unit = std::int64_t{1} << 40; break;
      default: break;
    }
    if (unit != 1) text.remove_suffix(1);
  }
  if (text.empty()) return std::nullopt;
  std::int64_t value = 0;
  for (char c : text) {
    if (c < '0' || c > '9') return std::nullopt;
    if (value > (std::numeric_limits<std::int64_t>::max() - (c - '0')) / 10) return std::nullopt;
    value = value * 10 + (c - '0');
  }
  if (value > std::numeric_limits<std::int64_t>::max() / unit) return std::nullopt;
  return value * unit;
}

std::int64_t readMaxStoreBytes(const std::string& path, std::string* problem) {
  const auto file = readKeyFile(path);
  if (!file) return kDefaultMaxStoreBytes;
  const auto it = file->find("MaxStoreBytes");
  if (it == file->end()) return kDefaultMaxStoreBytes;
  if (auto bytes = parseByteSize(it->second)) return *bytes;
  *problem = "MaxStoreBytes=" + it->second + " is not a size (bytes, or a number with K, M, G or T): keeping " +
             std::to_string(kDefaultMaxStoreBytes);
  return kDefaultMaxStoreBytes;
}

}  // namespace vireo::linux_platform
