#include "daemon/notification_center.h"

#include "dispatch/dispatch.h"

namespace vireo::daemon {

int NotificationCenter::registerDispatch(std::string name, std::shared_ptr<SerialQueue> queue,
                                         std::function<void(int token)> handler, int* token) {
  if (name.empty() || !queue || !handler) return 1;
  MutexLock lock(mutex_);
  int t = ++lastToken_;
  registrations_.push_back({std::move(name), std::move(queue), std::move(handler), t});
  if (token) *token = t;
  return 0;
}

void NotificationCenter::post(std::string_view name) {
  std::vector<Registration> matching;
  {
    MutexLock lock(mutex_);
    for (const auto& r : registrations_)
      if (r.name == name) matching.push_back(r);
  }
  for (auto& r : matching) r.queue->async([handler = std::move(r.handler), token = r.token] { handler(token); });
}

}  // namespace vireo::daemon
