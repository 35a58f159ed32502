// Hands work to the bus thread: other threads post closures, an eventfd wakes
// the bus thread's event loop, which runs them in posting order.
//
// sd-bus objects are not thread-safe (not even their reference counts), so every
// touch of a message or of the bus from another thread goes through here. Once
// the bus thread has finished, the mailbox is closed: posts then run at once on
// the posting thread, one at a time, which keeps the remaining sd-bus work
// (dropping late replies, the final close) serialised.
#pragma once

#include <functional>
#include <vector>

#include "base/mutex.h"

namespace vireo::daemon {

class BusMailbox {
 public:
  using Task = std::function<void()>;

  BusMailbox();
  ~BusMailbox();  // runs what is still queued
  BusMailbox(const BusMailbox&) = delete;
  BusMailbox& operator=(const BusMailbox&) = delete;

  // Readable when tasks wait; -1 when no eventfd could be made.
  int fd() const { return fd_; }
  void post(Task task);
  // On the bus thread: runs the queued tasks.
  void drain();
  // From now on tasks run on the posting thread; runs those still queued.
  void close();

 private:
  int fd_ = -1;
  Mutex mutex_;  // guards tasks_ and closed_
  std::vector<Task> tasks_ VIREO_GUARDED_BY(mutex_);
  bool closed_ VIREO_GUARDED_BY(mutex_) = false;
  RecursiveMutex inlineMutex_ VIREO_ACQUIRED_BEFORE(mutex_);  // serialises tasks run after close()
};

}  // namespace vireo::daemon
