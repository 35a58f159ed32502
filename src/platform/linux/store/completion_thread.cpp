#include "platform/linux/store/completion_thread.h"

#include <condition_variable>
#include <deque>
#include <utility>

#include "base/mutex.h"

namespace vireo::linux_platform {

// Shared with the thread itself so that it may outlive its owner.
struct CompletionThread::State {
  Mutex mutex;  // guards queue and stop
  std::condition_variable wake;
  std::deque<std::function<void()>> queue VIREO_GUARDED_BY(mutex);
  bool stop VIREO_GUARDED_BY(mutex) = false;
};

CompletionThread::CompletionThread() : state_(std::make_shared<State>()) {
  thread_ = std::thread([state = state_] {
    MutexLock lock(state->mutex);
    for (;;) {
      while (!state->stop && state->queue.empty()) lock.wait(state->wake);
      if (state->queue.empty()) return;
      auto work = std::move(state->queue.front());
      state->queue.pop_front();
      lock.unlock();
      // A completion's failure stays inside it: the thread serves every session.
      try {
        work();
      } catch (...) {
      }
      work = nullptr;  // drop captures outside the lock
      lock.lock();
    }
  });
}

CompletionThread::~CompletionThread() {
  {
    MutexLock lock(state_->mutex);
    state_->stop = true;
  }
  state_->wake.notify_all();
  if (thread_.get_id() == std::this_thread::get_id()) {
    thread_.detach();
  } else {
    thread_.join();
  }
}

void CompletionThread::post(std::function<void()> work) {
  {
    MutexLock lock(state_->mutex);
    state_->queue.push_back(std::move(work));
  }
  state_->wake.notify_one();
}

}  // namespace vireo::linux_platform
