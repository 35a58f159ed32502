// Session cycle load: N clients, each on its own bus connection, run
// create/start/stop/destroy cycles against a running daemon, then the same clients
// run org.freedesktop.DBus.Peer.Ping for the same number of calls, so the report
// shows the service's call rate next to the bus's own round-trip rate.
#include <atomic>
#include <thread>
#include <vector>

#include "load_common.h"
#include "vireo/client.h"

namespace {

using namespace vireo;
using namespace std::chrono_literals;

constexpr const char* kUsage = R"(usage: session_cycle_load [--clients N] [--cycles N] [--seconds S] [--address ADDRESS]
  --clients N    client threads, each with its own connection (default 4)
  --cycles N     create/start/stop/destroy cycles per client (default 500)
  --seconds S    run cycles for S seconds instead of a fixed count
  --address A    D-Bus address (default: VIREO_BUS, else system for root, session otherwise)
)";

struct Phase {
  std::uint64_t calls = 0;
  std::uint64_t errors = 0;
  double seconds = 0;
  double rate() const { return seconds > 0 ? static_cast<double>(calls) / seconds : 0; }
};


// Runs body(client, index, stop) on every client at once; returns the wall time.
template <class Body>
double runClients(std::vector<std::unique_ptr<client::Client>>& clients, Body body) {
  bench::StartGate gate;
  std::vector<std::thread> threads;
  for (size_t i = 0; i < clients.size(); ++i)
    threads.emplace_back([&, i] {
      gate.wait();
      body(*clients[i], i);
    });
  auto t0 = std::chrono::steady_clock::now();
  gate.open();
  for (auto& t : threads) t.join();
  return bench::secondsSince(t0);
}

}  // namespace

int main(int argc, char** argv) {
  bench::Options opt(argc, argv, kUsage);
  const auto clientsCount = static_cast<size_t>(std::max(1LL, opt.number("clients", 4)));
  const auto cycles = static_cast<std::uint64_t>(std::max(1LL, opt.number("cycles", 500)));
  const double seconds = static_cast<double>(opt.number("seconds", 0));
  const std::string address = opt.text("address", "");

  std::vector<std::unique_ptr<client::Client>> clients;
  for (size_t i = 0; i < clientsCount; ++i) clients.push_back(bench::connectClient(address));
  if (auto p = clients[0]->ping(); !p) {
    std::fprintf(stderr, "the daemon does not answer: %s\n", p.error().message.c_str());
    return 1;
  }

  std::atomic<std::uint64_t> calls{0}, errors{0}, cyclesDone{0};
  const auto base = static_cast<std::int64_t>(getpid()) << 24;
  Phase service;
  service.seconds = runClients(clients, [&](client::Client& c, size_t index) {
    const std::int64_t id = base + static_cast<std::int64_t>(index);
    auto until = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
    for (std::uint64_t n = 0; seconds > 0 ? std::chrono::steady_clock::now() < until : n < cycles; ++n) {
      std::uint64_t bad = 0;
      bad += !c.createReportingSession(id).ok();
      auto start = c.startReportingSessionForID(id);
      bad += !c.stopReportingSessionForID(id).ok();
      auto answer = start.waitFor(10s);  // the start is answered by the stop
      bad += !(answer && answer->ok());
      bad += !c.destroyReportingSession(id).ok();
      calls += 4;
      errors += bad;
      ++cyclesDone;
    }
  });
  service.calls = calls.load();
  service.errors = errors.load();

  // The same number of calls per client as a bare bus round trip.
  const std::uint64_t pingsPerClient = service.calls / clientsCount;
  std::atomic<std::uint64_t> pingErrors{0};
  Phase ping;
  ping.seconds = runClients(clients, [&](client::Client& c, size_t) {
    for (std::uint64_t n = 0; n < pingsPerClient; ++n)
      if (!c.ping()) ++pingErrors;
  });
  ping.calls = pingsPerClient * clientsCount;
  ping.errors = pingErrors.load();

  std::printf("Vireo session cycle load\n");
  std::printf("  %zu clients, each on its own connection; one cycle = CreateReportingSession,\n"
              "  StartReportingSessionForID (answered by the stop), StopReportingSessionForID,\n"
              "  DestroyReportingSession = 4 calls. Peer.Ping: the same number of calls per client\n"
              "  to the daemon's org.freedesktop.DBus.Peer.Ping (bus round trip, no service logic).\n\n",
              clientsCount);
  std::printf("  %-22s %10s %10s %12s %8s\n", "phase", "calls", "seconds", "calls/s", "errors");
  std::printf("  %-22s %10llu %10.3f %12.0f %8llu\n", "session cycles", (unsigned long long)service.calls,
              service.seconds, service.rate(), (unsigned long long)service.errors);
  std::printf("  %-22s %10llu %10.3f %12.0f %8llu\n", "Peer.Ping", (unsigned long long)ping.calls, ping.seconds,
              ping.rate(), (unsigned long long)ping.errors);
  std::printf("\n  cycles/s %.0f; service calls/s over Peer.Ping calls/s: %.2f\n",
              service.seconds > 0 ? static_cast<double>(cyclesDone.load()) / service.seconds : 0,
              ping.rate() > 0 ? service.rate() / ping.rate() : 0);
  return service.errors + ping.errors == 0 ? 0 : 1;
}
