// Backend wait load: N reporting sessions start at once against a telemetry service
// that answers discovery with no list of backends (as the store does with
// Backends=none), so every session's queue waits out its whole backend interval,
// with one message queued behind the wait. Meanwhile another serial queue of the
// same class is probed: a probe is one closure, and its latency is the time from
// its submission to the start of its run. The floor is the same probe on the same
// pool before any session exists. Probes run during the start burst and then while
// every queue is parked. The report also gives the peak thread count of the process
// (/proc/self/status), how long the N starts took to reach their wait, and how long
// after the first interval ended every wait had given up and run what was queued
// behind it (the deadlines fall as spread out as the starts were).
//
// In-process: the real ThreadPoolDispatcher and VRReportingSession, the recording
// fakes for everything else. Each figure is the median over the repetitions.
//
// Run: backend_wait_load [--sessions 10000] [--repetitions 3] [--interval 3] [--probes 400]
#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "dispatch/thread_pool.h"
#include "fakes/fake_platform.h"
#include "session/reporting_session.h"
#include "vocabulary/reporting_environment.h"

namespace {

using namespace vireo;
using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

constexpr const char* kUsage =
    R"(usage: backend_wait_load [--sessions N] [--repetitions R] [--interval S] [--probes P]
  --sessions N     sessions started at once (default 10000)
  --repetitions R  runs; each figure is the median (default 3, at least 3)
  --interval S     the sessions' backend wait interval in seconds (default 3)
  --probes P       probes of the other queue per phase, at least (default 400)
)";

std::map<std::string, double> parse(int argc, char** argv) {
  std::map<std::string, double> o{{"sessions", 10000}, {"repetitions", 3}, {"interval", 3}, {"probes", 400}};
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    std::string name = a.rfind("--", 0) == 0 ? a.substr(2) : "";
    if (a == "-h" || a == "--help" || !o.count(name) || i + 1 >= argc) {
      std::fputs(kUsage, a == "-h" || a == "--help" ? stdout : stderr);
      std::exit(a == "-h" || a == "--help" ? 0 : 2);
    }
    o[name] = std::atof(argv[++i]);
  }
  o["repetitions"] = std::max(3.0, o["repetitions"]);
  return o;
}

int processThreads() {
  std::ifstream in("/proc/self/status");
  for (std::string line; std::getline(in, line);)
    if (line.rfind("Threads:", 0) == 0) return std::atoi(line.c_str() + 8);
  return -1;
}

double micros(Clock::duration d) { return std::chrono::duration<double, std::micro>(d).count(); }

double percentile(std::vector<double> v, double p) {
  if (v.empty()) return 0;
  std::sort(v.begin(), v.end());
  return v[static_cast<std::size_t>(p * static_cast<double>(v.size() - 1) + 0.5)];
}

double median(std::vector<double> v) { return percentile(std::move(v), 0.5); }



// Probes one queue, one closure at a time, every ~0.5 ms, until told to stop (and at
// least `minimum` times). Each sample: when it was submitted, its latency in microseconds.
class Prober {
 public:
  Prober(std::shared_ptr<SerialQueue> queue, std::size_t minimum) : queue_(std::move(queue)), minimum_(minimum) {}

  struct Sample {
    Clock::time_point submitted;
    double micros;
  };
  std::vector<Sample> run(const std::atomic<bool>& stop) {
    std::vector<Sample> latencies;
    while (latencies.size() < minimum_ || !stop.load()) {
      const auto submitted = Clock::now();
      queue_->async([this, submitted] {
        const auto started = Clock::now();
        std::lock_guard lock(mu_);
        ran_ = started - submitted;
        cv_.notify_one();
      });
      std::unique_lock lock(mu_);
      if (!cv_.wait_for(lock, 60s, [&] { return ran_.has_value(); })) {
        std::fprintf(stderr, "a probe did not run within 60 s\n");
        std::exit(1);
      }
      latencies.push_back({submitted, micros(*ran_)});
      ran_.reset();
      lock.unlock();
      std::this_thread::sleep_for(500us);
    }
    return latencies;
  }

 private:
  const std::shared_ptr<SerialQueue> queue_;
  const std::size_t minimum_;
  std::mutex mu_;  // guards ran_
  std::condition_variable cv_;
  std::optional<Clock::duration> ran_;
};

struct Run {
  double floorP50 = 0, floorP99 = 0, burstP50 = 0, burstP99 = 0, parkedP50 = 0, parkedP99 = 0;
  double startsMs = 0, drainMs = 0;
  int threadsBefore = 0, threadsPeak = 0;
  std::size_t poolWorkers = 0, gaveUp = 0, dropped = 0;
  bool intervalTooShort = false;  // the parked probes ran into the first deadlines
};

Run runOnce(std::size_t sessions, double interval, std::size_t probes) {
  Run r;
  r.threadsBefore = processThreads();
  // Samples all along, floor included, so that both phases share its cost.
  std::atomic<bool> sampling{true};
  std::atomic<int> peak{processThreads()};
  std::thread sampler([&] {
    while (sampling.load()) {
      int n = processThreads();
      int seen = peak.load();
      while (n > seen && !peak.compare_exchange_weak(seen, n)) {
      }
      std::this_thread::sleep_for(1ms);
    }
  });

  testing::FakePlatform fake;
  fake.telemetry.setBehaviour({testing::BackendAnswer::Nothing, false, false});
  ThreadPoolDispatcher pool;
  r.poolWorkers = pool.workerCount();
  Platform platform = fake.over(pool);
  auto env = std::make_shared<ReportingEnvironment>(platform);
  env->backendWaitInterval = interval;
  auto probe = pool.makeSerialQueue("probe", QoS::Utility);

  std::atomic<bool> stop{true};
  {
    std::vector<double> floor;
    for (auto& sample : Prober(probe, probes).run(stop)) floor.push_back(sample.micros);
    r.floorP50 = percentile(floor, 0.5);
    r.floorP99 = percentile(floor, 0.99);
  }

  std::vector<std::shared_ptr<VRReportingSession>> all;
  all.reserve(sessions);
  for (std::size_t i = 0; i < sessions; ++i) {
    all.push_back(VRReportingSession::initWithID(env, static_cast<std::int64_t>(i + 1), {static_cast<int>(i)}));
    all.back()->setServiceType(2);
  }

  stop = false;
  std::vector<Prober::Sample> during;
  std::thread prober([&] { during = Prober(probe, 0).run(stop); });
  const auto burst = Clock::now();
  for (auto& s : all) {
    s->start();
    s->sendMessage(Dictionary{{"n", 1}}, 0x40000003, 1, nullptr);  // waits behind the backend wait
  }
  // Every backend closure has run (and parked its queue) once its telemetry session exists.
  while (fake.telemetry.created.with([](auto& v) { return v.size(); }) < sessions) std::this_thread::sleep_for(1ms);
  const auto allWaiting = Clock::now();
  r.startsMs = micros(allWaiting - burst) / 1000;
  stop = true;
  prober.join();
  std::vector<double> samples;
  for (auto& sample : during) samples.push_back(sample.micros);
  r.burstP50 = percentile(samples, 0.5);
  r.burstP99 = percentile(samples, 0.99);

  // Every queue is parked now; the first deadline is one interval after the burst began.
  samples.clear();
  for (auto& sample : Prober(probe, probes).run(stop)) samples.push_back(sample.micros);
  if (Clock::now() > burst + std::chrono::duration<double>(interval)) r.intervalTooShort = true;
  r.parkedP50 = percentile(samples, 0.5);
  r.parkedP99 = percentile(samples, 0.99);

  // Now the intervals run out: every wait gives up, and its message is let go after it.
  const auto firstDeadline =
      burst + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(interval));
  if (!pool.drain(std::chrono::milliseconds(static_cast<long long>(interval * 1000)) + 120s)) {
    std::fprintf(stderr, "the waits did not end\n");
    std::exit(1);
  }
  r.drainMs = std::max(0.0, micros(Clock::now() - firstDeadline) / 1000);
  sampling = false;
  sampler.join();
  r.threadsPeak = peak.load();
  r.gaveUp = fake.logger.count("failed to find backend");
  r.dropped = fake.logger.count("No valid SkylarkReportingSession");
  for (auto& s : all) s->stop();
  pool.drain(60s);
  all.clear();
  pool.shutdown();
  return r;
}

}  // namespace

int main(int argc, char** argv) {
  auto o = parse(argc, argv);
  const auto sessions = static_cast<std::size_t>(std::max(1.0, o["sessions"]));
  const auto reps = static_cast<int>(o["repetitions"]);
  const double interval = std::max(0.5, o["interval"]);
  const auto probes = static_cast<std::size_t>(std::max(10.0, o["probes"]));

  std::vector<Run> runs;
  for (int i = 0; i < reps; ++i) {
    runs.push_back(runOnce(sessions, interval, probes));
    const Run& r = runs.back();
    if (r.gaveUp != sessions || r.dropped != sessions) {
      std::fprintf(stderr, "run %d: %zu waits gave up and %zu queued messages ran, of %zu\n", i + 1, r.gaveUp,
                   r.dropped, sessions);
      return 1;
    }
    if (r.intervalTooShort) std::fprintf(stderr, "run %d: the interval ended before the parked probes did\n", i + 1);
  }
  auto med = [&](auto field) {
    std::vector<double> v;
    for (auto& r : runs) v.push_back(static_cast<double>(field(r)));
    return median(v);
  };
  const double floorP50 = med([](const Run& r) { return r.floorP50; });
  const double floorP99 = med([](const Run& r) { return r.floorP99; });
  const double burstP50 = med([](const Run& r) { return r.burstP50; });
  const double burstP99 = med([](const Run& r) { return r.burstP99; });
  const double parkedP50 = med([](const Run& r) { return r.parkedP50; });
  const double parkedP99 = med([](const Run& r) { return r.parkedP99; });
  auto ratio = [](double a, double b) { return b > 0 ? a / b : 0; };

  std::printf("Vireo backend wait load\n");
  std::printf("  %zu sessions start at once; discovery answers with no backends, so each queue waits\n"
              "  its full %.1f s interval (parked) with one message behind it. Probe: one closure on\n"
              "  another Utility serial queue, latency from submission to run. Floor: the same probe\n"
              "  on the same pool before any session exists. Medians of %d runs.\n\n",
              sessions, interval, reps);
  std::printf("  %-34s %12s %12s\n", "probe latency", "p50 (us)", "p99 (us)");
  std::printf("  %-34s %12.1f %12.1f\n", "floor (no parked queues)", floorP50, floorP99);
  std::printf("  %-34s %12.1f %12.1f\n", "while the sessions start", burstP50, burstP99);
  std::printf("  %-34s %12.1f %12.1f\n", "while all of them wait, parked", parkedP50, parkedP99);
  std::printf("  %-34s %12.2f %12.2f\n", "  start burst / floor", ratio(burstP50, floorP50), ratio(burstP99, floorP99));
  std::printf("  %-34s %12.2f %12.2f\n", "  parked / floor", ratio(parkedP50, floorP50), ratio(parkedP99, floorP99));
  std::printf("\n  pool workers                        %.0f (plus one timer thread)\n",
              med([](const Run& r) { return r.poolWorkers; }));
  std::printf("  process threads before the pool     %.0f\n", med([](const Run& r) { return r.threadsBefore; }));
  std::printf("  process threads, peak under load    %.0f (the tool itself adds a prober and a sampler)\n",
              med([](const Run& r) { return r.threadsPeak; }));
  std::printf("  all %zu starts reached their wait    %.0f ms after the first\n", sessions,
              med([](const Run& r) { return r.startsMs; }));
  std::printf("  all waits given up, messages run     %.0f ms after the first interval ended\n",
              med([](const Run& r) { return r.drainMs; }));
  std::printf("  in every run: %zu waits gave up, then their %zu queued messages ran\n", sessions, sessions);
  return 0;
}
