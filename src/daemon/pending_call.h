// A method call waiting for its answer. The service answers on its own queues;
// the answer is sent on the bus thread. Only the first answer is sent, later
// ones are dropped; a call never answered gets no reply (the client's timeout
// applies), but its message is still released, on the bus thread.
#pragma once

#include <systemd/sd-bus.h>

#include <atomic>
#include <functional>
#include <memory>
#include <string>

#include "daemon/bus_mailbox.h"

namespace vireo::daemon {

struct Reply {
  // An error reply when errorName is set.
  std::string errorName;
  std::string errorMessage;
  // Appends the return values to the reply message; returns <0 on failure.
  std::function<int(sd_bus_message*)> body;

  static Reply error(std::string name, std::string message) { return {std::move(name), std::move(message), {}}; }
};

class PendingCall {
 public:
  // On the bus thread: takes a reference to call.
  PendingCall(std::shared_ptr<BusMailbox> mailbox, sd_bus_message* call);
  ~PendingCall();  // any thread
  PendingCall(const PendingCall&) = delete;
  PendingCall& operator=(const PendingCall&) = delete;

  // Any thread. Returns false when an answer was given before (this one is dropped).
  bool answer(Reply reply);

 private:
  std::shared_ptr<BusMailbox> mailbox_;
  sd_bus_message* call_;  // our reference; used and released on the bus thread only
  std::atomic<bool> answered_{false};
};

}  // namespace vireo::daemon
