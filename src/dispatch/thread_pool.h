// The process's dispatcher: one small pool of worker threads runs every serial
// queue and the shared low-priority queue.
#pragma once

#include <chrono>
#include <cstddef>
#include <memory>

#include "dispatch/dispatch.h"

namespace vireo {

class ThreadPoolDispatcher : public Dispatcher {
 public:
  struct Options {
    // Workers that run queues while nobody is blocked; 0 means max(2, cores).
    std::size_t coreWorkers = 0;
    // Stand-in workers started while closures sit in blocking regions.
    std::size_t maxExtraWorkers = 64;
    // An idle worker beyond the core count exits after this long.
    std::chrono::milliseconds extraIdleTimeout = std::chrono::seconds(5);
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
  // Delayed closures whose time has not come are not waited for. True when idle.
  bool drain(std::chrono::milliseconds budget);
  // Stops the workers and the timer and joins them; closures not yet started are
  // dropped and later submissions are ignored. Idempotent. Called from one of the
  // pool's own closures it only stops the workers; the owner's call joins them.
  void shutdown();

  // Worker threads alive right now (for tests and diagnostics).
  std::size_t workerCount() const;

  class Core;

 private:
  std::shared_ptr<Core> core_;
};

}  // namespace vireo
