// Hostile load: what misbehaving and vanishing clients do to a running daemon.
//
// 1. ping: a separate connection sends org.freedesktop.DBus.Peer.Ping every 10 ms
//    while hostile connections send, as fast as they are answered, oversize, wide,
//    long, deep and NaN-keyed payloads, mistyped and unknown calls, and calls whose
//    connection closes before the answer. Floor: the same pings with no load, in the
//    same repetition.
// 2. vanish: clients (each a new bus connection) create and start a session and then
//    disconnect without stop or destroy; the daemon's RSS along the way, and the rows
//    each abandoned session leaves in the store.
// 3. flood: one session given many pipelined messages; the daemon's RSS before,
//    during and after, against the size of one payload.
// 4. idle: thousands of sessions started and left idle: RSS per session, the daemon's
//    threads, and a probe session's send-to-store latency meanwhile.
// 5. wait: the same while every new session waits out its backend interval.
//
// Every figure is per repetition, then the median over the repetitions.
#include <signal.h>
#include <sqlite3.h>

#include <algorithm>
#include <atomic>
#include <cmath>
#include <thread>
#include <vector>

#include "base/value_pack.h"
#include "load_common.h"
#include "platform/linux/paths.h"
#include "vireo/client.h"

namespace {

using namespace vireo;
using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;
using bench::rssMiB;

constexpr const char* kUsage = R"(usage: hostile_load [--repetitions R] [--scenarios ping,vanish,flood] [options]
  --repetitions R   repetitions of each scenario, at least 3 (default 3)
  --scenarios S     comma-separated subset of ping,vanish,flood,idle,wait (default all)
  --seconds S       ping: seconds of pinging per phase, floor and load (default 10)
  --hostile N       ping: hostile connections, one thread each (default 4)
  --clients N       vanish: clients that start a session and disconnect (default 12000)
  --parallel N      vanish: clients at a time (default 8)
  --messages N      flood: messages into the one session (default 150000)
  --window W        flood: calls in flight (default 64)
  --sessions N      idle, wait: sessions created and started (default 10000)
  --per-client N    idle, wait: sessions of each client (default 50)
  --address A       D-Bus address (default: VIREO_BUS, else system for root, session otherwise)
  --db PATH         the daemon's store (default STATE_DIRECTORY/vireo.db)
  --pid PID         the daemon's process (default: asked from the bus)
)";

constexpr std::uint32_t kCategory = 0x40000003;
constexpr const char* kUptimeEvent = "com.orvane.vireo.vrreportingclientuptime";

double ms(Clock::duration d) { return std::chrono::duration<double, std::milli>(d).count(); }

double percentile(std::vector<double> v, double p) {
  if (v.empty()) return 0;
  std::sort(v.begin(), v.end());
  return v[static_cast<std::size_t>(p * static_cast<double>(v.size() - 1) + 0.5)];
}
double median(std::vector<double> v) { return percentile(std::move(v), 0.5); }

// Alive and not a zombie waiting for its parent.
bool alive(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
  std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  auto close = text.rfind(')');
  return kill(pid, 0) == 0 && close != std::string::npos && close + 2 < text.size() && text[close + 2] != 'Z';
}

// Read-only queries of the daemon's store; -1 when it cannot be read.
class Store {
 public:
  explicit Store(const std::string& path) : store_(path, 2000) {}
  std::int64_t number(const std::string& sql) { return store_.scalar(sql); }
  std::int64_t maxId(const char* table) { return number(std::string("SELECT IFNULL(MAX(id), 0) FROM ") + table); }
  // Polls sql until it gives want, or stops moving for `quiet`, or the deadline passes.
  std::int64_t await(const std::string& sql, std::int64_t want, std::chrono::seconds deadline, Clock::duration quiet) {
    auto end = Clock::now() + deadline, lastMove = Clock::now();
    std::int64_t last = number(sql);
    while (last != want && Clock::now() < end && Clock::now() - lastMove < quiet) {
      std::this_thread::sleep_for(50ms);
      std::int64_t now = number(sql);
      if (now != last) lastMove = Clock::now();
      last = now;
    }
    return last;
  }
  // Until every table stops growing, so one scenario's rows do not count in the next.
  void settle() {
    bench::waitUntilStill(
        [&] { return maxId("telemetry_sessions") + maxId("telemetry_messages") + maxId("analytics_events"); }, 200ms);
  }

 private:
  bench::ReadOnlyStore store_;
};

struct Env {
  std::string address;
  pid_t pid = 0;
  Store* store = nullptr;
  int repetitions = 3;
};

// ---------------------------------------------------------------- 1. ping

struct Pings {
  std::vector<double> ms;
  std::vector<std::pair<Clock::time_point, Clock::time_point>> spans;  // sent, answered
  int failed = 0;
  double p50() const { return percentile(ms, 0.5); }
  double p99() const { return percentile(ms, 0.99); }
  double max() const { return ms.empty() ? 0 : *std::max_element(ms.begin(), ms.end()); }
  long over(double limit) const {
    return std::count_if(ms.begin(), ms.end(), [&](double x) { return x > limit; });
  }
};

// One Peer.Ping of destination every 10 ms (or at once when the previous one took longer).
Pings pingFor(sd_bus* bus, const char* destination, double seconds) {
  Pings p;
  const auto end = Clock::now() + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(seconds));
  auto next = Clock::now();
  while (Clock::now() < end) {
    sd_bus_error e = SD_BUS_ERROR_NULL;
    auto t0 = Clock::now();
    int r = sd_bus_call_method(bus, destination, bench::kPath, "org.freedesktop.DBus.Peer", "Ping", &e, nullptr, "");
    const auto t1 = Clock::now();
    p.ms.push_back(ms(t1 - t0));
    p.spans.emplace_back(t0, t1);
    p.failed += r < 0;
    sd_bus_error_free(&e);
    next = std::max(next + 10ms, Clock::now());
    std::this_thread::sleep_until(next);
  }
  return p;
}

// Daemon pings over 100 ms during which no bus-only ping took over 50 ms: a stall the
// bus and the CPUs do not explain.
long daemonOnlyStalls(const Pings& daemon, const Pings& control) {
  long n = 0;
  for (std::size_t i = 0; i < daemon.ms.size(); ++i) {
    if (daemon.ms[i] <= 100) continue;
    const auto [from, to] = daemon.spans[i];
    bool explained = false;
    for (std::size_t j = 0; j < control.ms.size() && !explained; ++j)
      explained = control.ms[j] > 50 && control.spans[j].first < to && control.spans[j].second > from;
    n += !explained;
  }
  return n;
}

// A connection of this tool that only answers Peer.Ping (sd-bus does so by itself), from
// a thread of its own: the same pings through the same bus and CPUs, without the daemon.
class Echo {
 public:
  explicit Echo(const std::string& address) : bus_(bench::openBus(address)) {
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
  ~Echo() {
    stop_ = true;
    thread_.join();
    sd_bus_flush_close_unref(bus_);
  }
  const char* name() const { return name_.c_str(); }

 private:
  sd_bus* bus_;
  std::string name_;
  std::atomic<bool> stop_{false};
  std::thread thread_;
};

enum Shape {
  BigString,
  WideDict,
  LongArray,
  Deep,
  NanKeys,
  NanKeysFit,
  WrongSignature,
  UnknownMethod,
  ClosedMidCall,
  kShapes
};
constexpr const char* kShapeNames[kShapes] = {"s of 1 MiB",         "a{sv} of 10,000 keys",  "ax of 100,000",
                                              "nested 16..40 deep", "a{dv} 32,000 NaN keys", "a{dv} 4,000 NaN keys",
                                              "wrong signature",    "unknown method/iface",  "closed mid-call"};

// Arrays and structs take turns, so depth 40 stays within D-Bus's 32 of each.
std::string nestedSignature(int depth) {
  if (depth == 0) return "x";
  return depth % 2 ? "a" + nestedSignature(depth - 1) : "(" + nestedSignature(depth - 1) + ")";
}
int appendNested(sd_bus_message* m, int depth) {
  if (depth == 0) return sd_bus_message_append(m, "x", std::int64_t{7});
  int r = sd_bus_message_open_container(m, depth % 2 ? 'a' : 'r', nestedSignature(depth - 1).c_str());
  if (r >= 0) r = appendNested(m, depth - 1);
  return r < 0 ? r : sd_bus_message_close_container(m);
}

int appendNanDictionary(sd_bus_message* m, int keys) {
  const double nan = std::nan("");
  int r = sd_bus_message_open_container(m, 'a', "{dv}");
  for (int i = 0; r >= 0 && i < keys; ++i) r = sd_bus_message_append(m, "{dv}", nan, "x", std::int64_t{i});
  return r < 0 ? r : sd_bus_message_close_container(m);
}

// A SendMessage whose a{sv} payload has the given shape, addressed to `id`.
int makeSend(sd_bus* bus, sd_bus_message** m, Shape shape, int variant, std::int64_t id) {
  static const std::string blob(1 << 20, 'x');
  static const std::vector<std::int64_t> samples(100000, 42);
  // One payload entry: key, then a variant of signature sig that body fills.
  auto entry = [m](const char* key, const char* sig, auto&& body) {
    int r = sd_bus_message_open_container(*m, 'e', "sv");
    if (r >= 0) r = sd_bus_message_append(*m, "s", key);
    if (r >= 0) r = sd_bus_message_open_container(*m, 'v', sig);
    if (r >= 0) r = body();
    if (r >= 0) r = sd_bus_message_close_container(*m);
    return r < 0 ? r : sd_bus_message_close_container(*m);
  };
  int r = sd_bus_message_new_method_call(bus, m, bench::kService, bench::kPath, bench::kInterface, "SendMessage");
  if (r >= 0) r = sd_bus_message_open_container(*m, 'a', "{sv}");
  if (r < 0) return r;
  if (shape == BigString) {
    r = entry("blob", "s", [&] { return sd_bus_message_append_basic(*m, 's', blob.c_str()); });
  } else if (shape == WideDict) {
    for (int i = 0; r >= 0 && i < 10000; ++i)
      r = sd_bus_message_append(*m, "{sv}", ("key_" + std::to_string(i)).c_str(), "x", std::int64_t{i});
  } else if (shape == LongArray) {
    r = entry("samples", "ax",
              [&] { return sd_bus_message_append_array(*m, 'x', samples.data(), samples.size() * sizeof samples[0]); });
  } else if (shape == Deep) {
    const int depth = 16 + variant % 25;
    r = entry("deep", nestedSignature(depth).c_str(), [&] { return appendNested(*m, depth); });
  } else {
    r = entry("nan", "a{dv}", [&] { return appendNanDictionary(*m, shape == NanKeys ? 32000 : 4000); });
  }
  if (r >= 0) r = sd_bus_message_close_container(*m);
  if (r >= 0) r = sd_bus_message_append(*m, "uqb", kCategory, std::uint16_t{1}, 1);
  if (r >= 0) r = sd_bus_message_append_array(*m, 'x', &id, sizeof id);
  return r;
}

struct ShapeTally {
  std::map<std::string, std::uint64_t> outcomes;  // "ok" or the error's name
  std::vector<double> ms;
};

// One hostile connection: every shape in turn, each call awaited, until stop.
void hostile(const std::string& address, int index, const std::atomic<bool>& stop, std::vector<ShapeTally>& tally,
             std::mutex& mu) {
  sd_bus* bus = bench::openBus(address);
  std::vector<ShapeTally> mine(kShapes);
  const std::int64_t id = (static_cast<std::int64_t>(getpid()) << 24) + 0x100000 + index;
  for (int n = index; !stop.load(); ++n) {
    const auto shape = static_cast<Shape>(n % kShapes);
    const int variant = n / kShapes;
    sd_bus_message* m = nullptr;
    sd_bus_error e = SD_BUS_ERROR_NULL;
    std::string outcome;
    auto t0 = Clock::now();
    int r;
    if (shape == WrongSignature) {
      // a{ss} where a{sv} belongs, or a lone string.
      r = variant % 2 ? sd_bus_call_method(bus, bench::kService, bench::kPath, bench::kInterface, "SendMessage", &e,
                                           nullptr, "a{ss}uqbax", 1, "k", "v", kCategory, 1, 1, 0)
                      : sd_bus_call_method(bus, bench::kService, bench::kPath, bench::kInterface, "SendMessage", &e,
                                           nullptr, "s", "payload");
    } else if (shape == UnknownMethod) {
      r = sd_bus_call_method(bus, bench::kService, bench::kPath,
                             variant % 2 ? "com.orvane.vireo.Nope1" : bench::kInterface, "SendMessages", &e, nullptr,
                             "");
    } else if (shape == ClosedMidCall) {
      // A new connection queues a large send, a create and a start, then closes
      // without reading an answer.
      sd_bus* gone = bench::openBus(address);
      r = makeSend(gone, &m, BigString, 0, id);
      if (r >= 0) r = sd_bus_send(gone, m, nullptr);
      if (r >= 0)
        r = sd_bus_call_method_async(gone, nullptr, bench::kService, bench::kPath, bench::kInterface,
                                     "CreateReportingSession", nullptr, nullptr, "x", id);
      if (r >= 0)
        r = sd_bus_call_method_async(gone, nullptr, bench::kService, bench::kPath, bench::kInterface,
                                     "StartReportingSessionForID", nullptr, nullptr, "x", id);
      if (r >= 0) r = sd_bus_flush(gone);
      sd_bus_flush_close_unref(gone);
      outcome = r >= 0 ? "sent, closed" : std::string("local: ") + std::strerror(-r);
    } else {
      r = makeSend(bus, &m, shape, variant, id);
      if (r >= 0) r = sd_bus_call(bus, m, 30'000'000, &e, nullptr);
    }
    if (outcome.empty()) outcome = r >= 0 ? "ok" : e.name ? e.name : std::string("local: ") + std::strerror(-r);
    mine[shape].ms.push_back(ms(Clock::now() - t0));
    ++mine[shape].outcomes[outcome];
    sd_bus_message_unref(m);
    sd_bus_error_free(&e);
    if (r == -ENOTCONN || r == -ECONNRESET) {  // the bus dropped this connection: count it and come back
      sd_bus_flush_close_unref(bus);
      bus = bench::openBus(address);
    }
  }
  sd_bus_flush_close_unref(bus);
  std::lock_guard lock(mu);
  for (int s = 0; s < kShapes; ++s) {
    for (auto& [k, v] : mine[s].outcomes) tally[s].outcomes[k] += v;
    tally[s].ms.insert(tally[s].ms.end(), mine[s].ms.begin(), mine[s].ms.end());
  }
}

bool scenarioPing(const Env& env, double seconds, int hostiles) {
  std::printf(
      "== 1. Peer.Ping of the daemon every 10 ms from its own connection, %g s with no load (floor),\n"
      "   then %g s while %d hostile connections send as fast as they are answered (target: no ping\n"
      "   over 100 ms). 'bus only': the same pings, at the same time, to a connection of this tool\n"
      "   that only answers pings: what the bus and the shared CPUs alone add. CPU: the daemon's\n"
      "   utime+stime over the loaded phase, percent of one core. alone: pings over 100 ms while no\n"
      "   bus-only ping took over 50 ms (a stall of the daemon's own).\n\n",
      seconds, seconds, hostiles);
  std::printf("  %-4s %26s   %29s %6s %5s %6s   %22s %5s %6s %6s\n", "rep", "floor p50/p99/max ms (n)",
              "load p50/p99/max ms (n)", ">100ms", "alone", "p99 x", "bus only p99/max >100", "CPU%", "RSS0", "RSS1");
  sd_bus* pinger = bench::openBus(env.address);
  sd_bus* controlPinger = bench::openBus(env.address);
  Echo echo(env.address);
  std::vector<ShapeTally> tally(kShapes);
  std::mutex mu;
  std::vector<double> fp50, fp99, fmax, lp50, lp99, lmax, over, alone, ratio, cp99, cmax, cpu, rss0, rss1;
  bool met = true;
  for (int rep = 1; rep <= env.repetitions; ++rep) {
    rss0.push_back(rssMiB(env.pid));
    Pings floor = pingFor(pinger, bench::kService, seconds);
    std::atomic<bool> stop{false};
    std::vector<std::thread> threads;
    for (int i = 0; i < hostiles; ++i)
      threads.emplace_back([&, i] { hostile(env.address, i + rep * hostiles, stop, tally, mu); });
    const double cpu0 = bench::cpuSeconds(env.pid).value_or(0);
    Pings control;
    std::thread controlThread([&] { control = pingFor(controlPinger, echo.name(), seconds); });
    Pings load = pingFor(pinger, bench::kService, seconds);
    controlThread.join();
    cpu.push_back((bench::cpuSeconds(env.pid).value_or(0) - cpu0) / seconds * 100);
    stop = true;
    for (auto& t : threads) t.join();
    std::this_thread::sleep_for(500ms);
    rss1.push_back(rssMiB(env.pid));
    fp50.push_back(floor.p50()), fp99.push_back(floor.p99()), fmax.push_back(floor.max());
    lp50.push_back(load.p50()), lp99.push_back(load.p99()), lmax.push_back(load.max());
    cp99.push_back(control.p99()), cmax.push_back(control.max());
    over.push_back(static_cast<double>(load.over(100)));
    alone.push_back(static_cast<double>(daemonOnlyStalls(load, control)));
    ratio.push_back(floor.p99() > 0 ? load.p99() / floor.p99() : 0);
    met = met && load.over(100) == 0 && load.failed == 0;
    std::printf(
        "  %-4d %6.2f/%6.2f/%6.2f (%4zu)   %6.2f/%7.2f/%7.2f (%4zu) %6ld %5.0f %6.0f   %7.2f/%7.2f %6ld %5.0f %6.1f "
        "%6.1f\n",
        rep, floor.p50(), floor.p99(), floor.max(), floor.ms.size(), load.p50(), load.p99(), load.max(), load.ms.size(),
        load.over(100), alone.back(), ratio.back(), control.p99(), control.max(), control.over(100), cpu.back(),
        rss0.back(), rss1.back());
    if (load.failed + floor.failed + control.failed > 0)
      std::printf("       pings failed: %d floor, %d load, %d bus only\n", floor.failed, load.failed, control.failed);
  }
  std::printf(
      "  %-4s %6.2f/%6.2f/%6.2f          %6.2f/%7.2f/%7.2f        %6.0f %5.0f %6.0f   %7.2f/%7.2f %6s %5.0f %6.1f "
      "%6.1f\n",
      "med", median(fp50), median(fp99), median(fmax), median(lp50), median(lp99), median(lmax), median(over),
      median(alone), median(ratio), median(cp99), median(cmax), "", median(cpu), median(rss0), median(rss1));
  sd_bus_flush_close_unref(pinger);
  sd_bus_flush_close_unref(controlPinger);
  std::printf("\n  hostile calls over all repetitions, answer time of each awaited call:\n");
  std::printf("  %-22s %7s %9s %9s  %s\n", "shape", "calls", "p50 ms", "max ms", "answers");
  for (int sh = 0; sh < kShapes; ++sh) {
    std::string answers;
    for (auto& [k, v] : tally[sh].outcomes) answers += (answers.empty() ? "" : ", ") + k + " " + std::to_string(v);
    const double mx = tally[sh].ms.empty() ? 0 : *std::max_element(tally[sh].ms.begin(), tally[sh].ms.end());
    std::printf("  %-22s %7zu %9.2f %9.2f  %s\n", kShapeNames[sh], tally[sh].ms.size(), percentile(tally[sh].ms, 0.5),
                mx, answers.c_str());
  }
  const bool up = alive(env.pid);
  std::printf(
      "\n  RSS in MiB before the floor and 0.5 s after the load. target no ping over 100 ms: %s;\n"
      "  daemon alive after: %s; RSS first/last %.1f/%.1f MiB\n\n",
      met ? "met" : "MISSED", up ? "yes" : "NO", rss0.front(), rss1.back());
  return up;
}

// ---------------------------------------------------------------- 2. vanish

bool scenarioVanish(const Env& env, std::size_t clients, std::size_t parallel) {
  std::printf(
      "== 2. %zu clients, %zu at a time, each a new connection: create, start, then disconnect without\n"
      "   stop or destroy. RSS sampled every 500 clients (target: second half flat within 5%%). In the\n"
      "   store, each should leave one telemetry_sessions row, flushed (the daemon stops the session\n"
      "   when its client leaves), one %s analytics event, and no\n"
      "   telemetry_messages row (a session with no payload sends no summary).\n\n",
      clients, parallel, kUptimeEvent);
  std::printf("  %-4s %7s %8s %6s %9s %9s %9s %8s %7s | %9s %9s %9s %9s\n", "rep", "seconds", "clients/s", "errors",
              "RSS0 MiB", "half MiB", "end MiB", "spread2", "target", "sessions", "flushed", "uptime", "messages");
  std::vector<double> secs, rate, rss0, rssHalf, rssEnd, spread;
  bool met = true, stored = true;
  for (int rep = 1; rep <= env.repetitions && alive(env.pid); ++rep) {
    if (env.store) env.store->settle();
    const std::int64_t s0 = env.store ? env.store->maxId("telemetry_sessions") : 0;
    const std::int64_t a0 = env.store ? env.store->maxId("analytics_events") : 0;
    std::vector<std::pair<std::size_t, double>> samples{{0, rssMiB(env.pid)}};
    std::mutex mu;
    std::atomic<std::size_t> next{0}, done{0}, errors{0};
    std::string firstError;
    auto t0 = Clock::now();
    std::vector<std::thread> threads;
    for (std::size_t t = 0; t < parallel; ++t)
      threads.emplace_back([&] {
        for (std::size_t n; (n = next++) < clients;) {
          auto c = bench::connectClient(env.address);
          const auto id = static_cast<std::int64_t>(n + 1);
          std::optional<client::Error> err;
          if (auto r = c->createReportingSession(id); !r) err = r.error();
          auto start = c->startReportingSessionForID(id);
          if (auto r = c->getAllReporters(); !r && !err) err = r.error();  // the start has been handled
          c.reset();                                                       // gone: no stop, no destroy
          if (err && errors++ == 0) {
            std::lock_guard lock(mu);
            firstError = err->name + ": " + err->message;
          }
          if (std::size_t d = ++done; d % 500 == 0 || d == clients) {
            double rss = rssMiB(env.pid);
            std::lock_guard lock(mu);
            samples.emplace_back(d, rss);
          }
        }
      });
    for (auto& t : threads) t.join();
    secs.push_back(ms(Clock::now() - t0) / 1000);
    rate.push_back(static_cast<double>(clients) / secs.back());
    std::sort(samples.begin(), samples.end());
    std::vector<double> second;
    for (auto& [n, rss] : samples)
      if (n >= clients / 2) second.push_back(rss);
    const double lo = *std::min_element(second.begin(), second.end());
    const double hi = *std::max_element(second.begin(), second.end());
    auto at = [&](std::size_t n) {
      auto it = std::lower_bound(samples.begin(), samples.end(), std::make_pair(n, 0.0));
      return it == samples.end() ? samples.back().second : it->second;
    };
    rss0.push_back(samples.front().second), rssHalf.push_back(at(clients / 2)), rssEnd.push_back(samples.back().second);
    spread.push_back(lo > 0 ? (hi - lo) / lo : 0);
    met = met && spread.back() <= 0.05;
    std::int64_t sessions = -1, flushed = -1, uptime = -1, messages = -1;
    if (env.store) {
      const auto want = static_cast<std::int64_t>(clients);
      const std::string s = " FROM telemetry_sessions WHERE id > " + std::to_string(s0);
      sessions = env.store->await("SELECT COUNT(*)" + s, want, 60s, 3s);
      flushed = env.store->await("SELECT COUNT(*)" + s + " AND flushed_at IS NOT NULL", want, 60s, 3s);
      uptime = env.store->await("SELECT COUNT(*) FROM analytics_events WHERE id > " + std::to_string(a0) +
                                    " AND name = '" + kUptimeEvent + "'",
                                want, 60s, 3s);
      messages = env.store->number("SELECT COUNT(*) FROM telemetry_messages WHERE session > " + std::to_string(s0));
      stored = stored && sessions == want && flushed == want && uptime == want && messages == 0;
    }
    std::printf("  %-4d %7.1f %8.0f %6zu %9.1f %9.1f %9.1f %7.1f%% %7s | %9lld %9lld %9lld %9lld\n", rep, secs.back(),
                rate.back(), errors.load(), rss0.back(), rssHalf.back(), rssEnd.back(), spread.back() * 100,
                spread.back() <= 0.05 ? "met" : "MISSED", (long long)sessions, (long long)flushed, (long long)uptime,
                (long long)messages);
    if (!firstError.empty()) std::printf("       first error: %s\n", firstError.c_str());
  }
  std::printf("  %-4s %7.1f %8.0f %6s %9.1f %9.1f %9.1f %7.1f%%\n", "med", median(secs), median(rate), "", median(rss0),
              median(rssHalf), median(rssEnd), median(spread) * 100);
  const bool up = alive(env.pid);
  std::printf(
      "\n  target RSS flat within 5%% over the second half: %s; every abandoned session's rows stored: %s;"
      " daemon alive after: %s\n\n",
      met ? "met" : "MISSED", env.store ? (stored ? "yes" : "NO") : "no store", up ? "yes" : "NO");
  return up;
}

// ---------------------------------------------------------------- 3. flood

bool scenarioFlood(const Env& env, std::size_t messages, std::size_t window) {
  const Dictionary payload = bench::makePayload();
  const std::size_t jsonBytes = toJson(Value(payload), JsonMode::Lenient).value_or("").size();
  std::printf(
      "== 3. One session, %zu messages of a 20-entry payload (compact JSON %zu bytes) addressed to it,\n"
      "   %zu in flight, then stopped. RSS (MiB, sampled every 10 ms) before the session, peak while\n"
      "   sending, right after the stop answer, peak and last within 1 s after it; 'back' is when RSS\n"
      "   first came within 10%% of before (target: within 1 s). growth/msg = (peak while\n"
      "   sending - before) / accepted. stored: the session's type-1 rows in telemetry_messages.\n",
      messages, jsonBytes, window);
  // What a session keeps of each message for its summary (up to MaxKeptBytesPerSession):
  // the payload under its message identifier, packed as the daemon packs it.
  const Value kept(Dictionary{{Value("audio_stream_begin_1"), Value(payload)}});
  const std::size_t keptBytes = packedFootprint(packValue(kept));
  const std::size_t keptJson = toJson(kept, JsonMode::Lenient).value_or("").size();
  std::printf("   Kept for the summary: %zu bytes a message against %zu of compact JSON (%.2fx, target <= 1.5x).\n\n",
              keptBytes, keptJson, static_cast<double>(keptBytes) / static_cast<double>(keptJson));
  std::printf("  %-4s %8s %6s %7s %6s %6s %7s %6s %6s %7s %8s %7s %8s\n", "rep", "accepted", "failed", "msgs/s",
              "before", "peak", "stopped", "peak1s", "+1 s", "back ms", "growth/m", "target", "stored");
  std::vector<double> rate, before, peak, stopped, peakAfter, later, perMsg;
  bool met = true, allStored = true;
  for (int rep = 1; rep <= env.repetitions && alive(env.pid); ++rep) {
    if (env.store) env.store->settle();
    const std::int64_t s0 = env.store ? env.store->maxId("telemetry_sessions") : 0;
    auto c = bench::connectClient(env.address);
    const std::int64_t id = 0x7000 + rep;
    const double base = rssMiB(env.pid);
    // Phase 0 while sending, 1 from the stop answer on, 2 to end.
    std::atomic<int> phase{0};
    std::atomic<double> topSend{base}, topAfter{0}, backMs{-1};
    Clock::time_point stoppedAt;
    std::thread sampler([&] {
      for (int ph; (ph = phase.load()) < 2; std::this_thread::sleep_for(10ms)) {
        const double rss = rssMiB(env.pid);
        auto& top = ph == 0 ? topSend : topAfter;
        top = std::max(top.load(), rss);
        if (ph == 1 && backMs.load() < 0 && rss <= base * 1.10) backMs = ms(Clock::now() - stoppedAt);
      }
    });
    c->createReportingSession(id);
    auto start = c->startReportingSessionForID(id);
    std::uint64_t ok = 0, failed = 0;
    std::string firstError;
    const std::vector<std::int64_t> to{id};
    auto t0 = Clock::now();
    // The held start is a pending call of its own, so the window counts sends only.
    for (std::size_t sent = 0; sent < messages || ok + failed < sent;) {
      while (sent < messages && sent - ok - failed < window) {
        ++sent;
        auto s = c->sendMessageAsync(payload, kCategory, 1, to, [&](const client::Status& answer) {
          if (answer)
            ++ok;
          else if (failed++ == 0)
            firstError = answer.error().name + ": " + answer.error().message;
        });
        if (!s && failed++ == 0) firstError = s.error().name + ": " + s.error().message;
      }
      c->pump(100ms);
    }
    rate.push_back(static_cast<double>(ok) / (ms(Clock::now() - t0) / 1000));
    auto stopAnswer = c->stopReportingSessionForID(id);
    stoppedAt = Clock::now();
    const double atStop = rssMiB(env.pid);
    phase = 1;
    std::this_thread::sleep_until(stoppedAt + 1s);
    phase = 2;
    sampler.join();
    before.push_back(base), peak.push_back(topSend.load()), stopped.push_back(atStop);
    peakAfter.push_back(std::max(topAfter.load(), atStop)), later.push_back(rssMiB(env.pid));
    if (backMs.load() < 0 && atStop <= base * 1.10) backMs = 0;
    perMsg.push_back(ok ? (peak.back() - base) * 1048576.0 / static_cast<double>(ok) : 0);
    met = met && backMs.load() >= 0;
    std::int64_t rows = -1;
    if (env.store) {
      // Type 1 rows: the summary (type 65535) and driver deltas (type 0) are not the client's.
      const std::string sid = "(SELECT MIN(id) FROM telemetry_sessions WHERE id > " + std::to_string(s0) + ")";
      rows = env.store->await("SELECT COUNT(*) FROM telemetry_messages WHERE type = 1 AND session = " + sid,
                              static_cast<std::int64_t>(ok), 60s, 3s);
      allStored = allStored && rows == static_cast<std::int64_t>(ok);
    }
    char back[16] = "no";
    if (backMs.load() >= 0) std::snprintf(back, sizeof back, "%.0f", backMs.load());
    std::printf("  %-4d %8llu %6llu %7.0f %6.1f %6.1f %7.1f %6.1f %6.1f %7s %8.0f %7s %8lld%s\n", rep,
                (unsigned long long)ok, (unsigned long long)failed, rate.back(), base, peak.back(), stopped.back(),
                peakAfter.back(), later.back(), back, perMsg.back(), backMs.load() >= 0 ? "met" : "MISSED",
                (long long)rows, stopAnswer ? "" : "  (stop failed)");
    if (!firstError.empty()) std::printf("       first error: %s\n", firstError.c_str());
    c->destroyReportingSession(id);
  }
  std::printf("  %-4s %8s %6s %7.0f %6.1f %6.1f %7.1f %6.1f %6.1f %7s %8.0f\n", "med", "", "", median(rate),
              median(before), median(peak), median(stopped), median(peakAfter), median(later), "", median(perMsg));
  const bool up = alive(env.pid);
  std::printf(
      "\n  RSS growth per message %.0f bytes against %zu bytes of compact JSON per payload (%.2fx).\n"
      "  target RSS within 10%% of before within 1 s of stop: %s; rows stored = messages accepted: %s;\n"
      "  daemon alive after: %s\n\n",
      median(perMsg), jsonBytes, median(perMsg) / static_cast<double>(jsonBytes), met ? "met" : "MISSED",
      env.store ? (allStored ? "yes" : "NO") : "no store", up ? "yes" : "NO");
  return up;
}


// ---------------------------------------------------------------- 4. idle
//
// sessions created and started (without asking for the start's answer) by clients of
// perClient sessions each, then left idle. With wait, telemetry.conf says Backends=none
// during the burst, so every new session's queue waits out its backend interval. A
// probe session started before the burst sends one message every 20 ms throughout; its
// latency is from the send to its row being readable in the store.

bool scenarioIdle(const Env& env, std::size_t sessions, std::size_t perClient, std::size_t parallel, bool wait) {
  const std::size_t clientCount = (sessions + perClient - 1) / perClient;
  std::printf(
      "== %s. %zu sessions created and started by %zu clients (%zu each), then left idle%s.\n"
      "   RSS per session = (RSS idle - RSS before the clients connected) / sessions (target <= 4 KiB);\n"
      "   threads: the daemon's peak, sampled every 10 ms (target <= 12). A probe session started\n"
      "   before the burst sends every 20 ms; probe ms = send to its row readable in the store,\n"
      "   before the burst and from the burst to %s after it (target: no stall over 100 ms).\n\n",
      wait ? "5. wait" : "4. idle", sessions, clientCount, perClient,
      wait ? ", each waiting for backends (Backends=none)" : "", wait ? "9.5 s" : "1 s");
  std::printf("  %-4s %7s %6s %8s %8s %7s %6s %7s | %6s %6s | %6s %6s %6s %6s\n", "rep", "burst s", "errors", "RSS0 MiB",
              "idle MiB", "B/sess", "target", "threads", "target", "end", "p50 0", "p99 0", "p50", "max");
  const std::string conf = linux_platform::ServiceDirectories::fromEnvironment().configuration + "/telemetry.conf";
  std::vector<double> burst, rss0, rssIdle, perSession, threadsPeak, rssEnd, p50Before, p99Before, p50During,
      maxDuring;
  bool met = true;
  for (int rep = 1; rep <= env.repetitions && alive(env.pid); ++rep) {
    if (env.store) env.store->settle();
    const double base = rssMiB(env.pid);
    const std::int64_t s0 = env.store ? env.store->maxId("telemetry_sessions") : 0;
    auto probe = bench::connectClient(env.address);
    const std::int64_t probeId = 0x7100 + rep;
    probe->createReportingSession(probeId);
    probe->startReportingSessionForIDNoWait(probeId);
    // By row id from where this repetition starts, so the poll stays cheap in a big store.
    const std::string probeRows =
        "SELECT COUNT(*) FROM telemetry_messages WHERE id > " +
        std::to_string(env.store ? env.store->maxId("telemetry_messages") : 0) +
        " AND type = 1 AND session = (SELECT MIN(id) FROM telemetry_sessions WHERE id > " + std::to_string(s0) + ")";
    const Dictionary payload = bench::makePayload();
    const std::vector<std::int64_t> to{probeId};
    // Phase 0: floor, 1: burst and after, 2: done.
    std::atomic<int> phase{0};
    std::vector<double> lat[2];
    std::thread prober([&] {
      std::int64_t stored = env.store ? env.store->number(probeRows) : 0;
      for (int ph; (ph = phase.load()) < 2; std::this_thread::sleep_for(20ms)) {
        auto t0 = Clock::now();
        if (!probe->sendMessage(payload, kCategory, 1, to)) continue;
        while (env.store && env.store->number(probeRows) <= stored && Clock::now() - t0 < 30s)
          std::this_thread::sleep_for(1ms);
        ++stored;
        lat[ph].push_back(ms(Clock::now() - t0));
      }
    });
    std::atomic<double> peakThreads{bench::procStatus(env.pid, "Threads")};
    std::atomic<bool> sampling{true};
    std::thread sampler([&] {
      for (; sampling; std::this_thread::sleep_for(10ms))
        peakThreads = std::max(peakThreads.load(), bench::procStatus(env.pid, "Threads"));
    });
    std::this_thread::sleep_for(1s);

    std::string saved;
    bool hadConf = false;
    if (wait) {
      std::ifstream in(conf);
      hadConf = in.good();
      saved.assign(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
      std::ofstream(conf) << "Backends=none\n";
    }
    std::vector<std::unique_ptr<client::Client>> clients(clientCount);
    std::atomic<std::size_t> next{0}, errors{0};
    phase = 1;
    auto t0 = Clock::now();
    std::vector<std::thread> threads;
    for (std::size_t t = 0; t < parallel; ++t)
      threads.emplace_back([&] {
        for (std::size_t c; (c = next++) < clientCount;) {
          clients[c] = bench::connectClient(env.address);
          for (std::size_t k = 0; k < perClient && c * perClient + k < sessions; ++k) {
            const auto id = static_cast<std::int64_t>(1000000 * rep + c * perClient + k);
            if (!clients[c]->createReportingSession(id) || !clients[c]->startReportingSessionForIDNoWait(id)) ++errors;
          }
          if (!clients[c]->getAllReporters()) ++errors;  // every start has been handled
        }
      });
    for (auto& t : threads) t.join();
    burst.push_back(ms(Clock::now() - t0) / 1000);
    if (wait) {
      if (hadConf)
        std::ofstream(conf) << saved;
      else
        std::remove(conf.c_str());
    }
    std::this_thread::sleep_for(wait ? 9500ms : 1s);  // the last wait ends 9 s after its start
    const double idle = rssMiB(env.pid);
    phase = 2;
    prober.join();
    clients.clear();  // gone: the daemon stops and drops their sessions
    probe.reset();
    if (env.store) env.store->settle();
    std::this_thread::sleep_for(1s);
    sampling = false;
    sampler.join();
    rss0.push_back(base), rssIdle.push_back(idle), rssEnd.push_back(rssMiB(env.pid));
    perSession.push_back((idle - base) * 1048576.0 / static_cast<double>(sessions));
    threadsPeak.push_back(peakThreads.load());
    p50Before.push_back(percentile(lat[0], 0.5)), p99Before.push_back(percentile(lat[0], 0.99));
    p50During.push_back(percentile(lat[1], 0.5)), maxDuring.push_back(percentile(lat[1], 1.0));
    const bool memOk = perSession.back() <= 4096, threadsOk = threadsPeak.back() <= 12, probeOk = maxDuring.back() <= 100;
    met = met && memOk && threadsOk && probeOk;
    std::printf("  %-4d %7.1f %6zu %8.1f %8.1f %7.0f %6s %7.0f | %6s %6.1f | %6.1f %6.1f %6.1f %6.1f%s\n", rep,
                burst.back(), errors.load(), base, idle, perSession.back(), memOk ? "met" : "MISSED",
                threadsPeak.back(), threadsOk ? "met" : "MISSED", rssEnd.back(), p50Before.back(), p99Before.back(),
                p50During.back(), maxDuring.back(), probeOk ? "" : "  (probe stalled)");
  }
  std::printf("  %-4s %7.1f %6s %8.1f %8.1f %7.0f %6s %7.0f | %6s %6.1f | %6.1f %6.1f %6.1f %6.1f\n", "med",
              median(burst), "", median(rss0), median(rssIdle), median(perSession), "", median(threadsPeak), "",
              median(rssEnd), median(p50Before), median(p99Before), median(p50During), median(maxDuring));
  const bool up = alive(env.pid);
  std::printf("\n  targets (<= 4 KiB per session, <= 12 threads, probe under 100 ms): %s; daemon alive after: %s\n\n",
              met ? "met" : "MISSED", up ? "yes" : "NO");
  return up;
}

}  // namespace

int main(int argc, char** argv) {
  bench::Options opt(argc, argv, kUsage);
  std::setvbuf(stdout, nullptr, _IOLBF, 0);  // the report shows as it goes, also through a pipe
  Env env;
  env.address = opt.text("address", "");
  env.repetitions = static_cast<int>(std::max(3LL, opt.number("repetitions", 3)));
  const std::string scenarios = "," + opt.text("scenarios", "ping,vanish,flood,idle,wait") + ",";
  const std::string dbPath = opt.text("db", linux_platform::ServiceDirectories::fromEnvironment().state + "/vireo.db");

  sd_bus* bus = bench::openBus(env.address);
  std::optional<pid_t> pid;
  if (long long p = opt.number("pid", 0); p > 0)
    pid = static_cast<pid_t>(p);
  else
    pid = bench::daemonPid(bus);
  sd_bus_flush_close_unref(bus);
  if (!pid || !alive(*pid)) {
    std::fprintf(stderr, "the daemon is not on the bus (%s)\n", bench::kService);
    return 1;
  }
  env.pid = *pid;
  Store store(dbPath);
  if (store.number("SELECT COUNT(*) FROM telemetry_sessions") >= 0)
    env.store = &store;
  else
    std::fprintf(stderr, "note: no readable store at %s; rows are not counted\n", dbPath.c_str());

  std::printf("Vireo hostile load report: daemon pid %d, %d repetitions per scenario, medians in 'med' rows\n\n",
              static_cast<int>(env.pid), env.repetitions);
  bool up = true;
  if (up && scenarios.find(",ping,") != std::string::npos)
    up = scenarioPing(env, static_cast<double>(opt.number("seconds", 10)), static_cast<int>(opt.number("hostile", 4)));
  if (up && scenarios.find(",vanish,") != std::string::npos)
    up = scenarioVanish(env, static_cast<std::size_t>(std::max(2LL, opt.number("clients", 12000))),
                        static_cast<std::size_t>(std::max(1LL, opt.number("parallel", 8))));
  if (up && scenarios.find(",flood,") != std::string::npos)
    up = scenarioFlood(env, static_cast<std::size_t>(std::max(1LL, opt.number("messages", 150000))),
                       static_cast<std::size_t>(std::max(1LL, opt.number("window", 64))));
  for (bool wait : {false, true})
    if (up && scenarios.find(wait ? ",wait," : ",idle,") != std::string::npos)
      up = scenarioIdle(env, static_cast<std::size_t>(std::max(1LL, opt.number("sessions", 10000))),
                        static_cast<std::size_t>(std::max(1LL, opt.number("per-client", 50))),
                        static_cast<std::size_t>(std::max(1LL, opt.number("parallel", 8))), wait);
  if (!up) std::printf("the daemon (pid %d) is gone\n", static_cast<int>(env.pid));
  return up ? 0 : 1;
}
