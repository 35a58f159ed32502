// Read-only queries of the local store for analysts: sessions, messages,
// analytics and energy events.
#pragma once

#include <cstdint>
#include <cstdio>
#include <map>
#include <optional>
#include <string>
#include <vector>

struct sqlite3;

namespace vireo::ctl {

struct StoreQuery {
  std::string table;  // sessions, messages, analytics, energy
  std::string db;     // path of vireo.db
  std::optional<std::int64_t> session;
  std::optional<std::string> name;  // shell pattern
  std::optional<double> since, until;
  std::optional<std::int64_t> limit;
  std::optional<std::int64_t> after;  // only rows with a greater id
  bool json = false;
};

bool isStoreCommand(const std::string& word);
// Parses the words after the table name; nothing and error on a usage error.
std::optional<StoreQuery> parseStoreQuery(const std::string& table, const std::vector<std::string>& args,
                                          std::string* error);
// The SQL text; parameters ?1 name, ?2 session, ?3 since, ?4 until, ?5 limit, ?6 after.
std::string storeSql(const StoreQuery& q);
// Exit status: 0 ok, 1 when the store cannot be read.
int runStoreQuery(const StoreQuery& q, std::FILE* out, std::FILE* err);
// sessions, messages, analytics, energy
std::vector<std::string> storeTables();
// Unix seconds as UTC ISO 8601 with milliseconds, as the store queries print times.
std::string isoTime(double unixSeconds);

// Follows a store file for new rows by row id, read-only. The file may not exist
// yet, and may be replaced (a new file starts over from its first row).
class StoreWatcher {
 public:
  // No tables: all of them.
  StoreWatcher(std::string db, std::vector<std::string> tables);
  ~StoreWatcher();
  StoreWatcher(const StoreWatcher&) = delete;
  StoreWatcher& operator=(const StoreWatcher&) = delete;

  // Prints the rows added since the last poll, one line each ("TABLE: col=value..."
  // or a JSON object with "table"); the first poll only notes where the store is.
  // Returns the number of rows printed.
  int poll(std::FILE* out, bool json);
  // True once the file has been opened.
  bool isOpen() const { return db_ != nullptr; }

 private:
  bool open();
  void close();

  std::string path_;
  std::vector<std::string> tables_;
  sqlite3* db_ = nullptr;
  unsigned long device_ = 0, inode_ = 0;
  bool firstPoll_ = true;
  std::map<std::string, std::int64_t> after_;  // per table: the last row id seen
};

}  // namespace vireo::ctl
