// Hands work to the bus thread: other threads post closures, an eventfd wakes
// the bus thread's event loop, which runs them in posting order.
//
// sd-bus objects are not thread-safe (not even their reference counts), so every
// touch of a message or of the bus from another thread goes through here. Once
// the bus thread has finished, the mailbox is closed: posts then run at once on
// the posting thread, one at a time, which keeps the remaining sd-bus work
// (dropping late replies, the final close) serialised.
#pragma once

#include <atomic>
#include <functional>
#include <thread>
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
  // The bus thread calls this before it runs its loop.
  void bindToCurrentThread() { owner_.store(std::this_thread::get_id(), std::memory_order_release); }
  // On the bus thread with nothing queued ahead (so the posting order holds), runs the
  // task at once, saving a wake-up of the loop; anywhere else it posts it.
  void runOrPost(Task task);
  // On the bus thread: runs the queued tasks.
  void drain();
  // From now on tasks run on the posting thread; runs those still queued.
  void close();

 private:
  int fd_ = -1;
  Mutex mutex_;  // guards tasks_ and closed_
  std::vector<Task> tasks_ VIREO_GUARDED_BY(mutex_);
  bool closed_ VIREO_GUARDED_BY(mutex_) = false;
  std::atomic<std::thread::id> owner_{};
  RecursiveMutex inlineMutex_ VIREO_ACQUIRED_BEFORE(mutex_);  // serialises tasks run after close()
};

}  // namespace vireo::daemon
