// vireoctl: the command-line client of the reporting service.
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <ctime>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <iostream>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "base/value.h"
#include "ctl/arguments.h"
#include "ctl/defaults_command.h"
#include "ctl/forwarder_command.h"
#include "ctl/output.h"
#include "ctl/runner.h"
#include "ctl/store_query.h"
#include "platform/linux/paths.h"
#include "vireo/client.h"

namespace {

using namespace vireo;

constexpr const char* kHelp = R"(usage: vireoctl [OPTIONS] OPERATION [ARGS...] [-- OPERATION [ARGS...]]...
       vireoctl [OPTIONS] - | script          operations from standard input, one per line
       vireoctl [OPTIONS] defaults read [KEY] | write KEY VALUE... | delete KEY
       vireoctl [OPTIONS] sessions|messages|analytics|energy [FILTERS]   rows of the store
       vireoctl [OPTIONS] watch [TABLE...] [--db PATH]   new rows of the store, until Ctrl-C
       vireoctl [OPTIONS] forwarder [--db PATH]   what vireo-forwarder has sent and what waits

A reporting session lives only as long as the connection of the client that made it,
so all operations of one invocation run in order on one connection. Separate them
with a lone "--" on the command line, or give one per line in script mode ('#' starts
a comment, quotes group words).

Operations (com.orvane.vireo.Reporting1 unless said otherwise):
  create ID                      CreateReportingSession
  set-service-type ID TYPE       SetServiceType
  service-type ID                GetServiceNameForReporterID (prints the type number)
  configure ID KEY=VALUE...      SetConfiguration
  start ID [--wait|--no-wait]    StartReportingSessionForID. The service answers when the
                                 session stops. Default: send and print the answer once it
                                 arrives; --wait blocks until then; --no-wait asks for none.
  wait-start ID [TIMEOUT]        wait for the answer of an earlier start of ID
  send [--to ID,ID|--to-none|--broadcast] CATEGORY TYPE [KEY=VALUE...]
                                 SendMessage (default --broadcast; --to-none: an empty list)
  stop ID                        StopReportingSessionForID
  destroy ID                     DestroyReportingSession
  valid ID                       ReporterIDValid
  list                           GetAllReporters
  kill                           KillService (the service exits with status 2)
  ping                           org.freedesktop.DBus.Peer.Ping of the service
  sleep SECONDS                  pause (start answers are still printed)

Commands of their own (each alone on its command line):
  status                         GetStatus of com.orvane.vireo.Debug1: clients, sessions,
                                 rows waiting for the store, limits hit
  orientation TEXT               SetInterfaceOrientation of com.orvane.vireo.Orientation1:
                                 normal, bottom-up, left-up, right-up or undefined
  notify [NAME]                  the Posted(NAME) signal of com.orvane.Notify1 (default
                                 com.orvane.vireo.reporting: the daemon reads the suite again)

Values of KEY=VALUE: 12 or 0x1f -> integer, 1.5 -> double, true/false -> boolean,
s:text -> the string "text" (use it for "s:12"), anything else -> string.
Numbers (IDs, categories, types) are decimal or 0x hexadecimal, e.g. 0x40000003.

Defaults suite com.orvane.vireo (CONFIGURATION_DIRECTORY/com.orvane.vireo.conf), edited
atomically; keys the daemon reads: disable_reporting (boolean), device_name. The daemon
sees a change after "vireoctl notify" or SIGHUP.

Store queries (read-only, STATE_DIRECTORY/vireo.db):
  --session ID   sessions: row id; messages: owning session; energy: client number
  --name GLOB    sessions, messages: client_name or service_name; analytics, energy: event name
  --since T, --until T   Unix seconds or ISO 8601 (2026-03-16T14:15:03Z; no zone means UTC)
  --limit N      the last N rows (oldest first)   --db PATH   another store file
watch prints each row added to the given tables (default: all four) as it lands, checking
every 200 ms, until SIGINT or SIGTERM (exit status 0). Rows already stored are not shown;
the file may appear later, or be replaced, and is followed from its first row then.

forwarder shows vireo-forwarder's state: whether CONFIGURATION_DIRECTORY/forwarder.conf
exists; from STATE_DIRECTORY/forwarder.json (written after each pass) the device, consent,
last success, last error and next attempt; and per table, read from the store, the cursor
(last id sent), the backlog (rows past it) and the rows the disk quota deleted, already
forwarded or not. A store the forwarder never opened shows cursor 0 and every row waiting.

Options:
  --json               JSON on standard output: one object per line for operations, notify,
                       orientation, defaults write/delete and watch; one document for status,
                       defaults read, forwarder and store queries (an array of rows). Errors
                       are then one JSON object per line on standard error:
                       {"op":"send","error":{"name":"...","message":"..."}} (plus "domain" and
                       "code" for the reporting-disabled error); without --json they are text.
  --bus system|session the bus to use (default: VIREO_BUS, else system for root,
                       session otherwise)
  --address ADDRESS    connect to this D-Bus address instead
  --timeout SECONDS    timeout of each call (default 25)
  -h, --help           this text
  --version            the version

Environment:
  VIREO_BUS, DBUS_SESSION_BUS_ADDRESS, DBUS_SYSTEM_BUS_ADDRESS   which bus, and where
  CONFIGURATION_DIRECTORY, STATE_DIRECTORY   the defaults suite's and the store's directories.
                       Unset, they are /etc/vireo and /var/lib/vireo for root, else the user's
                       ~/.config/vireo and ~/.local/state/vireo (XDG_CONFIG_HOME, XDG_STATE_HOME),
                       as the daemon has them.

Exit status: 0 success, 1 an operation failed, 2 usage error.
)";

struct Options {
  bool json = false;
  client::BusKind bus = client::BusKind::Default;
  std::string address;
  double timeout = 25;
};

// Where the daemon keeps its files: the same rules it follows itself (a trial daemon
// started by scripts/run.sh has its directories in the line that script prints).
linux_platform::ServiceDirectories directories() {
  return linux_platform::ServiceDirectories::fromEnvironment();
}

client::Result<std::unique_ptr<client::Client>> connect(const Options& o) {
  auto c = o.address.empty() ? client::Client::connect(o.bus) : client::Client::connectAddress(o.address);
  if (c) (*c)->setCallTimeout(std::chrono::microseconds(static_cast<long long>(o.timeout * 1e6)));
  return c;
}

int connectionFailed(const Options& o, const std::string& op, const client::Error& e) {
  ctl::printError(stderr, o.json, {op, e.name, e.message, e.domain, e.code});
  return 1;
}

int runOperations(const Options& o, const std::vector<ctl::Operation>& ops) {
  auto c = connect(o);
  if (!c) return connectionFailed(o, ops.front().name, c.error());
  ctl::Runner runner(**c, o.json, stdout, stderr);
  for (const auto& op : ops)
    if (!runner.run(op)) return 1;
  return 0;
}

int runScript(const Options& o) {
  auto c = connect(o);
  if (!c) return connectionFailed(o, "script", c.error());
  ctl::Runner runner(**c, o.json, stdout, stderr);
  std::string line;
  int number = 0;
  while (std::getline(std::cin, line)) {
    ++number;
    std::string error;
    auto words = ctl::splitLine(line, &error);
    if (!words) return ctl::usageError(stderr, o.json, "line " + std::to_string(number) + ": " + error);
    if (words->empty()) continue;
    auto op = ctl::parseOperation(*words, &error);
    if (!op) return ctl::usageError(stderr, o.json, "line " + std::to_string(number) + ": " + error);
    if (!runner.run(*op)) return 1;
  }
  return 0;
}

// Takes --json out of a command's own words.
std::vector<std::string> takeJson(std::vector<std::string> words, Options& o) {
  std::erase_if(words, [&](const std::string& w) { return w == "--json" && (o.json = true); });
  return words;
}

void printJsonLine(const nlohmann::ordered_json& j) {
  std::printf("%s\n", j.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace).c_str());
}

volatile std::sig_atomic_t gInterrupted = 0;
extern "C" void onInterrupt(int) { gInterrupted = 1; }

int runWatch(Options o, const std::vector<std::string>& args) {
  std::vector<std::string> tables;
  std::string db;
  auto words = takeJson(args, o);
  for (size_t i = 0; i < words.size(); ++i) {
    const std::string& w = words[i];
    if (w == "--db" && i + 1 < words.size()) {
      db = words[++i];
    } else if (w.rfind("--db=", 0) == 0) {
      db = w.substr(5);
    } else if (ctl::isStoreCommand(w)) {
      tables.push_back(w);
    } else {
      return ctl::usageError(stderr, o.json,
                             "expected sessions, messages, analytics, energy or --db PATH, got '" + w + "'", "watch");
    }
  }
  if (db.empty()) db = directories().state + "/vireo.db";
  struct sigaction action {};
  action.sa_handler = onInterrupt;
  sigemptyset(&action.sa_mask);
  sigaction(SIGINT, &action, nullptr);  // no SA_RESTART: the signal cuts the pause short
  sigaction(SIGTERM, &action, nullptr);
  ctl::StoreWatcher watcher(db, tables);
  bool saidWaiting = false;
  while (!gInterrupted) {
    watcher.poll(stdout, o.json);
    if (!watcher.isOpen() && !saidWaiting && !o.json)
      std::fprintf(stderr, "vireoctl: watch: waiting for %s to appear\n", db.c_str());
    saidWaiting = !watcher.isOpen();
    timespec pause{0, 200'000'000};
    nanosleep(&pause, nullptr);
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  std::vector<std::string> args(argv + 1, argv + argc);
  Options o;
  // Usage errors are JSON too when --json is anywhere among the options.
  for (const auto& a : args) {
    if (a == "--") break;
    if (a == "--json") o.json = true;
  }
  auto usage = [&](const std::string& text) { return ctl::usageError(stderr, o.json, text); };
  size_t i = 0;
  for (; i < args.size(); ++i) {
    const std::string& a = args[i];
    auto value = [&]() -> std::optional<std::string> {
      if (i + 1 >= args.size()) return std::nullopt;
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
      auto v = value();
      if (v == "system") o.bus = client::BusKind::System;
      else if (v == "session") o.bus = client::BusKind::Session;
      else return usage("--bus needs system or session");
    } else if (a == "--address") {
      auto v = value();
      if (!v) return usage("--address needs an address");
      o.address = *v;
    } else if (a == "--timeout") {
      auto v = value();
      auto t = v ? ctl::parseDouble(*v) : std::nullopt;
      if (!t || !(*t > 0 && *t < 1e9)) return usage("--timeout needs a positive number of seconds");
      o.timeout = *t;
    } else if (a == "-" || a.rfind("--", 0) != 0) {
      break;
    } else {
      return usage("unknown option " + a);
    }
  }
  if (i >= args.size()) return usage("no operation given");
  const std::string command = args[i];
  std::vector<std::string> rest(args.begin() + static_cast<long>(i) + 1, args.end());

  if (command == "help") {
    std::fputs(kHelp, stdout);
    return 0;
  }
  if (command == "-" || command == "script") {
    if (!rest.empty()) return usage("script mode takes no arguments");
    return runScript(o);
  }
  if (command == "defaults")
    return ctl::runDefaults(directories().configuration + "/com.orvane.vireo.conf", rest, o.json, stdout, stderr);
  if (command == "notify") {
    rest = takeJson(rest, o);
    if (rest.size() > 1) return usage("notify takes one name");
    std::string name = rest.empty() ? client::kReportingNotification : rest[0];
    auto c = connect(o);
    client::Status s = c ? (*c)->postNotification(name) : client::Status(c.error());
    if (!s) return connectionFailed(o, "notify", s.error());
    if (o.json) printJsonLine({{"op", "notify"}, {"name", name}});
    return 0;
  }
  if (command == "status") {
    rest = takeJson(rest, o);
    if (!rest.empty()) return usage("status takes only --json");
    auto c = connect(o);
    auto status = c ? (*c)->getStatus() : client::Result<Dictionary>(c.error());
    if (!status) return connectionFailed(o, "status", status.error());
    std::fputs(o.json ? (toJson(Value(*status), JsonMode::Lenient, true).value_or("{}") + "\n").c_str()
                      : ctl::formatStatus(*status).c_str(),
               stdout);
    return 0;
  }
  if (command == "orientation") {
    rest = takeJson(rest, o);
    if (rest.size() != 1) return usage("orientation takes one orientation text");
    auto c = connect(o);
    client::Status s = c ? (*c)->setInterfaceOrientation(rest[0]) : client::Status(c.error());
    if (!s) return connectionFailed(o, "orientation", s.error());
    if (o.json) printJsonLine({{"op", "orientation"}, {"orientation", rest[0]}});
    return 0;
  }
  if (command == "watch") return runWatch(o, rest);
  if (command == "forwarder") {
    const auto d = directories();
    return ctl::runForwarder({d.state + "/vireo.db", d.state + "/forwarder.json", d.configuration + "/forwarder.conf"},
                             rest, o.json, stdout, stderr);
  }
  if (ctl::isStoreCommand(command)) {
    std::string error;
    auto q = ctl::parseStoreQuery(command, rest, &error);
    if (!q) return ctl::usageError(stderr, o.json || std::count(rest.begin(), rest.end(), "--json"), error, command);
    q->json = q->json || o.json;
    if (q->db.empty()) q->db = directories().state + "/vireo.db";
    return ctl::runStoreQuery(*q, stdout, stderr);
  }

  std::vector<std::string> words(args.begin() + static_cast<long>(i), args.end());
  std::vector<ctl::Operation> ops;
  for (const auto& opWords : ctl::splitSequence(words)) {
    std::string error;
    auto op = ctl::parseOperation(opWords, &error);
    if (!op) return usage(error);
    ops.push_back(std::move(*op));
  }
  if (ops.empty()) return usage("no operation given");
  return runOperations(o, ops);
}
