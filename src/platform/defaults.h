// The defaults store and the change notification.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace vireo {

class SerialQueue;

class DefaultsStore {
 public:
  virtual ~DefaultsStore() = default;
  // The stored value of key in suite, or nothing when the suite has none.
  virtual std::optional<std::string> stringForKey(std::string_view suite, std::string_view key) = 0;
  // The stored value read by the store's boolean rules; false when there is none.
  virtual bool boolForKey(std::string_view suite, std::string_view key) = 0;
};

class NotificationService {
 public:
  virtual ~NotificationService() = default;
  // Registers handler for the notification name, delivered on queue with the
  // registration token. Returns the status (0 is success) and fills token.
  virtual int registerDispatch(std::string name, std::shared_ptr<SerialQueue> queue,
                               std::function<void(int token)> handler, int* token) = 0;
};

}  // namespace vireo
