// vireoctl: the command-line client of the reporting service.
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstring>
#include <iostream>
#include <string>
#include <vector>

#include "ctl/arguments.h"
#include "ctl/defaults_command.h"
#include "ctl/runner.h"
#include "base/value.h"
#include "ctl/store_query.h"
#include "platform/linux/paths.h"
#include "vireo/client.h"

namespace {

using namespace vireo;

constexpr const char* kHelp = R"(usage: vireoctl [OPTIONS] OPERATION [ARGS...] [-- OPERATION [ARGS...]]...
       vireoctl [OPTIONS] -            (or: script) operations from standard input, one per line
       vireoctl defaults read [KEY] | write KEY VALUE | delete KEY
       vireoctl notify [NAME]          (default com.orvane.vireo.reporting)
       vireoctl status [--json]        the daemon's live state: clients, sessions, store, limits hit
       vireoctl orientation TEXT       report the interface orientation (normal, bottom-up,
                                       left-up, right-up, undefined), as the shell does
       vireoctl sessions|messages|analytics|energy [FILTERS] [--json]

A reporting session lives only as long as the connection of the client that made it,
so all operations of one invocation run in order on one connection. Separate them
with a lone "--" on the command line, or give one per line in script mode ('#' starts
a comment, quotes group words).

Operations:
  create ID                      CreateReportingSession
  set-service-type ID TYPE       SetServiceType
  service-type ID                GetServiceNameForReporterID (prints the type number)
  configure ID KEY=VALUE...      SetConfiguration
  start ID [--wait|--no-wait]    StartReportingSessionForID. The service answers when the
                                 session stops. Default: send and print the answer once it
                                 arrives; --wait blocks until then; --no-wait asks for no answer.
  wait-start ID [TIMEOUT]        wait for the answer of an earlier start of ID
  send [--to ID,ID|--to-none|--broadcast] CATEGORY TYPE [KEY=VALUE...]
                                 SendMessage (default --broadcast; --to-none sends an empty list)
  stop ID                        StopReportingSessionForID
  destroy ID                     DestroyReportingSession
  valid ID                       ReporterIDValid
  list                           GetAllReporters
  kill                           KillService (the service exits with status 2)
  ping                           org.freedesktop.DBus.Peer.Ping of the service
  sleep SECONDS                  pause (start answers are still printed)

Values of KEY=VALUE: 12 or 0x1f -> integer, 1.5 -> double, true/false -> boolean,
s:text -> the string "text" (use it for "s:12"), anything else -> string.
Numbers (IDs, categories, types) are decimal or 0x hexadecimal, e.g. 0x40000003.

Store queries (read-only, STATE_DIRECTORY/vireo.db):
  --session ID   sessions: row id; messages: owning session; energy: client number
  --name GLOB    sessions, messages: client_name or service_name; analytics, energy: event name
  --since T, --until T   Unix seconds or ISO 8601 (2026-03-16T14:15:03Z; no zone means UTC)
  --limit N      the last N rows (oldest first)   --db PATH   another store file

Options:
  --json               JSON output: one object per operation line; an array for store queries
  --bus system|session the bus to use (default: VIREO_BUS, else system for root, session otherwise)
  --address ADDRESS    connect to this D-Bus address instead
  --timeout SECONDS    timeout of each call (default 25)
  -h, --help           this text
  --version            the version

Exit status: 0 success, 1 an operation failed, 2 usage error.
)";

struct Options {
  bool json = false;
  client::BusKind bus = client::BusKind::Default;
  std::string address;
  double timeout = 25;
};

int usageError(const std::string& text) {
  std::fprintf(stderr, "vireoctl: %s\n(see vireoctl --help)\n", text.c_str());
  return 2;
}

client::Result<std::unique_ptr<client::Client>> connect(const Options& o) {
  auto c = o.address.empty() ? client::Client::connect(o.bus) : client::Client::connectAddress(o.address);
  if (c) (*c)->setCallTimeout(std::chrono::microseconds(static_cast<long long>(o.timeout * 1e6)));
  return c;
}

int runOperations(const Options& o, const std::vector<ctl::Operation>& ops) {
  auto c = connect(o);
  if (!c) {
    std::fprintf(stderr, "vireoctl: %s: %s\n", c.error().name.c_str(), c.error().message.c_str());
    return 1;
  }
  ctl::Runner runner(**c, o.json, stdout, stderr);
  for (const auto& op : ops)
    if (!runner.run(op)) return 1;
  return 0;
}

int runScript(const Options& o) {
  auto c = connect(o);
  if (!c) {
    std::fprintf(stderr, "vireoctl: %s: %s\n", c.error().name.c_str(), c.error().message.c_str());
    return 1;
  }
  ctl::Runner runner(**c, o.json, stdout, stderr);
  std::string line;
  int number = 0;
  while (std::getline(std::cin, line)) {
    ++number;
    std::string error;
    auto words = ctl::splitLine(line, &error);
    if (!words) return usageError("line " + std::to_string(number) + ": " + error);
    if (words->empty()) continue;
    auto op = ctl::parseOperation(*words, &error);
    if (!op) return usageError("line " + std::to_string(number) + ": " + error);
    if (!runner.run(*op)) return 1;
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  std::vector<std::string> args(argv + 1, argv + argc);
  Options o;
  size_t i = 0;
  for (; i < args.size(); ++i) {
    const std::string& a = args[i];
    auto value = [&](const char* what) -> std::optional<std::string> {
      if (i + 1 >= args.size()) return std::nullopt;
      (void)what;
      return args[++i];
    };
    if (a == "-h" || a == "--help") {
      std::fputs(kHelp, stdout);
      return 0;
    } else if (a == "--version") {
      std::printf("vireoctl 0.1.0\n");
      return 0;
    } else if (a == "--json") {
      o.json = true;
    } else if (a == "--bus") {
      auto v = value("--bus");
      if (v == "system") o.bus = client::BusKind::System;
      else if (v == "session") o.bus = client::BusKind::Session;
      else return usageError("--bus needs system or session");
    } else if (a == "--address") {
      auto v = value("--address");
      if (!v) return usageError("--address needs an address");
      o.address = *v;
    } else if (a == "--timeout") {
      auto v = value("--timeout");
      auto t = v ? ctl::parseDouble(*v) : std::nullopt;
      if (!t || *t <= 0) return usageError("--timeout needs a positive number of seconds");
      o.timeout = *t;
    } else if (a == "-" || a.rfind("--", 0) != 0) {
      break;
    } else {
      return usageError("unknown option " + a);
    }
  }
  if (i >= args.size()) return usageError("no operation given");
  const std::string command = args[i];
  std::vector<std::string> rest(args.begin() + static_cast<long>(i) + 1, args.end());

  if (command == "-" || command == "script") {
    if (!rest.empty()) return usageError("script mode takes no arguments");
    return runScript(o);
  }
  if (command == "defaults") {
    auto dirs = linux_platform::ServiceDirectories::fromEnvironment();
    return ctl::runDefaults(dirs.configuration + "/com.orvane.vireo.conf", rest, o.json, stdout, stderr);
  }
  if (command == "notify") {
    if (rest.size() > 1) return usageError("notify takes one name");
    std::string name = rest.empty() ? client::kReportingNotification : rest[0];
    auto c = connect(o);
    client::Status s = c ? (*c)->postNotification(name) : client::Status(c.error());
    if (!s) {
      std::fprintf(stderr, "vireoctl: notify: %s: %s\n", s.error().name.c_str(), s.error().message.c_str());
      return 1;
    }
    if (o.json) std::printf("{\"op\":\"notify\",\"name\":\"%s\"}\n", name.c_str());
    return 0;
  }
  if (command == "status") {
    for (const auto& a : rest) {
      if (a != "--json") return usageError("status takes only --json");
      o.json = true;
    }
    auto c = connect(o);
    auto status = c ? (*c)->getStatus() : client::Result<Dictionary>(c.error());
    if (!status) {
      std::fprintf(stderr, "vireoctl: status: %s: %s\n", status.error().name.c_str(), status.error().message.c_str());
      return 1;
    }
    std::fputs(o.json ? (toJson(Value(*status), JsonMode::Lenient, true).value_or("{}") + "\n").c_str()
                      : ctl::formatStatus(*status).c_str(),
               stdout);
    return 0;
  }
  if (command == "orientation") {
    if (rest.size() != 1) return usageError("orientation takes one orientation text");
    auto c = connect(o);
    client::Status s = c ? (*c)->setInterfaceOrientation(rest[0]) : client::Status(c.error());
    if (!s) {
      std::fprintf(stderr, "vireoctl: orientation: %s: %s\n", s.error().name.c_str(), s.error().message.c_str());
      return 1;
    }
    if (o.json) std::printf("{\"op\":\"orientation\",\"orientation\":\"%s\"}\n", rest[0].c_str());
    return 0;
  }
  if (ctl::isStoreCommand(command)) {
    std::string error;
    auto q = ctl::parseStoreQuery(command, rest, &error);
    if (!q) return usageError(error);
    q->json = q->json || o.json;
    if (q->db.empty()) q->db = linux_platform::ServiceDirectories::fromEnvironment().state + "/vireo.db";
    return ctl::runStoreQuery(*q, stdout, stderr);
  }

  std::vector<std::string> words(args.begin() + static_cast<long>(i), args.end());
  std::vector<ctl::Operation> ops;
  for (const auto& opWords : ctl::splitSequence(words)) {
    std::string error;
    auto op = ctl::parseOperation(opWords, &error);
    if (!op) return usageError(error);
    ops.push_back(std::move(*op));
  }
  if (ops.empty()) return usageError("no operation given");
  return runOperations(o, ops);
}
