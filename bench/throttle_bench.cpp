// Message throttle: submission throughput and delivery lag on the real clock.
//
// Submissions: each iteration submits a batch of 10,000 messages, all distinct or
// all the same (one hot key), with the longest accepted hold (4 s) so that nothing
// fires while the batch is measured. The same iteration measures two floors on the
// same messages: building the message key alone, and a mutex-guarded hash-map
// insert of the precomputed keys. x_key_floor and x_map_floor are the submission
// time divided by each floor's time.
//
// Lag: messages with a hold of 0 are submitted as fast as possible; the lag of a
// delivery is the time from its due date (its submission, since the hold is 0) to
// the start of its closure on the worker. The worker looks for new entries every
// 0.1 s, so that pass interval bounds the lag from above. Each iteration starts its
// batch at a different point of the worker's 0.1 s cycle (steps of 37 ms), so the
// percentiles cover all phases rather than one.
//
// Run: throttle_bench --benchmark_repetitions=3 --benchmark_report_aggregates_only=true
#include <benchmark/benchmark.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <mutex>
#include <thread>
#include <unordered_map>
#include <vector>

#include "throttle/block_throttle.h"

namespace {

using namespace vireo;
using Clock = std::chrono::steady_clock;

constexpr int kBatch = 10'000;
constexpr std::int64_t kReporter = 42;
constexpr std::uint32_t kCategory = 0x40000003;
constexpr std::uint32_t kType = 1;

struct NullLogger final : Logger {
  bool verbose(LogScope) const override { return false; }
  void write(LogScope, LogLevel, const char*, int, const char*, std::string_view) override {}
};

// A typical volume-and-route report; i makes it distinct (or not, for the hot key).
Dictionary makeMessage(int i, double hold) {
  return {{"Route", "Speaker"},
          {"DeviceID", i},
          {"Level", 0.25 * (i % 4)},
          {"Channels", Array{1, 2}},
          {"vrreporting_timestamp", 1'700'000'000.5 + i},
          {"_throttle_seconds", hold}};
}

std::vector<Dictionary> makeBatch(int n, bool hot, double hold) {
  std::vector<Dictionary> batch;
  batch.reserve(static_cast<std::size_t>(n));
  for (int i = 0; i < n; ++i) batch.push_back(makeMessage(hot ? 0 : i, hold));
  return batch;
}

template <typename F>
double secondsOf(F&& f) {
  auto start = Clock::now();
  f();
  return std::chrono::duration<double>(Clock::now() - start).count();
}

void BM_Submit(benchmark::State& state, bool hot) {
  NullLogger logger;
  const auto messages = makeBatch(kBatch, hot, 4.0);
  std::vector<std::string> keys;
  for (const auto& m : messages) keys.push_back(VRReportingBlockThrottle::buildMessageKey(m, kReporter, kCategory, kType));

  double submitSeconds = 0, keySeconds = 0, mapSeconds = 0;
  for (auto _ : state) {
    keySeconds += secondsOf([&] {
      for (const auto& m : messages)
        benchmark::DoNotOptimize(VRReportingBlockThrottle::buildMessageKey(m, kReporter, kCategory, kType));
    });
    {
      std::mutex lock;
      std::unordered_map<std::string, std::shared_ptr<int>> map;
      mapSeconds += secondsOf([&] {
        for (const auto& k : keys) {
          std::lock_guard guard(lock);
          auto [it, inserted] = map.try_emplace(k);
          if (inserted) it->second = std::make_shared<int>(0);
        }
      });
    }
    auto throttle = VRReportingBlockThrottle::make(logger);
    double t = secondsOf([&] {
      for (const auto& m : messages) throttle->addMessageBlock([] {}, kReporter, m, kCategory, kType);
    });
    state.SetIterationTime(t);
    submitSeconds += t;
    throttle->stop();  // drops the 10,000 pending entries, outside the measurement
  }
  double n = static_cast<double>(state.iterations()) * kBatch;
  state.SetItemsProcessed(static_cast<std::int64_t>(n));
  state.counters["submit_per_s"] = n / submitSeconds;
  state.counters["key_floor_per_s"] = n / keySeconds;
  state.counters["map_floor_per_s"] = n / mapSeconds;
  state.counters["x_key_floor"] = submitSeconds / keySeconds;
  state.counters["x_map_floor"] = submitSeconds / mapSeconds;
}

void BM_DeliveryLag(benchmark::State& state, bool hot) {
  NullLogger logger;
  const int n = static_cast<int>(state.range(0));
  const auto messages = makeBatch(n, hot, 0.0);
  std::vector<double> lags;
  double deliveries = 0;
  int round = 0;
  for (auto _ : state) {
    auto throttle = VRReportingBlockThrottle::make(logger);
    std::this_thread::sleep_for(std::chrono::milliseconds(1 + (37 * round++) % 100));
    // Slot i is written by message i's closure on the worker, read after the drain.
    std::vector<double> slot(static_cast<std::size_t>(n), -1.0);
    auto start = Clock::now();
    for (int i = 0; i < n; ++i) {
      auto submitted = Clock::now();
      throttle->addMessageBlock(
          [&slot, i, submitted] {
            slot[static_cast<std::size_t>(i)] = std::chrono::duration<double>(Clock::now() - submitted).count();
          },
          kReporter, messages[static_cast<std::size_t>(i)], kCategory, kType);
    }
    while (throttle->timersInFlightCount() != 0) std::this_thread::sleep_for(std::chrono::milliseconds(1));
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
    throttle->stop();  // joins the worker: its writes to slot are visible from here on
    for (double lag : slot)
      if (lag >= 0) {
        lags.push_back(lag);
        deliveries += 1;
      }
  }
  std::sort(lags.begin(), lags.end());
  auto percentile = [&](double p) {
    return lags.empty() ? 0.0 : lags[static_cast<std::size_t>(p * static_cast<double>(lags.size() - 1))] * 1e3;
  };
  state.counters["lag_p50_ms"] = percentile(0.50);
  state.counters["lag_p99_ms"] = percentile(0.99);
  state.counters["lag_max_ms"] = percentile(1.0);
  state.counters["delivered"] = deliveries / static_cast<double>(state.iterations());
}

BENCHMARK_CAPTURE(BM_Submit, distinct_keys, false)->UseManualTime()->Unit(benchmark::kMillisecond);
BENCHMARK_CAPTURE(BM_Submit, one_hot_key, true)->UseManualTime()->Unit(benchmark::kMillisecond);
BENCHMARK_CAPTURE(BM_DeliveryLag, distinct_keys, false)
    ->Arg(1)
    ->Arg(kBatch)
    ->Iterations(20)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond);
BENCHMARK_CAPTURE(BM_DeliveryLag, one_hot_key, true)
    ->Arg(kBatch)
    ->Iterations(20)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
