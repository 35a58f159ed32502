// The server queue on the bus thread: inline when idle, FIFO always, a bounded batch
// per turn of the loop, and still serial once the loop has ended.
#include "daemon/bus_thread_queue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "base/mutex.h"

namespace vireo::daemon {
namespace {

class NullLogger final : public Logger {
 public:
  bool verbose(LogScope) const override { return false; }
  void write(LogScope, LogLevel, const char*, int, const char*, std::string_view) override {}
};

TEST(BusThreadQueue, RunsInlineWhenIdleInOrderAndInBatches) {
  NullLogger logger;
  auto mailbox = std::make_shared<BusMailbox>();
  mailbox->bindToCurrentThread();  // this test's thread plays the bus thread
  auto queue = BusThreadQueue::make(mailbox, "server", logger);
  std::vector<std::string> ran;

  // Idle: runs before async returns; what it submits runs after it, not inside it.
  queue->async([&] {
    ran.push_back("a");
    queue->async([&] { ran.push_back("c"); });
    ran.push_back("b");
  });
  EXPECT_EQ(ran, (std::vector<std::string>{"a", "b", "c"}));

  // From another thread: nothing runs until the bus thread drains its mailbox, and
  // a flood runs a batch per turn so that the bus is read in between.
  ran.clear();
  std::thread([&] {
    for (int i = 0; i < 100; ++i) queue->async([&ran, i] { ran.push_back(std::to_string(i)); });
  }).join();
  EXPECT_TRUE(ran.empty());
  mailbox->drain();
  EXPECT_EQ(ran.size(), 64u);
  mailbox->drain();
  ASSERT_EQ(ran.size(), 100u);
  for (int i = 0; i < 100; ++i) EXPECT_EQ(ran[static_cast<std::size_t>(i)], std::to_string(i));

  // Once the loop has ended, closures run on the submitting thread, one at a time.
  mailbox->close();
  ran.clear();
  Mutex mutex;
  std::atomic<int> running{0}, overlap{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t)
    threads.emplace_back([&] {
      for (int i = 0; i < 50; ++i)
        queue->async([&] {
          overlap += running.fetch_add(1) > 0;
          std::this_thread::yield();
          running.fetch_sub(1);
          MutexLock lock(mutex);
          ran.push_back("x");
        });
    });
  for (auto& t : threads) t.join();
  EXPECT_EQ(ran.size(), 200u);
  EXPECT_EQ(overlap, 0);
}

}  // namespace
}  // namespace vireo::daemon
