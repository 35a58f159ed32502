#include "ctl/store_query.h"

#include <sqlite3.h>

#include <sys/stat.h>

#include <cmath>
#include <ctime>
#include <nlohmann/json.hpp>

#include "ctl/arguments.h"
#include "ctl/output.h"

namespace vireo::ctl {

namespace {

using nlohmann::json;

struct TableSpec {
  const char* word;
  const char* select;  // columns and FROM
  const char* idColumn;
  const char* sessionColumn;  // nullptr: --session not allowed
  const char* nameExpr;       // an SQL expression the pattern is matched against with GLOB
  const char* timeColumn;
};

// A JSON column read safely: NULL when the text is not JSON.
#define VR_JSON_FIELD(col, field) "(CASE WHEN json_valid(" col ") THEN json_extract(" col ", '$." field "') END)"

constexpr TableSpec kTables[] = {
    {"sessions",
     "SELECT id, session_info, user_info, backends, created_at, flushed_at FROM telemetry_sessions", "id", "id",
     "(" VR_JSON_FIELD("user_info", "client_name") " GLOB ?1 OR " VR_JSON_FIELD("user_info", "service_name") " GLOB ?1)",
     "created_at"},
    {"messages",
     "SELECT m.id AS id, m.session AS session, m.category AS category, m.type AS type, m.payload AS payload, "
     "m.sent_at AS sent_at, m.session_info AS session_info, m.user_info AS user_info "
     "FROM telemetry_messages m LEFT JOIN telemetry_sessions s ON s.id = m.session",
     "m.id", "m.session",
     "(COALESCE(" VR_JSON_FIELD("s.user_info", "client_name") ", " VR_JSON_FIELD("m.user_info", "client_name")
     ") GLOB ?1 OR COALESCE(" VR_JSON_FIELD("s.user_info", "service_name") ", " VR_JSON_FIELD("m.user_info", "service_name")
     ") GLOB ?1)",
     "m.sent_at"},
    {"analytics", "SELECT id, name, payload, at FROM analytics_events", "id", nullptr, "name GLOB ?1", "at"},
    {"energy", "SELECT id, client, name, payload, at FROM energy_events", "id", "client", "name GLOB ?1", "at"},
};

const TableSpec* findTable(const std::string& word) {
  for (const auto& t : kTables)
    if (word == t.word) return &t;
  return nullptr;
}

bool isJsonColumn(const std::string& name) {
  return name == "session_info" || name == "user_info" || name == "backends" || name == "payload";
}
bool isTimeColumn(const std::string& name) {
  return name == "created_at" || name == "flushed_at" || name == "sent_at" || name == "at";
}

json columnJson(sqlite3_stmt* st, int i, const std::string& name) {
  switch (sqlite3_column_type(st, i)) {
    case SQLITE_NULL: return nullptr;
    case SQLITE_INTEGER: return static_cast<std::int64_t>(sqlite3_column_int64(st, i));
    case SQLITE_FLOAT: return sqlite3_column_double(st, i);
    default: {
      const auto* p = reinterpret_cast<const char*>(sqlite3_column_text(st, i));
      std::string text = p ? p : "";
      if (isJsonColumn(name)) {
        json parsed = json::parse(text, nullptr, false);
        if (!parsed.is_discarded()) return parsed;
      }
      return text;
    }
  }
}

std::string columnText(sqlite3_stmt* st, int i, const std::string& name) {
  int type = sqlite3_column_type(st, i);
  if (type == SQLITE_NULL) return "-";
  if (isTimeColumn(name) && (type == SQLITE_FLOAT || type == SQLITE_INTEGER))
    return isoTime(sqlite3_column_double(st, i));
  const auto* p = reinterpret_cast<const char*>(sqlite3_column_text(st, i));
  return p ? p : "";
}

json rowJson(sqlite3_stmt* st) {
  json row = json::object();
  for (int i = 0, n = sqlite3_column_count(st); i < n; ++i) {
    std::string name = sqlite3_column_name(st, i);
    row[name] = columnJson(st, i, name);
  }
  return row;
}

std::string rowText(sqlite3_stmt* st) {
  std::string line;
  for (int i = 0, n = sqlite3_column_count(st); i < n; ++i) {
    std::string name = sqlite3_column_name(st, i);
    if (i > 0) line += "  ";
    line += name + "=" + columnText(st, i, name);
  }
  return line;
}

std::string dumpJson(const json& j, int indent = -1) {
  return j.dump(indent, ' ', false, json::error_handler_t::replace);
}

void bindQuery(sqlite3_stmt* st, const StoreQuery& q) {
  if (q.name) sqlite3_bind_text(st, 1, q.name->c_str(), -1, SQLITE_TRANSIENT);
  if (q.session) sqlite3_bind_int64(st, 2, *q.session);
  if (q.since) sqlite3_bind_double(st, 3, *q.since);
  if (q.until) sqlite3_bind_double(st, 4, *q.until);
  if (q.limit) sqlite3_bind_int64(st, 5, *q.limit);
  if (q.after) sqlite3_bind_int64(st, 6, *q.after);
}

}  // namespace

std::string isoTime(double t) {
  auto secs = static_cast<time_t>(std::floor(t));
  int millis = static_cast<int>(std::lround((t - std::floor(t)) * 1000));
  if (millis == 1000) {
    ++secs;
    millis = 0;
  }
  std::tm tm{};
  gmtime_r(&secs, &tm);
  char buf[64];
  std::snprintf(buf, sizeof buf, "%04d-%02d-%02dT%02d:%02d:%02d.%03dZ", tm.tm_year + 1900, tm.tm_mon + 1,
                tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec, millis);
  return buf;
}

bool isStoreCommand(const std::string& word) { return findTable(word) != nullptr; }

std::optional<StoreQuery> parseStoreQuery(const std::string& table, const std::vector<std::string>& args,
                                          std::string* error) {
  StoreQuery q;
  q.table = table;
  const TableSpec* entry = findTable(table);
  auto fail = [&](std::string text) {
    if (error) *error = table + ": " + text;
    return std::nullopt;
  };
  if (!entry) return fail("unknown store table");
  for (size_t i = 0; i < args.size(); ++i) {
    std::string flag = args[i];
    std::string value;
    bool inlineValue = false;
    if (auto eq = flag.find('='); flag.rfind("--", 0) == 0 && eq != std::string::npos) {
      value = flag.substr(eq + 1);
      flag = flag.substr(0, eq);
      inlineValue = true;
    }
    if (flag == "--json") {
      q.json = true;
      continue;
    }
    if (!inlineValue) {
      if (i + 1 >= args.size()) return fail(flag + " needs a value");
      value = args[++i];
    }
    if (flag == "--session") {
      if (!entry->sessionColumn) return fail("--session does not apply to " + table);
      auto id = parseInt64(value);
      if (!id) return fail("bad --session '" + value + "'");
      q.session = *id;
    } else if (flag == "--name") {
      q.name = value;
    } else if (flag == "--since" || flag == "--until") {
      auto t = parseTime(value);
      if (!t) return fail("bad time '" + value + "' (Unix seconds or ISO 8601)");
      (flag == "--since" ? q.since : q.until) = *t;
    } else if (flag == "--limit") {
      auto n = parseInt64(value);
      if (!n || *n < 0) return fail("bad --limit '" + value + "'");
      q.limit = *n;
    } else if (flag == "--db") {
      q.db = value;
    } else {
      return fail("unknown option " + flag);
    }
  }
  return q;
}

std::string storeSql(const StoreQuery& q) {
  const TableSpec* entry = findTable(q.table);
  std::string sql = entry->select;
  std::vector<std::string> where;
  if (q.name) where.push_back(entry->nameExpr);
  if (q.session) where.push_back(std::string(entry->sessionColumn) + " = ?2");
  if (q.since) where.push_back(std::string(entry->timeColumn) + " >= ?3");
  if (q.until) where.push_back(std::string(entry->timeColumn) + " <= ?4");
  if (q.after) where.push_back(std::string(entry->idColumn) + " > ?6");
  for (size_t i = 0; i < where.size(); ++i) sql += (i == 0 ? " WHERE " : " AND ") + where[i];
  // The last N rows, shown oldest first.
  sql += std::string(" ORDER BY ") + entry->idColumn + (q.limit ? " DESC LIMIT ?5" : " ASC");
  if (q.limit) sql = "SELECT * FROM (" + sql + ") ORDER BY id ASC";
  return sql;
}

int runStoreQuery(const StoreQuery& q, std::FILE* out, std::FILE* err) {
  auto storeError = [&](const std::string& message) {
    printError(err, q.json, {q.table, kStoreError, message, {}, 0});
    return 1;
  };
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(q.db.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
    std::string message = "cannot open the store " + q.db + ": " + (db ? sqlite3_errmsg(db) : "no memory");
    sqlite3_close(db);
    return storeError(message);
  }
  sqlite3_busy_timeout(db, 5000);
  std::string sql = storeSql(q);
  sqlite3_stmt* st = nullptr;
  if (sqlite3_prepare_v2(db, sql.c_str(), -1, &st, nullptr) != SQLITE_OK) {
    std::string message = "cannot query the store " + q.db + ": " + sqlite3_errmsg(db);
    sqlite3_close(db);
    return storeError(message);
  }
  bindQuery(st, q);
  json rows = json::array();
  int rc;
  while ((rc = sqlite3_step(st)) == SQLITE_ROW) {
    if (q.json) rows.push_back(rowJson(st));
    else std::fprintf(out, "%s\n", rowText(st).c_str());
  }
  std::string failure = rc == SQLITE_DONE ? "" : std::string("reading the store failed: ") + sqlite3_errmsg(db);
  sqlite3_finalize(st);
  sqlite3_close(db);
  if (!failure.empty()) return storeError(failure);
  if (q.json) std::fprintf(out, "%s\n", dumpJson(rows, 2).c_str());
  return 0;
}

std::vector<std::string> storeTables() {
  std::vector<std::string> words;
  for (const auto& t : kTables) words.emplace_back(t.word);
  return words;
}

StoreWatcher::StoreWatcher(std::string db, std::vector<std::string> tables)
    : path_(std::move(db)), tables_(std::move(tables)) {
  if (tables_.empty()) tables_ = storeTables();
}

StoreWatcher::~StoreWatcher() { close(); }

void StoreWatcher::close() {
  sqlite3_close(db_);
  db_ = nullptr;
}

bool StoreWatcher::open() {
  struct stat info {};
  if (::stat(path_.c_str(), &info) != 0) {
    // Gone (or not there yet): whatever appears at this path later is a new store.
    close();
    after_.clear();
    return false;
  }
  if (db_ && info.st_dev == device_ && info.st_ino == inode_) return true;
  close();
  after_.clear();
  if (sqlite3_open_v2(path_.c_str(), &db_, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
    close();
    return false;
  }
  sqlite3_busy_timeout(db_, 1000);
  device_ = info.st_dev;
  inode_ = info.st_ino;
  return true;
}

int StoreWatcher::poll(std::FILE* out, bool asJson) {
  const bool first = firstPoll_;
  firstPoll_ = false;
  if (!open()) return 0;
  int printed = 0;
  for (const auto& table : tables_) {
    StoreQuery q;
    q.table = table;
    auto cursor = after_.find(table);
    if (cursor != after_.end()) q.after = cursor->second;
    if (first) q.limit = 1;  // only where the table ends
    sqlite3_stmt* st = nullptr;
    // A table the daemon has not created yet is simply empty for now.
    if (sqlite3_prepare_v2(db_, storeSql(q).c_str(), -1, &st, nullptr) != SQLITE_OK) continue;
    bindQuery(st, q);
    std::int64_t last = cursor != after_.end() ? cursor->second : 0;
    while (sqlite3_step(st) == SQLITE_ROW) {
      last = sqlite3_column_int64(st, 0);
      // Rows already there when the watch began are history, not news.
      if (first) continue;
      if (asJson) {
        json row{{"table", table}};
        row.update(rowJson(st));
        std::fprintf(out, "%s\n", dumpJson(row).c_str());
      } else {
        std::fprintf(out, "%s: %s\n", table.c_str(), rowText(st).c_str());
      }
      ++printed;
    }
    sqlite3_finalize(st);
    after_[table] = last;
  }
  if (printed) std::fflush(out);
  return printed;
}

}  // namespace vireo::ctl
