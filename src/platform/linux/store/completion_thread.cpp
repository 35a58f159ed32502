#include "platform/linux/store/completion_thread.h"

#include <condition_variable>
#include <deque>
#include <mutex>
#include <utility>

namespace vireo::linux_platform {

// Shared with the thread itself so that it may outlive its owner.
struct CompletionThread::State {
  std::mutex mutex;  // guards queue and stop
  std::condition_variable wake;
  std::deque<std::function<void()>> queue;
  bool stop = false;
};

CompletionThread::CompletionThread() : state_(std::make_shared<State>()) {
  thread_ = std::thread([state = state_] {
    std::unique_lock lock(state->mutex);
    for (;;) {
      state->wake.wait(lock, [&] { return state->stop || !state->queue.empty(); });
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
    std::lock_guard lock(state_->mutex);
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
    std::lock_guard lock(state_->mutex);
    state_->queue.push_back(std::move(work));
  }
  state_->wake.notify_one();
}

}  // namespace vireo::linux_platform
