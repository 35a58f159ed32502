#include "daemon/bus_mailbox.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <cstdint>

namespace vireo::daemon {

BusMailbox::BusMailbox() : fd_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {}

BusMailbox::~BusMailbox() {
  close();
  if (fd_ >= 0) ::close(fd_);
}

void BusMailbox::post(Task task) {
  {
    MutexLock lock(mutex_);
    if (!closed_) {
      // Only the first task of a batch signals: the bus thread drains them all.
      const bool first = tasks_.empty();
      tasks_.push_back(std::move(task));
      std::uint64_t one = 1;
      if (first && fd_ >= 0 && write(fd_, &one, sizeof one) < 0) {
        // Already signalled (counter full); the bus thread will drain anyway.
      }
      return;
    }
  }
  RecursiveMutexLock inlineLock(inlineMutex_);
  task();
}

void BusMailbox::runOrPost(Task task) {
  if (owner_.load(std::memory_order_acquire) == std::this_thread::get_id()) {
    bool idle;
    {
      MutexLock lock(mutex_);
      idle = !closed_ && tasks_.empty();
    }
    if (idle) return task();
  }
  post(std::move(task));
}

void BusMailbox::drain() {
  std::uint64_t count = 0;
  if (fd_ >= 0 && read(fd_, &count, sizeof count) < 0) {
    // Nothing signalled: a spurious wake-up.
  }
  std::vector<Task> tasks;
  {
    MutexLock lock(mutex_);
    tasks.swap(tasks_);
  }
  for (Task& t : tasks) t();
}

void BusMailbox::close() {
  // Held before closing, so that a task posted from now on runs after the queued ones.
  RecursiveMutexLock inlineLock(inlineMutex_);
  std::vector<Task> tasks;
  {
    MutexLock lock(mutex_);
    closed_ = true;
    tasks.swap(tasks_);
  }
  for (Task& t : tasks) t();
}

}  // namespace vireo::daemon
