#include "daemon/bus_thread_queue.h"

#include <exception>
#include <utility>

namespace vireo::daemon {

namespace {
class SpentParking final : public Parking {
 public:
  bool resume(Task) override { return false; }
};
}  // namespace

std::shared_ptr<BusThreadQueue> BusThreadQueue::make(std::shared_ptr<BusMailbox> mailbox, std::string label,
                                                     Logger& logger) {
  return std::shared_ptr<BusThreadQueue>(new BusThreadQueue(std::move(mailbox), std::move(label), logger));
}

BusThreadQueue::BusThreadQueue(std::shared_ptr<BusMailbox> mailbox, std::string label, Logger& logger)
    : mailbox_(std::move(mailbox)), label_(std::move(label)), logger_(logger) {}

void BusThreadQueue::async(Task task) {
  if (!task) return;
  {
    MutexLock lock(mutex_);
    fifo_.push_back(std::move(task));
    // A closure submitted by a running one waits for it: the run picks it up.
    if (scheduled_) return;
    scheduled_ = true;
  }
  mailbox_->runOrPost([self = shared_from_this()] { self->run(); });
}

std::shared_ptr<Parking> BusThreadQueue::park(std::chrono::nanoseconds, Task) {
  return std::make_shared<SpentParking>();
}

void BusThreadQueue::run() {
  for (std::size_t ran = 0;; ++ran) {
    Task task;
    {
      MutexLock lock(mutex_);
      if (fifo_.empty()) {
        scheduled_ = false;
        return;
      }
      if (ran == kBatch) break;  // still scheduled: the rest runs on the next turn
      task = std::move(fifo_.front());
      fifo_.pop_front();
    }
    try {
      task();
    } catch (const std::exception& e) {
      VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, "BusThreadQueue::run", "a closure on %s failed: %s",
             label_.c_str(), e.what());
    } catch (...) {
      VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, "BusThreadQueue::run", "a closure on %s failed",
             label_.c_str());
    }
  }
  mailbox_->post([self = shared_from_this()] { self->run(); });
}

}  // namespace vireo::daemon
