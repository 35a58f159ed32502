// The notification service: registrations by name, each delivered on its own
// queue with its token. The bus service posts a name when the Posted signal
// arrives (or SIGHUP, for the defaults notification).
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "base/mutex.h"
#include "platform/defaults.h"

namespace vireo::daemon {

class NotificationCenter final : public NotificationService {
 public:
  // Status 0 and a fresh token (from 1 up); status 1 for an empty name, no queue
  // or no handler.
  int registerDispatch(std::string name, std::shared_ptr<SerialQueue> queue, std::function<void(int token)> handler,
                       int* token) override;
  // Queues every handler registered for name on its queue. Any thread.
  void post(std::string_view name);

 private:
  struct Registration {
    std::string name;
    std::shared_ptr<SerialQueue> queue;
    std::function<void(int)> handler;
    int token;
  };
  Mutex mutex_;  // guards registrations_ and lastToken_
  std::vector<Registration> registrations_ VIREO_GUARDED_BY(mutex_);
  int lastToken_ VIREO_GUARDED_BY(mutex_) = 0;
};

}  // namespace vireo::daemon
