// Serial queues and the shared low-priority queue.
//
// A serial queue runs its closures one at a time, in submission order, on threads
// of a small shared pool; a queue costs memory, not a thread. A closure that may
// block for long (waiting for a backend) marks the wait with BlockingRegion, so the
// pool can lend another thread to the other queues meanwhile.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>

namespace vireo {

using Task = std::function<void()>;

// Quality-of-service classes, highest first.
enum class QoS { UserInteractive, UserInitiated, Default, Utility, Background };

class SerialQueue {
 public:
  virtual ~SerialQueue() = default;
  // Submits without waiting.
  virtual void async(Task task) = 0;
  virtual const std::string& label() const = 0;
};

class Dispatcher {
 public:
  virtual ~Dispatcher() = default;
  virtual std::shared_ptr<SerialQueue> makeSerialQueue(std::string label, QoS qos) = 0;
  // The shared low-priority concurrent queue: task runs after delay, possibly at the
  // same time as other tasks of this queue.
  virtual void asyncLowPriority(std::chrono::nanoseconds delay, Task task) = 0;
};

// Marks the current thread as blocked for the region's lifetime. On a pool thread,
// the pool may start a stand-in so that other queues keep running; elsewhere it does
// nothing.
class BlockingRegion {
 public:
  BlockingRegion();
  ~BlockingRegion();
  BlockingRegion(const BlockingRegion&) = delete;
  BlockingRegion& operator=(const BlockingRegion&) = delete;

  // Implemented by the pool and installed per worker thread.
  class Observer {
   public:
    virtual void blockingBegan() = 0;
    virtual void blockingEnded() = 0;

   protected:
    ~Observer() = default;
  };
  static void setThreadObserver(Observer* observer);

 private:
  Observer* observer_;
};

}  // namespace vireo
