#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <future>
#include <mutex>
#include <random>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "dispatch/thread_pool.h"
#include "fakes/fake_platform.h"

namespace vireo {
namespace {

using namespace std::chrono_literals;

int threadsOfProcess() {
  return static_cast<int>(std::distance(std::filesystem::directory_iterator("/proc/self/task"), {}));
}

// A countdown that tests can wait on with a deadline, so a fault fails instead of hanging.
struct Countdown {
  explicit Countdown(int n) : left(n) {}
  void arrive() {
    std::lock_guard lock(mu);
    if (--left <= 0) cv.notify_all();
  }
  bool wait(std::chrono::milliseconds budget = 10s) {
    std::unique_lock lock(mu);
    return cv.wait_for(lock, budget, [&] { return left <= 0; });
  }
  std::mutex mu;  // guards left
  std::condition_variable cv;
  int left;
};

// What ran, in order, across threads.
using Trail = testing::Recorder<std::string>;

// Many producers feed many queues; every closure checks that it is alone on its
// queue and that each producer's sequence numbers arrive in order.
TEST(SerialQueue, NeverRunsTwoClosuresOfOneQueueAtOnceUnderStress) {
  constexpr int kQueues = 64, kProducers = 4, kPerProducer = 4000;
  ThreadPoolDispatcher pool({.workers = 4, .batchSize = 3});  // many hand-overs between workers
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
        Task closure = [&s, &overlaps, &reorders, &ran, p, seq] {
          if (s.inFlight.fetch_add(1) != 0) ++overlaps;
          if (s.lastSeq[p] >= seq) ++reorders;
          s.lastSeq[p] = seq;
          if (seq % 97 == 0) std::this_thread::yield();
          s.inFlight.fetch_sub(1);
          ++ran;
        };
        // Half run on the producer itself whenever their queue is idle.
        if (seq % 2) {
          s.queue->asyncOrRun(std::move(closure));
        } else {
          s.queue->async(std::move(closure));
        }
      }
    });
  }
  for (auto& t : producers) t.join();
  ASSERT_TRUE(pool.drain(30s));
  EXPECT_EQ(ran.load(), kProducers * kPerProducer);
  EXPECT_EQ(overlaps.load(), 0);
  EXPECT_EQ(reorders.load(), 0);
}

TEST(SerialQueue, AsyncOrRunRunsOnTheCallerOnlyWhenTheQueueIsIdle) {
  ThreadPoolDispatcher pool({.workers = 2});
  auto queue = pool.makeSerialQueue("q", QoS::Default);
  const auto caller = std::this_thread::get_id();
  std::thread::id ranOn;
  queue->asyncOrRun([&] { ranOn = std::this_thread::get_id(); });
  EXPECT_EQ(ranOn, caller);

  // Busy: it waits its turn on the pool, behind the closure that holds the queue.
  Countdown release(1), done(1);
  Trail trail;
  queue->async([&] {
    release.wait();
    trail.add("first");
  });
  queue->asyncOrRun([&] {
    trail.add("second");
    ranOn = std::this_thread::get_id();
    done.arrive();
  });
  EXPECT_TRUE(trail().empty());
  release.arrive();
  ASSERT_TRUE(done.wait());
  EXPECT_EQ(trail(), (std::vector<std::string>{"first", "second"}));
  EXPECT_NE(ranOn, caller);
}

// Two workers, ten thousand parked queues: another queue still gets a thread. A
// resume from a thread outside the pool then lets every queue go on, its resume
// closure first and what waited behind the park after it.
TEST(Park, TenThousandParkedQueuesHoldNoThreadAndResumeInOrder) {
  constexpr int kQueues = 10000;
  const int before = threadsOfProcess();
  ThreadPoolDispatcher pool({.workers = 2});
  struct Parked {
    std::shared_ptr<SerialQueue> queue;
    std::shared_ptr<Parking> parking;
    std::vector<int> steps;  // touched only by the queue's closures, read after drain
  };
  std::vector<Parked> all(kQueues);
  Countdown parked(kQueues);
  for (auto& q : all) {
    q.queue = pool.makeSerialQueue("parked", QoS::Utility);
    q.queue->async([&q, &parked] {
      q.steps.push_back(1);
      q.parking = q.queue->park(std::chrono::hours(1), [&q] { q.steps.push_back(-1); });
      parked.arrive();
    });
    q.queue->async([&q] { q.steps.push_back(3); });
  }
  ASSERT_TRUE(parked.wait(60s));
  Countdown other(1);
  auto free = pool.makeSerialQueue("free", QoS::Utility);
  free->async([&] { other.arrive(); });
  EXPECT_TRUE(other.wait());
  EXPECT_EQ(pool.workerCount(), 2u);
  EXPECT_LE(threadsOfProcess(), before + 3);  // two workers and the timer
  EXPECT_FALSE(pool.drain(0ms));              // the parks are awaited work

  std::thread completions([&] {
    for (auto& q : all) EXPECT_TRUE(q.parking->resume([&q] { q.steps.push_back(2); }));
  });
  completions.join();
  ASSERT_TRUE(pool.drain(60s));
  for (auto& q : all) ASSERT_EQ(q.steps, (std::vector<int>{1, 2, 3}));
  EXPECT_FALSE(all[0].parking->resume([] {}));
}

// Whichever comes first ends the park: the deadline runs the timeout closure ahead
// of the queue and refuses a later resume; an earlier resume lets the timeout
// closure go at once, not when its deadline passes.
TEST(Park, DeadlineOrResumeWhicheverComesFirstAndOneParkAtATime) {
  ThreadPoolDispatcher pool({.workers = 2});
  auto q = pool.makeSerialQueue("timed", QoS::Default);
  Trail trail;
  std::shared_ptr<Parking> parking;
  q->async([&] { parking = q->park(20ms, [&] { trail.add("timeout"); }); });
  q->async([&] { trail.add("behind"); });
  ASSERT_TRUE(pool.drain(10s));  // the deadline passes within the drain
  EXPECT_EQ(trail(), (std::vector<std::string>{"timeout", "behind"}));
  EXPECT_FALSE(parking->resume([&] { trail.add("late"); }));

  auto token = std::make_shared<int>(0);
  std::weak_ptr<int> watch = token;
  Countdown parkedAgain(1);
  q->async([&, t = std::move(token)]() mutable {
    parking = q->park(std::chrono::hours(1), [&trail, t] { trail.add("timeout 2"); });
    t.reset();
    parkedAgain.arrive();
  });
  q->async([&] { trail.add("behind 2"); });
  ASSERT_TRUE(parkedAgain.wait());
  EXPECT_FALSE(watch.expired());
  EXPECT_TRUE(parking->resume([&] { trail.add("resumed"); }));
  EXPECT_TRUE(watch.expired());
  ASSERT_TRUE(pool.drain(10s));  // the spent deadline is not waited for

  // Resumed before the parking closure returns, the queue never stops. One park at a time.
  q->async([&] {
    auto first = q->park(std::chrono::hours(1), nullptr);
    EXPECT_FALSE(q->park(std::chrono::hours(1), nullptr)->resume(nullptr));
    EXPECT_TRUE(first->resume([&] { trail.add("next"); }));
    trail.add("returns");
  });
  q->async([&] { trail.add("behind 3"); });
  ASSERT_TRUE(pool.drain(10s));
  EXPECT_EQ(trail(), (std::vector<std::string>{"timeout", "behind", "resumed", "behind 2", "returns", "next",
                                                     "behind 3"}));
}

// drain waits for a parked queue only within its budget, and runs what waited behind
// it when the resume comes in time. shutdown never waits for a park: it lets go of
// the timeout closure and of the closures behind it, and later resumes are refused.
TEST(Park, DrainWithinItsBudgetAndShutdownDropsParkedQueues) {
  auto pool = std::make_unique<ThreadPoolDispatcher>(ThreadPoolDispatcher::Options{.workers = 2});
  auto q = pool->makeSerialQueue("parked", QoS::Utility);
  Trail trail;
  std::shared_ptr<Parking> parking;
  Countdown parked(1);
  q->async([&] {
    parking = q->park(std::chrono::hours(1), [&] { trail.add("timeout"); });
    parked.arrive();
  });
  q->async([&] { trail.add("behind"); });
  ASSERT_TRUE(parked.wait());
  EXPECT_FALSE(pool->drain(50ms));
  std::thread late([&] {
    std::this_thread::sleep_for(20ms);
    parking->resume(nullptr);
  });
  EXPECT_TRUE(pool->drain(10s));
  late.join();
  EXPECT_EQ(trail(), std::vector<std::string>{"behind"});

  auto token = std::make_shared<int>(0);
  std::weak_ptr<int> watch = token;
  Countdown parkedAgain(1);
  q->async([&, t = token] {
    parking = q->park(std::chrono::hours(1), [&trail, t] { trail.add("timeout 2"); });
    parkedAgain.arrive();
  });
  q->async([&trail, t = std::move(token)] { trail.add("behind 2"); });
  ASSERT_TRUE(parkedAgain.wait());
  auto stopped = std::async(std::launch::async, [&] { pool->shutdown(); });
  ASSERT_EQ(stopped.wait_for(10s), std::future_status::ready);
  EXPECT_TRUE(watch.expired());
  EXPECT_FALSE(parking->resume([&] { trail.add("after shutdown"); }));
  EXPECT_FALSE(q->park(1ms, [&] { trail.add("park after shutdown"); })->resume(nullptr));
  EXPECT_TRUE(pool->drain(0ms));
  pool.reset();
  EXPECT_EQ(trail(), std::vector<std::string>{"behind"});
}

// Delayed tasks, submitted out of order, run no earlier than their delay and
// side by side: each waits until all have started.
TEST(LowPriority, DelayedTasksRunNoEarlierThanTheirDelayAndConcurrently) {
  ThreadPoolDispatcher pool({.workers = 3});
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
    ThreadPoolDispatcher pool({.workers = 2});
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
  auto pool = std::make_unique<ThreadPoolDispatcher>(ThreadPoolDispatcher::Options{.workers = 1});
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
