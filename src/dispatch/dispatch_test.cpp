#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <future>
#include <mutex>
#include <random>
#include <set>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "dispatch/thread_pool.h"

namespace vireo {
namespace {

using namespace std::chrono_literals;

int threadsOfProcess() {
  return static_cast<int>(std::distance(std::filesystem::directory_iterator("/proc/self/task"), {}));
}

// A countdown that tests can wait on with a deadline, so a fault fails instead of hanging.
class Countdown {
 public:
  explicit Countdown(int n) : left_(n) {}
  void arrive() {
    std::lock_guard lock(mu_);
    if (--left_ <= 0) cv_.notify_all();
  }
  bool wait(std::chrono::milliseconds budget = 10s) {
    std::unique_lock lock(mu_);
    return cv_.wait_for(lock, budget, [&] { return left_ <= 0; });
  }

 private:
  std::mutex mu_;  // guards left_
  std::condition_variable cv_;
  int left_;
};

ThreadPoolDispatcher::Options small(std::size_t workers) {
  ThreadPoolDispatcher::Options o;
  o.coreWorkers = workers;
  return o;
}

// Many producers feed many queues; every closure checks that it is alone on its
// queue and that each producer's sequence numbers arrive in order.
TEST(SerialQueue, NeverRunsTwoClosuresOfOneQueueAtOnceUnderStress) {
  constexpr int kQueues = 64, kProducers = 4, kPerProducer = 4000;
  ThreadPoolDispatcher::Options o = small(4);
  o.batchSize = 3;  // many hand-overs between workers
  ThreadPoolDispatcher pool(o);
  struct State {
    std::shared_ptr<SerialQueue> queue;
    std::atomic<int> inFlight{0};
    int lastSeq[kProducers];
  };
  std::vector<State> states(kQueues);
  for (int i = 0; i < kQueues; ++i) {
    states[i].queue = pool.makeSerialQueue("q" + std::to_string(i), QoS(i % 5));
    std::fill(std::begin(states[i].lastSeq), std::end(states[i].lastSeq), -1);
  }
  std::atomic<int> overlaps{0}, reorders{0}, ran{0};
  std::vector<std::thread> producers;
  for (int p = 0; p < kProducers; ++p) {
    producers.emplace_back([&, p] {
      std::mt19937 rng(static_cast<unsigned>(p));
      for (int seq = 0; seq < kPerProducer; ++seq) {
        State& s = states[rng() % kQueues];
        s.queue->async([&s, &overlaps, &reorders, &ran, p, seq] {
          if (s.inFlight.fetch_add(1) != 0) ++overlaps;
          if (s.lastSeq[p] >= seq) ++reorders;
          s.lastSeq[p] = seq;
          if (seq % 97 == 0) std::this_thread::yield();
          s.inFlight.fetch_sub(1);
          ++ran;
        });
      }
    });
  }
  for (auto& t : producers) t.join();
  ASSERT_TRUE(pool.drain(30s));
  EXPECT_EQ(ran.load(), kProducers * kPerProducer);
  EXPECT_EQ(overlaps.load(), 0);
  EXPECT_EQ(reorders.load(), 0);
}

TEST(SerialQueue, TenThousandQueuesShareAFewThreads) {
  int before = threadsOfProcess();
  ThreadPoolDispatcher pool(small(3));
  std::mutex mu;  // guards ids
  std::set<std::thread::id> ids;
  std::atomic<int> maxThreads{0};
  std::vector<std::shared_ptr<SerialQueue>> queues;
  for (int i = 0; i < 10000; ++i) queues.push_back(pool.makeSerialQueue("many", QoS::Utility));
  for (int round = 0; round < 3; ++round) {
    for (auto& q : queues) {
      q->async([&, sample = (&q - queues.data()) % 100 == 0] {
        {
          std::lock_guard lock(mu);
          ids.insert(std::this_thread::get_id());
        }
        if (!sample) return;
        int n = threadsOfProcess();
        int seen = maxThreads.load();
        while (n > seen && !maxThreads.compare_exchange_weak(seen, n)) {
        }
      });
    }
  }
  ASSERT_TRUE(pool.drain(60s));
  EXPECT_LE(ids.size(), 3u);
  EXPECT_LE(maxThreads.load(), before + 3);
  EXPECT_EQ(pool.workerCount(), 3u);
}

TEST(BlockingRegion, BlockedQueuesDoNotStallOtherQueuesAndStandInsAreCapped) {
  ThreadPoolDispatcher::Options o = small(2);
  o.extraIdleTimeout = 50ms;
  o.maxExtraWorkers = 2;
  ThreadPoolDispatcher pool(o);
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  // Both core workers block; the other queues still complete thanks to stand-ins.
  Countdown entered(2);
  std::vector<std::shared_ptr<SerialQueue>> queues;
  for (int i = 0; i < 2; ++i) {
    queues.push_back(pool.makeSerialQueue("blocked", QoS::Utility));
    queues.back()->async([&, released] {
      BlockingRegion outer;
      BlockingRegion nested;  // counted once
      entered.arrive();
      released.wait_for(20s);
    });
  }
  ASSERT_TRUE(entered.wait());
  Countdown others(100);
  for (int i = 0; i < 100; ++i) {
    queues.push_back(pool.makeSerialQueue("free", QoS::Default));
    queues.back()->async([&] { others.arrive(); });
  }
  EXPECT_TRUE(others.wait());
  EXPECT_GE(pool.workerCount(), 3u);

  // Blocking stand-ins too: never more than maxExtraWorkers of them.
  Countdown standIns(2);
  std::atomic<int> done{0};
  for (int i = 0; i < 4; ++i) {
    queues.push_back(pool.makeSerialQueue("capped", QoS::Default));
    queues.back()->async([&, released] {
      BlockingRegion region;
      standIns.arrive();
      released.wait_for(20s);
      ++done;
    });
  }
  ASSERT_TRUE(standIns.wait());
  std::this_thread::sleep_for(50ms);
  EXPECT_EQ(pool.workerCount(), 4u);
  EXPECT_EQ(done.load(), 0);
  EXPECT_FALSE(pool.drain(20ms));  // the blocked closures are still pending

  release.set_value();
  ASSERT_TRUE(pool.drain(10s));
  EXPECT_EQ(done.load(), 4);
  // The stand-ins leave once idle.
  auto deadline = std::chrono::steady_clock::now() + 10s;
  while (pool.workerCount() > 2 && std::chrono::steady_clock::now() < deadline) std::this_thread::sleep_for(10ms);
  EXPECT_EQ(pool.workerCount(), 2u);
}

// Delayed tasks, submitted out of order, run no earlier than their delay and
// side by side: each waits until all have started.
TEST(LowPriority, DelayedTasksRunNoEarlierThanTheirDelayAndConcurrently) {
  ThreadPoolDispatcher pool(small(3));
  auto start = std::chrono::steady_clock::now();
  std::mutex mu;  // guards elapsed
  std::vector<std::pair<std::chrono::milliseconds, std::chrono::steady_clock::duration>> elapsed;
  Countdown started(3);
  std::atomic<int> overlapped{0};
  for (auto delay : {120ms, 40ms, 80ms}) {
    pool.asyncLowPriority(delay, [&, delay] {
      {
        std::lock_guard lock(mu);
        elapsed.emplace_back(delay, std::chrono::steady_clock::now() - start);
      }
      started.arrive();
      if (started.wait(10s)) ++overlapped;
    });
  }
  ASSERT_TRUE(started.wait());
  ASSERT_TRUE(pool.drain(10s));
  EXPECT_EQ(overlapped.load(), 3);
  std::lock_guard lock(mu);
  ASSERT_EQ(elapsed.size(), 3u);
  for (auto& [delay, took] : elapsed) EXPECT_GE(took, delay);
}

// Throwing and empty closures, drain over cascaded work, and shutdown.
TEST(Lifecycle, ThrowsDrainAndShutdown) {
  std::shared_ptr<SerialQueue> survivor;
  std::atomic<int> ran{0};
  std::atomic<bool> delayedRan{false};
  {
    ThreadPoolDispatcher pool(small(2));
    survivor = pool.makeSerialQueue("a", QoS::Default);
    auto b = pool.makeSerialQueue("b", QoS::Background);
    pool.asyncLowPriority(std::chrono::hours(1), [&] { delayedRan = true; });
    survivor->async([] { throw std::runtime_error("boom"); });
    survivor->async([] { throw 42; });
    survivor->async(Task{});  // an empty closure is ignored
    pool.asyncLowPriority(0ns, [] { throw std::runtime_error("boom"); });
    pool.asyncLowPriority(0ns, [&] { ++ran; });
    survivor->async([&] {
      std::this_thread::sleep_for(20ms);
      ++ran;
      b->async([&] {
        std::this_thread::sleep_for(20ms);
        ++ran;
      });
    });
    EXPECT_TRUE(pool.drain(10s));  // waits for the cascade, not for the hour
    EXPECT_EQ(ran.load(), 3);
    pool.shutdown();
    pool.shutdown();  // idempotent
    EXPECT_EQ(pool.workerCount(), 0u);
    EXPECT_FALSE(delayedRan.load());
    survivor->async([&] { ++ran; });
    pool.asyncLowPriority(0ns, [&] { ++ran; });
    EXPECT_TRUE(pool.drain(10ms));
  }
  survivor->async([&] { ++ran; });  // the dispatcher is gone: ignored
  EXPECT_EQ(ran.load(), 3);
}

TEST(Lifecycle, ClosureSubmittedFromAClosureDuringShutdownIsDropped) {
  std::atomic<int> ran{0};
  auto pool = std::make_unique<ThreadPoolDispatcher>(small(1));
  auto q = pool->makeSerialQueue("self", QoS::Default);
  // A closure keeping its own queue alive must not leak when dropped.
  std::promise<void> go, running;
  auto gate = go.get_future().share();
  q->async([q, gate, &ran, &running] {
    running.set_value();
    gate.wait_for(10s);
    ++ran;
    q->async([&ran] { ++ran; });
  });
  for (int i = 0; i < 10; ++i) q->async([q, &ran] { ++ran; });
  ASSERT_EQ(running.get_future().wait_for(10s), std::future_status::ready);
  std::thread stopper([&] { pool->shutdown(); });
  std::this_thread::sleep_for(20ms);
  go.set_value();
  stopper.join();
  pool.reset();
  EXPECT_GE(ran.load(), 1);
  EXPECT_LE(ran.load(), 12);
}

}  // namespace
}  // namespace vireo
