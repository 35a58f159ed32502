// Read-only queries of the local store for analysts: sessions, messages,
// analytics and energy events.
#pragma once

#include <cstdint>
#include <cstdio>
#include <optional>
#include <string>
#include <vector>

namespace vireo::ctl {

struct StoreQuery {
  std::string table;  // sessions, messages, analytics, energy
  std::string db;     // path of vireo.db
  std::optional<std::int64_t> session;
  std::optional<std::string> name;  // shell pattern
  std::optional<double> since, until;
  std::optional<std::int64_t> limit;
  bool json = false;
};

bool isStoreCommand(const std::string& word);
// Parses the words after the table name; nothing and error on a usage error.
std::optional<StoreQuery> parseStoreQuery(const std::string& table, const std::vector<std::string>& args,
                                          std::string* error);
// The SQL text; parameters ?1 name, ?2 session, ?3 since, ?4 until, ?5 limit.
std::string storeSql(const StoreQuery& q);
// Exit status: 0 ok, 1 when the store cannot be read.
int runStoreQuery(const StoreQuery& q, std::FILE* out, std::FILE* err);

}  // namespace vireo::ctl
