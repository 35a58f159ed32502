// The store's disk quota (MaxStoreBytes= in telemetry.conf). Once the pages in use
// pass it, rows go until the store is back under nine tenths of it: first rows the
// forwarder has sent (oldest first, table by table; sessions still open stay, since
// their flush is yet to be sent), then the oldest rows not sent, whichever table holds
// the oldest. Each table's newest row always stays: the next ids follow it, and the
// forwarder's cursors rely on ids never coming back. What goes is added to
// store_dropped, in the same transaction as the delete.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace vireo::linux_platform {

struct QuotaPass {
  std::uint64_t forwarded = 0;    // deleted rows the forwarder had sent
  std::uint64_t unforwarded = 0;  // deleted rows it had not: lost to the fleet
  std::int64_t usedBefore = 0;
  std::int64_t usedAfter = 0;
  std::string error;  // why the pass stopped early, "" when it did not
};

// Bytes of the store's pages in use: the file less its free pages (which SQLite
// reuses before it grows the file).
std::int64_t storeUsedBytes(sqlite3* db);

// Deletes in transactions of at most kQuotaChunk rows per table, so that another
// writer (the forwarder) never waits long and little more goes than needed. Does
// nothing while under maxBytes.
inline constexpr int kQuotaChunk = 200;
QuotaPass enforceStoreQuota(sqlite3* db, std::int64_t maxBytes);

// "1048576", "512K", "64M", "1G" (powers of 1024); nothing for anything else.
std::optional<std::int64_t> parseByteSize(std::string_view text);

// MaxStoreBytes= of telemetry.conf at path: the default without the file or the key,
// 0 for no quota; a value that does not parse keeps the default and says why in problem.
inline constexpr std::int64_t kDefaultMaxStoreBytes = std::int64_t{128} << 20;
std::int64_t readMaxStoreBytes(const std::string& path, std::string* problem);

}  // namespace vireo::linux_platform
