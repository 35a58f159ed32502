// Serial queues and the shared low-priority queue.
//
// A serial queue runs its closures one at a time, in submission order, on threads
// of a small fixed pool; a queue costs memory, not a thread. A closure that has to
// wait for something (a backend's answer) never blocks its thread for it: it parks
// its queue and returns, and the queue goes on when whoever answers resumes it, or
// when the park's deadline passes.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>

namespace vireo {

using Task = std::function<void()>;

// Quality-of-service classes, highest first.
enum class QoS { UserInteractive, UserInitiated, Default, Utility, Background };

// The way back for a parked serial queue. Thread-safe; may outlive its queue.
class Parking {
 public:
  virtual ~Parking() = default;
  // Lets the queue go on, running next (when not empty) before anything queued
  // behind the park. Only the first of resume() and the deadline counts: false when
  // the park has already ended (resumed, timed out, or dropped at shutdown), and
  // next is then released unrun.
  virtual bool resume(Task next) = 0;
};

class SerialQueue {
 public:
  virtual ~SerialQueue() = default;
  // Submits without waiting.
  virtual void async(Task task) = 0;
  // When the queue is idle (nothing queued or running, not parked), runs task at once
  // on the calling thread, in its place in the queue's order; otherwise as async. For
  // short closures whose caller would otherwise wait for a hand-off to another thread.
  virtual void asyncOrRun(Task task) { async(std::move(task)); }
  virtual const std::string& label() const = 0;
  // Parks the queue: once the closure running on it returns (at once if none is
  // running), the queue runs nothing more, and holds no thread, until the returned
  // Parking is resumed or timeout passes; on timeout, onTimeout runs first. Closures
  // submitted meanwhile wait, in order. Usually called by the queue's own closure
  // that starts a wait. One park at a time: while one is pending, or once the
  // dispatcher has shut down, the returned Parking is already spent (resume() is
  // false), the queue is not parked again and onTimeout is released unrun.
  virtual std::shared_ptr<Parking> park(std::chrono::nanoseconds timeout, Task onTimeout) = 0;
};

class Dispatcher {
 public:
  virtual ~Dispatcher() = default;
  virtual std::shared_ptr<SerialQueue> makeSerialQueue(std::string label, QoS qos) = 0;
  // The shared low-priority concurrent queue: task runs after delay, possibly at the
  // same time as other tasks of this queue.
  virtual void asyncLowPriority(std::chrono::nanoseconds delay, Task task) = 0;
};

}  // namespace vireo
