// The forwarder's side of the local store: reading rows past a cursor as ClickHouse
// JSONEachRow lines, the cursors in forward_state, the change log and pruning.
//
// Its own connection, with a busy timeout, and only short write transactions: the
// daemon's writer waits at most for one cursor update or one small delete.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace vireo::forwarder {

enum class ColumnType { Text, Integer, Real };

struct ForwardedColumn {
  const char* name;
  ColumnType type;
  bool nullable;
};

struct ForwardedTable {
  const char* name;
  const char* time;  // SQL for the row's age, for pruning
  std::vector<ForwardedColumn> columns;  // after id
};

// The four tables of the store, in the order a pass sends them.
const std::vector<ForwardedTable>& forwardedTables();
inline constexpr const char* kChangesName = "store_changes";
// The forward_state name of the dropped counts' total last sent.
inline constexpr const char* kDroppedName = "store_dropped";

// Rows of one table the daemon's disk quota deleted: already sent, or never.
struct DroppedCount {
  std::int64_t forwarded = 0;
  std::int64_t unforwarded = 0;
};

// Rows of one table (or of the change log) as JSONEachRow text.
struct Batch {
  std::string body;
  std::int64_t rows = 0;     // lines in body
  std::int64_t entries = 0;  // rows or change-log entries read
  std::int64_t last = 0;     // the cursor once body is stored: the last id or seq read
};

class ForwardStore {
 public:
  ~ForwardStore();
  ForwardStore(const ForwardStore&) = delete;
  ForwardStore& operator=(const ForwardStore&) = delete;

  // Opens an existing store written by the daemon; nothing, with error empty, when
  // there is no store yet.
  static std::unique_ptr<ForwardStore> open(const std::string& path, std::string* error);

  // forward_state's value for name, 0 when it has none.
  bool cursor(std::string_view name, std::int64_t* value, std::string* error);
  // The session rows the forwarder may read are those up to the watch mark, whose
  // later changes the store logs: raises it to the newest row.
  bool raiseWatchMark(std::int64_t* mark, std::string* error);
  // At most limit rows of table with after < id <= upTo, oldest first, version 0.
  bool readRows(const ForwardedTable& table, std::int64_t after, std::int64_t upTo, std::int64_t limit,
                std::string_view device, Batch* batch, std::string* error);
  // At most limit change-log entries past after: each changed row once, in its
  // current state, its version the seq of its last change.
  bool readChanges(std::int64_t after, std::int64_t limit, std::string_view device, Batch* batch, std::string* error);
  // Stores the cursor in one transaction; the change log's also deletes the entries it covers.
  bool commit(std::string_view name, std::int64_t value, std::string* error);
  // store_dropped, by table; tables without a row are left out.
  bool dropped(std::map<std::string, DroppedCount>* counts, std::string* error);
  // Rows (entries) past the cursor.
  std::int64_t backlog(std::string_view table, std::int64_t cursor);
  // Deletes forwarded rows older than cutoff in small transactions, keeping each
  // table's newest row, whose id the daemon continues from. Returns the rows deleted.
  std::uint64_t prune(double cutoff, const std::function<bool()>& cancelled, std::string* error);

 private:
  explicit ForwardStore(sqlite3* db) : db_(db) {}
  bool exec(const char* sql, std::string* error);
  bool fail(std::string* error, const char* what);

  sqlite3* db_;
};

}  // namespace vireo::forwarder
