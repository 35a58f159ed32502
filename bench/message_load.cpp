// Message load: N clients send M messages of a 20-entry payload to started
// sessions, addressed and broadcast, synchronously and pipelined, and a message
// counts once its row is in the store. The same run measures two floors on the same
// bus with the same clients: org.freedesktop.DBus.Peer.Ping of the daemon, and a
// do-nothing method with the same signature and payload that this tool exports on a
// second connection of its own (bus + parse cost, no service logic).
#include <sqlite3.h>

#include <atomic>
#include <functional>
#include <memory>
#include <thread>
#include <vector>

#include "load_common.h"
#include "platform/dbus/send_message_arguments.h"
#include "platform/dbus/value_codec.h"
#include "platform/linux/paths.h"
#include "vireo/client.h"

namespace {

using namespace vireo;
using namespace std::chrono_literals;

constexpr const char* kUsage = R"(usage: message_load [--clients N] [--messages M] [--window W] [--address A] [--db PATH] [--pid PID]
  --clients N    client threads, each with its own connection (default 8)
  --messages M   messages per client and phase (default 500)
  --window W     calls in flight per client when pipelined (default 64)
  --address A    D-Bus address (default: VIREO_BUS, else system for root, session otherwise)
  --db PATH      the daemon's store (default STATE_DIRECTORY/vireo.db)
  --pid PID      the daemon's process (default: asked from the bus)
)";

constexpr const char* kBenchPath = "/com/orvane/vireo/Bench1";
constexpr const char* kBenchInterface = "com.orvane.vireo.Bench1";

Dictionary makePayload() {
  Dictionary d;
  for (int i = 0; i < 7; ++i) d.set(Value("string_" + std::to_string(i)), Value("value of entry " + std::to_string(i)));
  for (int i = 0; i < 7; ++i) d.set(Value("int_" + std::to_string(i)), Value(1234567890123LL * (i + 1)));
  for (int i = 0; i < 6; ++i) d.set(Value("double_" + std::to_string(i)), Value(3.14159 * (i + 1)));
  return d;
}

// Builds one call; the bus connection is the caller's.
using MakeCall = std::function<int(sd_bus*, sd_bus_message**)>;

int appendMessageArgs(sd_bus_message* m, const Dictionary& payload, bool addressed, std::int64_t id) {
  int r = dbus::appendStringDictionary(m, payload);
  if (r >= 0) r = sd_bus_message_append(m, "uqb", 0x40000003u, 1, addressed ? 1 : 0);
  if (r >= 0) r = sd_bus_message_append_array(m, 'x', &id, addressed ? sizeof id : 0);
  return r;
}

struct CallCount {
  std::uint64_t ok = 0;
  std::uint64_t failed = 0;
  std::string firstError;
};

struct Flight {
  std::uint64_t inflight = 0;
  CallCount* count;
};

int onReply(sd_bus_message* m, void* userdata, sd_bus_error*) {
  auto* f = static_cast<Flight*>(userdata);
  --f->inflight;
  if (sd_bus_message_is_method_error(m, nullptr)) {
    if (f->count->failed++ == 0) f->count->firstError = sd_bus_message_get_error(m)->name;
  } else {
    ++f->count->ok;
  }
  return 0;
}

// Makes count calls, one at a time (window 1) or with up to window in flight.
CallCount runCalls(sd_bus* bus, const MakeCall& make, std::uint64_t count, std::uint64_t window) {
  CallCount result;
  if (window <= 1) {
    for (std::uint64_t n = 0; n < count; ++n) {
      sd_bus_message* m = nullptr;
      sd_bus_error e = SD_BUS_ERROR_NULL;
      int r = make(bus, &m);
      if (r >= 0) r = sd_bus_call(bus, m, 0, &e, nullptr);
      if (r >= 0) ++result.ok;
      else if (result.failed++ == 0) result.firstError = e.name ? e.name : std::strerror(-r);
      sd_bus_error_free(&e);
      sd_bus_message_unref(m);
    }
    return result;
  }
  Flight flight{0, &result};
  std::uint64_t sent = 0;
  while (sent < count || flight.inflight > 0) {
    while (sent < count && flight.inflight < window) {
      sd_bus_message* m = nullptr;
      int r = make(bus, &m);
      if (r >= 0) r = sd_bus_call_async(bus, nullptr, m, onReply, &flight, 0);
      sd_bus_message_unref(m);
      ++sent;
      if (r < 0) {
        if (result.failed++ == 0) result.firstError = std::strerror(-r);
        continue;
      }
      ++flight.inflight;
    }
    int r = sd_bus_process(bus, nullptr);
    if (r < 0) break;
    if (r == 0) sd_bus_wait(bus, 1'000'000);
  }
  return result;
}

// The do-nothing method on a connection of its own, served by one thread like the
// daemon's bus thread.
class DiscardServer {
 public:
  explicit DiscardServer(const std::string& address) : bus_(bench::openBus(address)) {
    sd_bus_add_object_vtable(bus_, nullptr, kBenchPath, kBenchInterface, kVtable, nullptr);
    const char* name = nullptr;
    sd_bus_get_unique_name(bus_, &name);
    name_ = name ? name : "";
    thread_ = std::thread([this] {
      while (!stop_.load()) {
        int r = sd_bus_process(bus_, nullptr);
        if (r < 0) break;
        if (r == 0) sd_bus_wait(bus_, 100'000);
      }
    });
  }
  ~DiscardServer() {
    stop_ = true;
    thread_.join();
    sd_bus_flush_close_unref(bus_);
  }
  const std::string& name() const { return name_; }

 private:
  static int discard(sd_bus_message* m, void*, sd_bus_error* error) {
    dbus::SendMessageArguments args;
    int r = dbus::readSendMessageArguments(m, &args, error);
    return r < 0 ? r : sd_bus_reply_method_return(m, "");
  }
  static constexpr sd_bus_vtable kVtable[] = {
      SD_BUS_VTABLE_START(0),
      SD_BUS_METHOD("Discard", "a{sv}uqbax", "", discard, SD_BUS_VTABLE_UNPRIVILEGED),
      SD_BUS_VTABLE_END,
  };

  sd_bus* bus_;
  std::string name_;
  std::atomic<bool> stop_{false};
  std::thread thread_;
};

// Rows of telemetry_messages, read-only; -1 when the store cannot be read.
class StoreCounter {
 public:
  explicit StoreCounter(const std::string& path) {
    if (sqlite3_open_v2(path.c_str(), &db_, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
      sqlite3_close(db_);
      db_ = nullptr;
    } else {
      sqlite3_busy_timeout(db_, 1000);
    }
  }
  ~StoreCounter() { sqlite3_close(db_); }
  std::int64_t rows() {
    if (!db_) return -1;
    sqlite3_stmt* st = nullptr;
    std::int64_t n = -1;
    if (sqlite3_prepare_v2(db_, "SELECT COUNT(*) FROM telemetry_messages", -1, &st, nullptr) == SQLITE_OK &&
        sqlite3_step(st) == SQLITE_ROW)
      n = sqlite3_column_int64(st, 0);
    sqlite3_finalize(st);
    return n;
  }
  // Waits until the count stops moving, so leftovers of a phase do not count in the next.
  std::int64_t settle() {
    std::int64_t last = rows();
    for (int quiet = 0; quiet < 3;) {
      std::this_thread::sleep_for(150ms);
      std::int64_t now = rows();
      quiet = now == last ? quiet + 1 : 0;
      last = now;
    }
    return last;
  }

 private:
  sqlite3* db_ = nullptr;
};

struct Row {
  std::string what, mode;
  std::uint64_t accepted = 0, failed = 0;
  double acceptSeconds = 0, endSeconds = 0;
  std::int64_t stored = -1;  // rows stored in the phase, -1 without a store
  std::optional<double> cpuPerMessage;
  std::string firstError;
  double rate() const { return endSeconds > 0 ? static_cast<double>(accepted) / endSeconds : 0; }
};

// Runs one phase on every client connection at once.
Row runPhase(const std::string& what, const std::string& mode, std::vector<sd_bus*>& buses, std::uint64_t messages,
             std::uint64_t window, const std::function<MakeCall(size_t)>& makeFor, StoreCounter* store,
             std::optional<pid_t> pid) {
  Row row;
  row.what = what;
  row.mode = mode;
  std::int64_t base = store ? store->rows() : -1;
  std::optional<double> cpu0 = pid ? bench::cpuSeconds(*pid) : std::nullopt;
  std::vector<CallCount> counts(buses.size());
  bench::StartGate gate;
  std::vector<std::thread> threads;
  for (size_t i = 0; i < buses.size(); ++i)
    threads.emplace_back([&, i] {
      MakeCall make = makeFor(i);
      gate.wait();
      counts[i] = runCalls(buses[i], make, messages, window);
    });
  auto t0 = std::chrono::steady_clock::now();
  gate.open();
  for (auto& t : threads) t.join();
  row.acceptSeconds = bench::secondsSince(t0);
  for (const auto& c : counts) {
    row.accepted += c.ok;
    row.failed += c.failed;
    if (row.firstError.empty()) row.firstError = c.firstError;
  }
  row.endSeconds = row.acceptSeconds;
  if (store && base >= 0) {
    auto deadline = std::chrono::steady_clock::now() + std::max(10s, std::chrono::seconds(static_cast<long>(row.acceptSeconds * 5)));
    std::int64_t now = base;
    while ((now = store->rows()) - base < static_cast<std::int64_t>(row.accepted) &&
           std::chrono::steady_clock::now() < deadline)
      std::this_thread::sleep_for(2ms);
    row.endSeconds = bench::secondsSince(t0);
    row.stored = now - base;
  }
  if (cpu0) {
    auto cpu1 = bench::cpuSeconds(*pid);
    if (cpu1 && row.accepted > 0) row.cpuPerMessage = (*cpu1 - *cpu0) / static_cast<double>(row.accepted);
  }
  return row;
}


}  // namespace

int main(int argc, char** argv) {
  bench::Options opt(argc, argv, kUsage);
  const auto clients = static_cast<size_t>(std::max(1LL, opt.number("clients", 8)));
  const auto messages = static_cast<std::uint64_t>(std::max(1LL, opt.number("messages", 500)));
  const auto window = static_cast<std::uint64_t>(std::max(2LL, opt.number("window", 64)));
  const std::string address = opt.text("address", "");
  const std::string dbPath =
      opt.text("db", linux_platform::ServiceDirectories::fromEnvironment().state + "/vireo.db");

  std::vector<sd_bus*> buses;
  for (size_t i = 0; i < clients; ++i) buses.push_back(bench::openBus(address));
  std::optional<pid_t> pid;
  if (long long p = opt.number("pid", 0); p > 0) pid = static_cast<pid_t>(p);
  else pid = bench::daemonPid(buses[0]);
  if (!pid) {
    std::fprintf(stderr, "the daemon is not on the bus (%s)\n", bench::kService);
    return 1;
  }
  // The store is opened after the daemon made it.
  auto setup = bench::connectClient(address);
  if (auto p = setup->ping(); !p) {
    std::fprintf(stderr, "the daemon does not answer: %s\n", p.error().message.c_str());
    return 1;
  }
  std::unique_ptr<StoreCounter> store = std::make_unique<StoreCounter>(dbPath);
  if (store->rows() < 0) {
    std::fprintf(stderr, "note: no readable store at %s; rows are not counted\n", dbPath.c_str());
    store.reset();
  }
  DiscardServer discard(address);
  const Dictionary payload = makePayload();

  // Session owners: one client connection per sender, IDs unique to this run.
  const std::int64_t base = static_cast<std::int64_t>(getpid()) << 24;
  std::vector<std::unique_ptr<client::Client>> owners;
  for (size_t i = 0; i < clients; ++i) owners.push_back(bench::connectClient(address));
  auto startSessions = [&](size_t howMany) {
    std::vector<client::StartHandle> handles;
    for (size_t i = 0; i < howMany; ++i) {
      owners[i]->createReportingSession(base + static_cast<std::int64_t>(i));
      handles.push_back(owners[i]->startReportingSessionForID(base + static_cast<std::int64_t>(i)));
    }
    for (size_t i = 0; i < howMany; ++i) owners[i]->getAllReporters();  // the starts have been handled
    return handles;
  };
  auto stopSessions = [&](size_t howMany) {
    for (size_t i = 0; i < howMany; ++i) owners[i]->destroyReportingSession(base + static_cast<std::int64_t>(i));
    if (store) store->settle();
  };

  auto sendTo = [&](bool addressed) {
    return [&, addressed](size_t i) -> MakeCall {
      const std::int64_t id = base + static_cast<std::int64_t>(i);
      return [&, addressed, id](sd_bus* bus, sd_bus_message** m) {
        int r = sd_bus_message_new_method_call(bus, m, bench::kService, bench::kPath, bench::kInterface, "SendMessage");
        return r < 0 ? r : appendMessageArgs(*m, payload, addressed, id);
      };
    };
  };
  auto pingCall = [&](size_t) -> MakeCall {
    return [](sd_bus* bus, sd_bus_message** m) {
      return sd_bus_message_new_method_call(bus, m, bench::kService, bench::kPath, "org.freedesktop.DBus.Peer", "Ping");
    };
  };
  auto discardCall = [&](size_t i) -> MakeCall {
    const std::int64_t id = base + static_cast<std::int64_t>(i);
    return [&, id](sd_bus* bus, sd_bus_message** m) {
      int r = sd_bus_message_new_method_call(bus, m, discard.name().c_str(), kBenchPath, kBenchInterface, "Discard");
      return r < 0 ? r : appendMessageArgs(*m, payload, true, id);
    };
  };

  // Warm-up, not reported: the sessions' telemetry backends and the store's first pages.
  {
    auto handles = startSessions(clients);
    runPhase("warm-up", "", buses, 20, window, sendTo(true), store.get(), pid);
    stopSessions(clients);
  }

  std::vector<Row> rows;
  for (std::uint64_t w : {std::uint64_t{1}, window}) {
    const std::string mode = w == 1 ? "sync" : "pipelined";
    {
      auto handles = startSessions(clients);
      rows.push_back(runPhase("SendMessage addressed", mode, buses, messages, w, sendTo(true), store.get(), pid));
      stopSessions(clients);
    }
    {
      // One started session, so each broadcast makes one row.
      auto handles = startSessions(1);
      rows.push_back(runPhase("SendMessage broadcast", mode, buses, messages, w, sendTo(false), store.get(), pid));
      stopSessions(1);
    }
    rows.push_back(runPhase("Peer.Ping", mode, buses, messages, w, pingCall, nullptr, pid));
    rows.push_back(runPhase("Discard (same payload)", mode, buses, messages, w, discardCall, nullptr, pid));
  }

  std::printf("Vireo message load report\n");
  std::printf("  %zu clients (threads, one bus connection each), %llu messages per client and phase,\n"
              "  pipelined window %llu calls in flight per client; payload: 20 entries (7 strings,\n"
              "  7 64-bit integers, 6 doubles), category 0x40000003, type 1.\n",
              clients, (unsigned long long)messages, (unsigned long long)window);
  std::printf("  SendMessage: end to end; a message counts once its row is in telemetry_messages\n"
              "    (polled read-only with SELECT COUNT(*)); msgs/s = accepted / time until the last row.\n"
              "  Peer.Ping: org.freedesktop.DBus.Peer.Ping of the daemon, the bare bus round trip.\n"
              "  Discard: com.orvane.vireo.Bench1.Discard(a{sv}uqbax), a do-nothing method this tool\n"
              "    exports on a second connection of its own; it parses the payload into a Value with\n"
              "    the daemon's codec and replies empty: the bus + parse floor, no daemon logic.\n"
              "  ratio = SendMessage msgs/s / Discard msgs/s of the same mode (targets: >= 0.85\n"
              "    pipelined with 8 clients, >= 0.95 synchronous). CPU = the daemon's utime+stime\n"
              "    (/proc/%d/stat) over the phase, per message.\n\n",
              static_cast<int>(*pid));
  std::printf("  %-24s %-10s %9s %8s %8s %11s %7s %7s %10s\n", "phase", "mode", "accepted", "failed", "seconds",
              "msgs/s", "ratio", "target", "cpu us/msg");
  for (const auto& r : rows) {
    double floor = 0;
    for (const auto& f : rows)
      if (f.mode == r.mode && f.what.rfind("Discard", 0) == 0) floor = f.rate();
    bool isSend = r.what.rfind("SendMessage", 0) == 0;
    char ratio[32] = "", target[32] = "", cpu[32] = "-";
    if (isSend && floor > 0) {
      double x = r.rate() / floor;
      double want = r.mode == "sync" ? 0.95 : 0.85;
      std::snprintf(ratio, sizeof ratio, "%.2f", x);
      std::snprintf(target, sizeof target, "%s", x >= want ? "met" : "missed");
    }
    if (r.cpuPerMessage) std::snprintf(cpu, sizeof cpu, "%.1f", *r.cpuPerMessage * 1e6);
    std::printf("  %-24s %-10s %9llu %8llu %8.3f %11.0f %7s %7s %10s\n", r.what.c_str(), r.mode.c_str(),
                (unsigned long long)r.accepted, (unsigned long long)r.failed, r.endSeconds, r.rate(), ratio, target,
                cpu);
  }
  std::printf("\n  rows stored / messages accepted:\n");
  int status = 0;
  for (const auto& r : rows) {
    if (r.what.rfind("SendMessage", 0) != 0) continue;
    if (r.stored < 0)
      std::printf("    %-24s %-10s no store\n", r.what.c_str(), r.mode.c_str());
    else
      std::printf("    %-24s %-10s %lld / %llu (all accepted by %.3f s)\n", r.what.c_str(), r.mode.c_str(),
                  (long long)r.stored, (unsigned long long)r.accepted, r.acceptSeconds);
  }
  for (const auto& r : rows)
    if (r.failed > 0) {
      std::printf("  %s %s: %llu calls failed, first error %s\n", r.what.c_str(), r.mode.c_str(),
                  (unsigned long long)r.failed, r.firstError.c_str());
      status = 1;
    }
  for (auto* b : buses) sd_bus_flush_close_unref(b);
  return status;
}
