// Runs protocol operations one after another on one client connection, which is
// what keeps the sessions alive between them.
#pragma once

#include <cstdio>
#include <deque>
#include <map>
#include <string>

#include <nlohmann/json.hpp>

#include "ctl/arguments.h"
#include "vireo/client.h"

namespace vireo::ctl {

// The daemon's status as a few readable lines.
std::string formatStatus(const Dictionary& status);

class Runner {
 public:
  Runner(client::Client& client, bool json, std::FILE* out, std::FILE* err)
      : client_(client), json_(json), out_(out), err_(err) {}

  // False when the operation failed (its error has been printed).
  bool run(const Operation& op);
  // Prints the answers of pending starts that have arrived.
  void reportArrivedStarts();

 private:
  bool fail(const Operation& op, const client::Error& e);
  void print(const std::string& text, const nlohmann::ordered_json& line);
  bool waitStart(const Operation& op);

  client::Client& client_;
  bool json_;
  std::FILE* out_;
  std::FILE* err_;
  struct PendingStart {
    client::StartHandle handle;
    bool reported = false;  // its answer has been printed
  };
  // Starts not yet consumed by wait-start, oldest first per reporter ID.
  std::map<std::int64_t, std::deque<PendingStart>> pending_;
};

}  // namespace vireo::ctl
