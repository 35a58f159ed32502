// A prepared SQLite statement that finalizes itself. A failed prepare or bind makes
// every later step fail with SQLITE_ERROR, so a chain of binds needs one check.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <string>
#include <string_view>

namespace vireo::linux_platform {

class SqliteStatement {
 public:
  SqliteStatement(sqlite3* db, const std::string& sql) {
    ok_ = sqlite3_prepare_v2(db, sql.c_str(), -1, &s_, nullptr) == SQLITE_OK;
  }
  ~SqliteStatement() { sqlite3_finalize(s_); }
  SqliteStatement(const SqliteStatement&) = delete;
  SqliteStatement& operator=(const SqliteStatement&) = delete;
  bool ok() const { return ok_; }
  SqliteStatement& bind(int i, std::int64_t v) {
    ok_ = ok_ && sqlite3_bind_int64(s_, i, v) == SQLITE_OK;
    return *this;
  }
  SqliteStatement& bind(int i, double v) {
    ok_ = ok_ && sqlite3_bind_double(s_, i, v) == SQLITE_OK;
    return *this;
  }
  SqliteStatement& bind(int i, std::string_view v) {
    ok_ = ok_ && sqlite3_bind_text64(s_, i, v.data(), v.size(), SQLITE_TRANSIENT, SQLITE_UTF8) == SQLITE_OK;
    return *this;
  }
  // SQLITE_ROW, SQLITE_DONE or an error.
  int step() { return ok_ ? sqlite3_step(s_) : SQLITE_ERROR; }
  sqlite3_stmt* get() const { return s_; }

 private:
  sqlite3_stmt* s_ = nullptr;
  bool ok_ = false;
};

}  // namespace vireo::linux_platform
