#include "forwarder/forward_store.h"

#include <sys/stat.h>

#include <ctime>
#include <nlohmann/json.hpp>

#include "platform/linux/store/change_log.h"
#include "platform/linux/store/sqlite_statement.h"

namespace vireo::forwarder {

namespace {

using Json = nlohmann::json;

// A missing session id before a newer row is waited for this long: the daemon hands
// out session ids before their rows queue for its writer, so a row may be committed
// just after a newer one. A gap older than this is a row that was never stored.
constexpr double kSessionGapWait = 30;
// Rows deleted per pruning transaction.
constexpr int kPruneChunk = 500;

using Statement = linux_platform::SqliteStatement;

Json columnValue(sqlite3_stmt* s, int i, const ForwardedColumn& column) {
  if (sqlite3_column_type(s, i) == SQLITE_NULL) {
    if (column.nullable) return nullptr;
    return column.type == ColumnType::Text ? Json("") : Json(0);
  }
  switch (column.type) {
    case ColumnType::Integer: return sqlite3_column_int64(s, i);
    case ColumnType::Real: return sqlite3_column_double(s, i);
    case ColumnType::Text: break;
  }
  const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(s, i));
  return std::string(text ? text : "", static_cast<std::size_t>(sqlite3_column_bytes(s, i)));
}

// One JSONEachRow line from the statement's current row: id at first, the table's
// columns from first on.
void appendRow(std::string& body, sqlite3_stmt* s, int first, const ForwardedTable& table, std::string_view device,
               std::int64_t version) {
  Json row = Json::object();
  row["device"] = device;
  row["id"] = static_cast<std::uint64_t>(sqlite3_column_int64(s, first - 1));
  for (std::size_t i = 0; i < table.columns.size(); ++i)
    row[table.columns[i].name] = columnValue(s, first + static_cast<int>(i), table.columns[i]);
  row["version"] = static_cast<std::uint64_t>(version);
  // Invalid UTF-8 in a text column is sent replaced rather than holding the table back.
  body += row.dump(-1, ' ', false, Json::error_handler_t::replace);
  body += '\n';
}

std::string columnList(const ForwardedTable& table) {
  std::string out;
  for (const auto& c : table.columns) out += std::string(", s.\"") + c.name + "\"";
  return out;
}

const ForwardedTable& sessionsTable() { return forwardedTables().front(); }

}  // namespace

const std::vector<ForwardedTable>& forwardedTables() {
  using enum ColumnType;
  static const std::vector<ForwardedTable> tables = {
      {"telemetry_sessions",
       "COALESCE(flushed_at, created_at)",
       {{"session_info", Text, false},
        {"user_info", Text, false},
        {"backends", Text, true},
        {"created_at", Real, false},
        {"flushed_at", Real, true}}},
      {"telemetry_messages",
       "sent_at",
       {{"session", Integer, true},
        {"session_info", Text, true},
        {"user_info", Text, true},
        {"category", Integer, false},
        {"type", Integer, false},
        {"payload", Text, false},
        {"sent_at", Real, false}}},
      {"analytics_events", "at", {{"name", Text, false}, {"payload", Text, false}, {"at", Real, false}}},
      {"energy_events",
       "at",
       {{"client", Integer, false}, {"name", Text, false}, {"payload", Text, false}, {"at", Real, false}}},
  };
  return tables;
}

ForwardStore::~ForwardStore() { sqlite3_close(db_); }

std::unique_ptr<ForwardStore> ForwardStore::open(const std::string& path, std::string* error) {
  error->clear();
  struct stat st {};
  if (::stat(path.c_str(), &st) != 0) return nullptr;  // the daemon has not stored anything yet
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
    *error = path + ": " + (db ? sqlite3_errmsg(db) : "cannot open");
    sqlite3_close(db);
    return nullptr;
  }
  std::unique_ptr<ForwardStore> store(new ForwardStore(db));
  sqlite3_busy_timeout(db, 5000);
  Statement tables(db, "SELECT COUNT(*) FROM sqlite_master WHERE type = 'table' AND name IN "
                       "('telemetry_sessions', 'telemetry_messages', 'analytics_events', 'energy_events')");
  if (tables.step() != SQLITE_ROW) {
    store->fail(error, "cannot read the schema");
    return nullptr;
  }
  if (sqlite3_column_int(tables.get(), 0) != 4) return nullptr;  // being created by the daemon
  if (!store->exec("BEGIN IMMEDIATE", error)) return nullptr;
  if (!store->exec(linux_platform::kChangeLogSchema, error) || !store->exec("COMMIT", error)) {
    sqlite3_exec(db, "ROLLBACK", nullptr, nullptr, nullptr);
    *error = path + ": cannot add the change log: " + *error;
    return nullptr;
  }
  return store;
}

bool ForwardStore::exec(const char* sql, std::string* error) {
  if (sqlite3_exec(db_, sql, nullptr, nullptr, nullptr) == SQLITE_OK) return true;
  *error = sqlite3_errmsg(db_);
  return false;
}

bool ForwardStore::fail(std::string* error, const char* what) {
  *error = std::string("store: ") + what + ": " + sqlite3_errmsg(db_);
  return false;
}

bool ForwardStore::cursor(std::string_view name, std::int64_t* value, std::string* error) {
  Statement s(db_, "SELECT value FROM forward_state WHERE name = ?1");
  s.bind(1, name);
  const int rc = s.step();
  if (rc != SQLITE_ROW && rc != SQLITE_DONE) return fail(error, "cannot read the cursors");
  *value = rc == SQLITE_ROW ? sqlite3_column_int64(s.get(), 0) : 0;
  return true;
}

bool ForwardStore::raiseWatchMark(std::int64_t* mark, std::string* error) {
  std::int64_t newest = 0;
  {
    Statement s(db_, "SELECT COALESCE(MAX(id), 0) FROM telemetry_sessions");
    if (s.step() != SQLITE_ROW) return fail(error, "cannot read the sessions");
    newest = sqlite3_column_int64(s.get(), 0);
  }
  if (!cursor(linux_platform::kSessionsWatchedName, mark, error)) return false;
  if (newest <= *mark) return true;
  if (!commit(linux_platform::kSessionsWatchedName, newest, error)) return false;
  *mark = newest;
  return true;
}

bool ForwardStore::readRows(const ForwardedTable& table, std::int64_t after, std::int64_t upTo, std::int64_t limit,
                            std::string_view device, Batch* batch, std::string* error) {
  *batch = {};
  batch->last = after;
  Statement s(db_, std::string("SELECT s.id") + columnList(table) + " FROM \"" + table.name +
                       "\" AS s WHERE s.id > ?1 AND s.id <= ?2 ORDER BY s.id LIMIT ?3");
  s.bind(1, after).bind(2, upTo).bind(3, limit);
  const bool sessions = &table == &sessionsTable();
  const double gapsBefore = static_cast<double>(std::time(nullptr)) - kSessionGapWait;
  int rc;
  while ((rc = s.step()) == SQLITE_ROW) {
    const std::int64_t id = sqlite3_column_int64(s.get(), 0);
    // created_at is the fourth column of a session row.
    if (sessions && id != batch->last + 1 && sqlite3_column_double(s.get(), 4) > gapsBefore) break;
    appendRow(batch->body, s.get(), 1, table, device, 0);
    ++batch->rows;
    batch->last = id;
  }
  if (rc != SQLITE_ROW && rc != SQLITE_DONE) return fail(error, "cannot read rows");
  batch->entries = batch->rows;
  return true;
}

bool ForwardStore::readChanges(std::int64_t after, std::int64_t limit, std::string_view device, Batch* batch,
                               std::string* error) {
  *batch = {};
  batch->last = after;
  {
    Statement s(db_,
                "SELECT COUNT(*), COALESCE(MAX(seq), ?1) FROM "
                "(SELECT seq FROM store_changes WHERE seq > ?1 ORDER BY seq LIMIT ?2)");
    s.bind(1, after).bind(2, limit);
    if (s.step() != SQLITE_ROW) return fail(error, "cannot read the change log");
    batch->entries = sqlite3_column_int64(s.get(), 0);
    batch->last = sqlite3_column_int64(s.get(), 1);
  }
  if (batch->entries == 0) return true;
  // One statement, so each row is read after its last logged change. A row deleted
  // since is skipped.
  const ForwardedTable& table = sessionsTable();
  Statement s(db_, "SELECT MAX(c.seq), s.id" + columnList(table) +
                       " FROM store_changes AS c JOIN telemetry_sessions AS s ON s.id = c.row"
                       " WHERE c.tbl = 'telemetry_sessions' AND c.seq > ?1 AND c.seq <= ?2 GROUP BY s.id ORDER BY s.id");
  s.bind(1, after).bind(2, batch->last);
  int rc;
  while ((rc = s.step()) == SQLITE_ROW) {
    appendRow(batch->body, s.get(), 2, table, device, sqlite3_column_int64(s.get(), 0));
    ++batch->rows;
  }
  if (rc != SQLITE_DONE) return fail(error, "cannot read changed rows");
  return true;
}

bool ForwardStore::commit(std::string_view name, std::int64_t value, std::string* error) {
  if (!exec("BEGIN IMMEDIATE", error)) return fail(error, "cannot store a cursor");
  Statement set(db_,
                "INSERT INTO forward_state (name, value) VALUES (?1, ?2) "
                "ON CONFLICT (name) DO UPDATE SET value = excluded.value");
  set.bind(1, name).bind(2, value);
  bool ok = set.step() == SQLITE_DONE;
  if (ok && name == kChangesName) {
    Statement drop(db_, "DELETE FROM store_changes WHERE seq <= ?1");
    drop.bind(1, value);
    ok = drop.step() == SQLITE_DONE;
  }
  if (ok && exec("COMMIT", error)) return true;
  fail(error, "cannot store a cursor");
  if (!sqlite3_get_autocommit(db_)) sqlite3_exec(db_, "ROLLBACK", nullptr, nullptr, nullptr);
  return false;
}

bool ForwardStore::dropped(std::map<std::string, DroppedCount>* counts, std::string* error) {
  counts->clear();
  Statement s(db_, "SELECT tbl, forwarded, unforwarded FROM store_dropped");
  int rc;
  while ((rc = s.step()) == SQLITE_ROW) {
    const auto* name = reinterpret_cast<const char*>(sqlite3_column_text(s.get(), 0));
    (*counts)[name ? name : ""] = {sqlite3_column_int64(s.get(), 1), sqlite3_column_int64(s.get(), 2)};
  }
  if (rc != SQLITE_DONE) return fail(error, "cannot read the dropped counts");
  return true;
}

std::int64_t ForwardStore::backlog(std::string_view table, std::int64_t cursor) {
  const bool changes = table == kChangesName;
  Statement s(db_, std::string("SELECT COUNT(*) FROM \"") + std::string(table) + "\" WHERE " +
                       (changes ? "seq" : "id") + " > ?1");
  s.bind(1, cursor);
  return s.step() == SQLITE_ROW ? sqlite3_column_int64(s.get(), 0) : -1;
}

std::uint64_t ForwardStore::prune(double cutoff, const std::function<bool()>& cancelled, std::string* error) {
  std::uint64_t deleted = 0;
  for (const auto& table : forwardedTables()) {
    std::int64_t forwarded = 0;
    if (!cursor(table.name, &forwarded, error)) return deleted;
    // Among the oldest forwarded rows, those old enough; rows grow older with their
    // ids, so a chunk that is not all old ends the table's turn.
    Statement s(db_, std::string("DELETE FROM \"") + table.name + "\" WHERE id IN (SELECT id FROM \"" + table.name +
                         "\" WHERE id <= ?1 AND id < (SELECT MAX(id) FROM \"" + table.name +
                         "\") ORDER BY id LIMIT ?2) AND " + table.time + " < ?3");
    s.bind(1, forwarded).bind(2, static_cast<std::int64_t>(kPruneChunk)).bind(3, cutoff);
    while (!cancelled()) {
      if (s.step() != SQLITE_DONE) {
        fail(error, "cannot prune");
        return deleted;
      }
      const int n = sqlite3_changes(db_);
      deleted += static_cast<std::uint64_t>(n);
      sqlite3_reset(s.get());
      if (n < kPruneChunk) break;
      sqlite3_sleep(5);  // lets the daemon's writer in between chunks
    }
  }
  return deleted;
}

}  // namespace vireo::forwarder
