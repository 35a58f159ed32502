// Helpers shared by the store's tests: a temporary directory, a logger that keeps
// its lines, and a second connection that reads the file.
#pragma once

#include <sqlite3.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/logger.h"

namespace vireo::linux_platform::testing {

class TempDir {
 public:
  TempDir() {
    std::string pattern = (std::filesystem::temp_directory_path() / "vireo-store-XXXXXX").string();
    path_ = ::mkdtemp(pattern.data()) ? pattern : std::string();
  }
  ~TempDir() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  const std::string& path() const { return path_; }
  std::string sub(const std::string& name) const { return path_ + "/" + name; }
  void write(const std::string& name, const std::string& text) const { std::ofstream(sub(name)) << text; }

 private:
  std::string path_;
};

class RecordingLogger : public Logger {
 public:
  bool verbose(LogScope) const override { return true; }
  void write(LogScope, LogLevel level, const char*, int, const char*, std::string_view message) override {
    std::lock_guard lock(mutex_);
    if (level == LogLevel::Error) errors_.emplace_back(message);
  }
  std::vector<std::string> errors() const {
    std::lock_guard lock(mutex_);
    return errors_;
  }

 private:
  mutable std::mutex mutex_;  // guards errors_
  std::vector<std::string> errors_;
};

using Row = std::vector<std::optional<std::string>>;

// An independent reader of the store's file, as another process would see it.
class Reader {
 public:
  explicit Reader(const std::string& path) { sqlite3_open_v2(path.c_str(), &db_, SQLITE_OPEN_READWRITE, nullptr); }
  ~Reader() { sqlite3_close(db_); }
  Reader(const Reader&) = delete;
  Reader& operator=(const Reader&) = delete;

  std::vector<Row> query(const std::string& sql) const {
    std::vector<Row> rows;
    sqlite3_stmt* s = nullptr;
    if (sqlite3_prepare_v2(db_, sql.c_str(), -1, &s, nullptr) != SQLITE_OK) return rows;
    while (sqlite3_step(s) == SQLITE_ROW) {
      Row row;
      for (int i = 0; i < sqlite3_column_count(s); ++i) {
        const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(s, i));
        row.push_back(text ? std::optional<std::string>(text) : std::nullopt);
      }
      rows.push_back(std::move(row));
    }
    sqlite3_finalize(s);
    return rows;
  }
  // The first column of the first row, "" when there is none or it is NULL.
  std::string scalar(const std::string& sql) const {
    auto rows = query(sql);
    return rows.empty() || rows[0].empty() || !rows[0][0] ? std::string() : *rows[0][0];
  }
  bool exec(const std::string& sql) const { return sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, nullptr) == SQLITE_OK; }

 private:
  sqlite3* db_ = nullptr;
};

}  // namespace vireo::linux_platform::testing
