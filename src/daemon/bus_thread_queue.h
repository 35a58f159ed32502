// A serial queue that runs on the bus thread. The server queue is one: its closures
// are short and answer calls, so running them where the calls arrive saves two
// thread hand-offs per call, and a closure submitted by a method handler on an idle
// queue runs at once. Closures from other threads reach it through the mailbox.
//
// It never parks (no server closure waits), and runs at most a batch of closures per
// turn of the loop, so that a flood from other threads cannot keep the bus unread.
#pragma once

#include <deque>
#include <memory>
#include <string>

#include "base/mutex.h"
#include "daemon/bus_mailbox.h"
#include "dispatch/dispatch.h"
#include "platform/logger.h"

namespace vireo::daemon {

class BusThreadQueue final : public SerialQueue, public std::enable_shared_from_this<BusThreadQueue> {
 public:
  static std::shared_ptr<BusThreadQueue> make(std::shared_ptr<BusMailbox> mailbox, std::string label, Logger& logger);

  void async(Task task) override;
  const std::string& label() const override { return label_; }
  // Not supported here: the returned park is already spent and onTimeout is dropped.
  std::shared_ptr<Parking> park(std::chrono::nanoseconds timeout, Task onTimeout) override;

 private:
  BusThreadQueue(std::shared_ptr<BusMailbox> mailbox, std::string label, Logger& logger);
  void run();

  static constexpr std::size_t kBatch = 64;
  const std::shared_ptr<BusMailbox> mailbox_;
  const std::string label_;
  Logger& logger_;
  Mutex mutex_;
  std::deque<Task> fifo_ VIREO_GUARDED_BY(mutex_);
  bool scheduled_ VIREO_GUARDED_BY(mutex_) = false;  // a run is posted or under way
};

}  // namespace vireo::daemon
