// The process's dispatcher: one small, fixed pool of worker threads runs every
// serial queue and the shared low-priority queue; one timer thread keeps the
// delayed closures and the deadlines of parked queues.
#pragma once

#include <chrono>
#include <cstddef>
#include <memory>

#include "dispatch/dispatch.h"

namespace vireo {

class ThreadPoolDispatcher : public Dispatcher {
 public:
  struct Options {
    // Worker threads, started with the pool and kept until shutdown; 0 means the
    // number of cores, at least 2 and at most 4. Nothing blocks a worker for long
    // (waits park their queue), so more would only cost memory.
    std::size_t workers = 0;
    // Closures one queue may run before it yields its worker to other queues.
    std::size_t batchSize = 16;
  };

  ThreadPoolDispatcher();
  explicit ThreadPoolDispatcher(Options options);
  ~ThreadPoolDispatcher() override;
  ThreadPoolDispatcher(const ThreadPoolDispatcher&) = delete;
  ThreadPoolDispatcher& operator=(const ThreadPoolDispatcher&) = delete;

  std::shared_ptr<SerialQueue> makeSerialQueue(std::string label, QoS qos) override;
  void asyncLowPriority(std::chrono::nanoseconds delay, Task task) override;

  // Waits until every submitted closure that is due has run, or budget passes.
  // Delayed closures whose time has not come are not waited for. A parked queue is:
  // its resumption counts as due work, like the closures queued behind it, so they
  // still run if it is resumed (or times out) within the budget. True when idle.
  bool drain(std::chrono::milliseconds budget);
  // Stops the workers and the timer and joins them; closures not yet started are
  // dropped and later submissions are ignored. A parked queue is dropped as it
  // stands: its timeout closure and the closures behind it are released unrun, and
  // resuming it afterwards returns false. Never waits for a parked queue. Idempotent.
  // Called from one of the pool's own closures it only stops the workers; the
  // owner's call joins them.
  void shutdown();

  // Worker threads alive right now (for tests and diagnostics).
  std::size_t workerCount() const;

  class Core;

 private:
  std::shared_ptr<Core> core_;
};

}  // namespace vireo
