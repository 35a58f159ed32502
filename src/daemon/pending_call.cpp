#include "daemon/pending_call.h"

#include "platform/dbus/bus.h"

namespace vireo::daemon {

namespace {

// On the bus thread.
void send(sd_bus_message* call, const Reply& reply) {
  if (!reply.errorName.empty()) {
    dbus::BusError error;
    sd_bus_error_set(error.get(), reply.errorName.c_str(), reply.errorMessage.c_str());
    sd_bus_reply_method_error(call, error.get());
    return;
  }
  dbus::MessageRef m;
  if (sd_bus_message_new_method_return(call, m.out()) < 0) return;  // the bus is gone
  if (reply.body && reply.body(m.get()) < 0) {
    sd_bus_reply_method_errorf(call, "org.freedesktop.DBus.Error.Failed", "the reply could not be encoded");
    return;
  }
  sd_bus_send(nullptr, m.get(), nullptr);
}

}  // namespace

PendingCall::PendingCall(std::shared_ptr<BusMailbox> mailbox, sd_bus_message* call)
    : mailbox_(std::move(mailbox)), call_(sd_bus_message_ref(call)) {}

PendingCall::~PendingCall() {
  // Posted after any answer, so the answer still finds the message.
  mailbox_->runOrPost([call = call_] { sd_bus_message_unref(call); });
}

bool PendingCall::answer(Reply reply) {
  if (answered_.exchange(true)) return false;
  mailbox_->runOrPost([call = call_, reply = std::move(reply)] { send(call, reply); });
  return true;
}

}  // namespace vireo::daemon
