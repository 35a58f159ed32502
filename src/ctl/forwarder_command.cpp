#include "ctl/forwarder_command.h"

#include <sqlite3.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <nlohmann/json.hpp>
#include <optional>
#include <sstream>

#include "ctl/output.h"
#include "ctl/store_query.h"

namespace vireo::ctl {

namespace {

using json = nlohmann::ordered_json;

constexpr const char* kForwardedTables[] = {"telemetry_sessions", "telemetry_messages", "analytics_events",
                                            "energy_events"};
constexpr const char* kChangesTable = "store_changes";
// What forwarder.json holds besides the per-table counts, shown as it is.
constexpr const char* kStatusFields[] = {"device",          "consent",         "updated_at",
                                         "last_success_at", "last_error",      "last_error_at",
                                         "failed_attempts", "next_attempt_at", "pruned_rows"};

class ReadOnlyStore {
 public:
  ~ReadOnlyStore() { sqlite3_close(db_); }

  bool open(const std::string& path, std::string* error) {
    if (sqlite3_open_v2(path.c_str(), &db_, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
      *error = "cannot open the store " + path + ": " + (db_ ? sqlite3_errmsg(db_) : "no memory");
      return false;
    }
    sqlite3_busy_timeout(db_, 5000);
    return true;
  }

  // The first column of the first row; fallback when there is no row.
  std::optional<std::int64_t> integer(const std::string& sql, const std::string& text, std::int64_t number,
                                      std::int64_t fallback, int column, std::string* error) {
    sqlite3_stmt* st = nullptr;
    if (sqlite3_prepare_v2(db_, sql.c_str(), -1, &st, nullptr) != SQLITE_OK) {
      *error = std::string("cannot read the store: ") + sqlite3_errmsg(db_);
      return std::nullopt;
    }
    sqlite3_bind_text(st, 1, text.c_str(), -1, SQLITE_TRANSIENT);
    sqlite3_bind_int64(st, 2, number);
    const int rc = sqlite3_step(st);
    std::optional<std::int64_t> value;
    if (rc == SQLITE_ROW) value = sqlite3_column_int64(st, column);
    else if (rc == SQLITE_DONE) value = fallback;
    else *error = std::string("cannot read the store: ") + sqlite3_errmsg(db_);
    sqlite3_finalize(st);
    return value;
  }

  // A store made before the forwarder, or never opened by it, lacks its tables.
  std::optional<bool> hasTable(const char* name, std::string* error) {
    auto n = integer("SELECT COUNT(*) FROM sqlite_master WHERE type = 'table' AND name = ?1", name, 0, 0, 0, error);
    if (!n) return std::nullopt;
    return *n > 0;
  }

 private:
  sqlite3* db_ = nullptr;
};

// Cursor, backlog and (for the four tables) dropped counts, by table.
std::optional<json> readTables(const std::string& path, std::string* error) {
  ReadOnlyStore store;
  if (!store.open(path, error)) return std::nullopt;
  auto cursors = store.hasTable("forward_state", error);
  auto dropped = cursors ? store.hasTable("store_dropped", error) : std::nullopt;
  auto changes = dropped ? store.hasTable(kChangesTable, error) : std::nullopt;
  if (!changes) return std::nullopt;
  json tables = json::object();
  auto add = [&](const char* name, bool isChangeLog) -> bool {
    std::optional<std::int64_t> cursor = 0, backlog = 0;
    if (*cursors) cursor = store.integer("SELECT value FROM forward_state WHERE name = ?1", name, 0, 0, 0, error);
    if (cursor && (!isChangeLog || *changes))
      backlog = store.integer(std::string("SELECT COUNT(*) FROM \"") + name + "\" WHERE " +
                                  (isChangeLog ? "seq" : "id") + " > ?2",
                              "", *cursor, 0, 0, error);
    if (!cursor || !backlog) return false;
    json entry{{"cursor", *cursor}, {"backlog", *backlog}};
    if (!isChangeLog) {
      std::optional<std::int64_t> forwarded = 0, unforwarded = 0;
      if (*dropped) {
        const char* sql = "SELECT forwarded, unforwarded FROM store_dropped WHERE tbl = ?1";
        forwarded = store.integer(sql, name, 0, 0, 0, error);
        unforwarded = forwarded ? store.integer(sql, name, 0, 0, 1, error) : std::nullopt;
        if (!unforwarded) return false;
      }
      entry["dropped"] = {{"forwarded", *forwarded}, {"unforwarded", *unforwarded}};
    }
    tables[name] = std::move(entry);
    return true;
  };
  for (const char* name : kForwardedTables)
    if (!add(name, false)) return std::nullopt;
  if (!add(kChangesTable, true)) return std::nullopt;
  return tables;
}

// forwarder.json, or null when the forwarder has not written one.
std::optional<json> readStatus(const std::string& path, std::string* error) {
  std::ifstream in(path);
  if (!in) {
    if (errno == ENOENT) return json(nullptr);
    *error = "cannot read " + path + ": " + std::strerror(errno);
    return std::nullopt;
  }
  json status = json::parse(in, nullptr, false);
  if (!status.is_object()) {
    *error = path + " is not a JSON object";
    return std::nullopt;
  }
  return status;
}

std::string timeText(const json& t, const char* never) {
  return t.is_number() ? isoTime(t.get<double>()) : never;
}

std::string formatText(const json& doc) {
  std::ostringstream out;
  auto line = [&](const char* label, const std::string& value) {
    out << label << std::string(14 - std::strlen(label), ' ') << value << "\n";
  };
  line("forwarder", doc["configured"].get<bool>() ? "configured (" + doc["config_file"].get<std::string>() + ")"
                                                  : "not configured (no " + doc["config_file"].get<std::string>() + ")");
  if (doc["status_file"].is_null()) {
    line("status", "the forwarder has not run (no forwarder.json)");
  } else {
    line("status", doc["status_file"].get<std::string>() + ", updated " + timeText(doc["updated_at"], "never"));
    if (doc["device"].is_string()) line("device", doc["device"].get<std::string>());
    if (doc["consent"].is_boolean())
      line("consent", doc["consent"].get<bool>() ? "yes" : "no (disable_reporting): nothing is sent");
    line("last success", timeText(doc["last_success_at"], "never"));
    line("last error", doc["last_error"].is_string()
                           ? timeText(doc["last_error_at"], "?") + ": " + doc["last_error"].get<std::string>()
                           : "none");
    if (doc["failed_attempts"].is_number() && doc["failed_attempts"].get<double>() > 0)
      line("failed passes", doc["failed_attempts"].dump());
    line("next attempt", timeText(doc["next_attempt_at"], "none scheduled"));
  }
  line("store", doc["store"].get<std::string>());
  char row[160];
  std::snprintf(row, sizeof row, "\n%-20s %10s %10s %18s %20s\n", "TABLE", "CURSOR", "BACKLOG", "DROPPED-FORWARDED",
                "DROPPED-UNFORWARDED");
  out << row;
  for (const auto& [name, t] : doc["tables"].items()) {
    const bool counts = t.contains("dropped");
    std::snprintf(row, sizeof row, "%-20s %10lld %10lld %18s %20s\n", name.c_str(), t["cursor"].get<long long>(),
                  t["backlog"].get<long long>(), counts ? t["dropped"]["forwarded"].dump().c_str() : "-",
                  counts ? t["dropped"]["unforwarded"].dump().c_str() : "-");
    out << row;
  }
  return out.str();
}

}  // namespace

int runForwarder(ForwarderPaths paths, const std::vector<std::string>& args, bool asJson, std::FILE* out,
                 std::FILE* err) {
  for (const auto& a : args)
    if (a == "--json") asJson = true;
  for (size_t i = 0; i < args.size(); ++i) {
    if (args[i] == "--json") continue;
    if (args[i] == "--db" && i + 1 < args.size()) {
      paths.db = args[++i];
    } else if (args[i].starts_with("--db=")) {
      paths.db = args[i].substr(5);
    } else {
      return usageError(err, asJson, "usage: vireoctl forwarder [--json] [--db PATH]", "forwarder");
    }
  }
  std::string error;
  auto tables = readTables(paths.db, &error);
  if (!tables) {
    printError(err, asJson, {"forwarder", kStoreError, error, {}, 0});
    return 1;
  }
  auto status = readStatus(paths.status, &error);
  if (!status) {
    printError(err, asJson, {"forwarder", kForwarderError, error, {}, 0});
    return 1;
  }
  struct stat st {};
  json doc{{"configured", ::stat(paths.config.c_str(), &st) == 0},
           {"config_file", paths.config},
           {"store", paths.db},
           {"status_file", status->is_null() ? json(nullptr) : json(paths.status)}};
  for (const char* field : kStatusFields)
    doc[field] = status->is_object() && status->contains(field) ? (*status)[field] : json(nullptr);
  doc["tables"] = std::move(*tables);
  const std::string text =
      asJson ? doc.dump(2, ' ', false, json::error_handler_t::replace) + "\n" : formatText(doc);
  std::fputs(text.c_str(), out);
  return 0;
}

}  // namespace vireo::ctl
