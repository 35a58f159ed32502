// A long-lived thread that runs posted closures in order: the thread of the
// telemetry service's own, on which its completions are called.
#pragma once

#include <functional>
#include <memory>
#include <thread>

namespace vireo::linux_platform {

class CompletionThread {
 public:
  CompletionThread();
  // Runs what is still queued, then ends the thread. When the last owner lets go
  // from within a closure, the thread is left to finish on its own.
  ~CompletionThread();

  CompletionThread(const CompletionThread&) = delete;
  CompletionThread& operator=(const CompletionThread&) = delete;

  void post(std::function<void()> work);

 private:
  struct State;
  std::shared_ptr<State> state_;
  std::thread thread_;
};

}  // namespace vireo::linux_platform
