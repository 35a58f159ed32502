// The daemon on the bus: owns com.orvane.vireo.Reporting1, exports the
// reporting interface at /com/orvane/vireo/Reporting1, turns bus unique names
// into client connections for the listener delegate, and delivers the Posted
// notification signal (and SIGHUP) to the notification center. On the system
// bus a Posted signal counts only when root or the daemon's own user sent it:
// the bus is asked for the sender's uid (asynchronously, once per connection).
//
// One thread runs the sd-event loop with the bus attached: the one that calls
// run(), or the thread that start() makes. Method calls are parsed there and
// handed to the connection's exported object; replies come back from other
// threads through the mailbox.
//
// SIGTERM and SIGINT end the loop, SIGHUP posts the defaults notification. They
// must be blocked in every thread of the process (blockServiceSignals() before
// any thread is made), so that only the loop receives them.
#pragma once

#include "vireo/bus_names.h"

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <unordered_map>
#include <unordered_set>

#include "daemon/bus_choice.h"
#include "daemon/bus_mailbox.h"
#include "daemon/client_registry.h"
#include "daemon/notification_center.h"
#include "platform/connection.h"
#include "platform/dbus/bus.h"
#include "platform/dbus/value_codec.h"
#include "platform/limits.h"
#include "platform/logger.h"
#include "platform/orientation.h"

namespace vireo {
class VRReportingServiceProtocol;
}

namespace vireo::daemon {

class PendingCall;

using bus::kNotifyInterface;
using bus::kNotifyPath;
using bus::kObjectPath;
using bus::kReportingDisabledError;
using bus::kServiceName;
inline constexpr const char* kInterfaceName = bus::kInterface;
inline constexpr const char* kOrientationInterfaceName = bus::kOrientationInterface;
inline constexpr const char* kDebugInterfaceName = bus::kDebugInterface;
inline constexpr const char* kDefaultsNotification = bus::kReportingNotification;

// Blocks SIGTERM, SIGINT and SIGHUP in the calling thread (and the threads it makes).
void blockServiceSignals();

class BusService {
 public:
  struct Options {
    BusKind bus = BusKind::Session;
    // When set, this address is used instead of the standard bus (tests).
    std::string address;
    // Handle SIGTERM, SIGINT and SIGHUP in the loop.
    bool handleSignals = true;
    // Receives the interface orientation that the shell pushes (on the bus thread).
    std::function<void(Orientation)> interfaceOrientation;
    // What one client may make the daemon hold.
    ServiceLimits limits;
    // The engine's and the store's part of Debug1.GetStatus (on the bus thread).
    std::function<Dictionary()> status;
  };

  BusService(Logger& logger, ListenerDelegate& delegate, NotificationCenter& notifications);
  ~BusService();  // stops, joins and closes
  BusService(const BusService&) = delete;
  BusService& operator=(const BusService&) = delete;

  // Connects, exports the object, subscribes to the bus driver's name changes
  // and the notification signal, and takes the well-known name. Returns 0, or
  // -errno after logging why.
  int open(const Options& options);
  // Runs the loop on the calling thread until stop(), SIGTERM or SIGINT, or the
  // loss of the bus. Returns 0 for a requested end.
  int run();
  // Runs the loop on a thread of its own.
  void start();
  // Asks the loop to end (any thread) and waits for the thread start() made.
  void stop();
  // After the loop: stops taking calls and leaves the bus. Replies made later
  // are dropped. Idempotent.
  void close();

 private:
  friend struct BusServiceAccess;
  struct CredentialLookup;
  struct PostSender;
  using Invocation = std::function<void(VRReportingServiceProtocol& object, const std::shared_ptr<PendingCall>&)>;

  // What a client holds, counted against the limits; bus thread only.
  struct ClientUsage {
    std::unordered_set<std::int64_t> sessions;
    std::shared_ptr<std::atomic<std::size_t>> heldStarts = std::make_shared<std::atomic<std::size_t>>(0);
  };

  // Hands the call to its client's object; refuses a new client past MaxClients.
  int submit(sd_bus_message* call, sd_bus_error* error, Invocation invocation);
  ClientUsage& usageOf(sd_bus_message* call);
  // Fails the call with LimitsExceeded naming the limit, and counts it.
  int refuse(sd_bus_error* error, const char* limit, std::size_t value, const char* what);
  // Counts a refusal the value decoder made (its message names the limit).
  void countDecodeRefusal(const sd_bus_error* error);
  Dictionary status() const;
  void lookupCredentials(const std::string& name);
  static int onCredentials(sd_bus_message* reply, void* userdata, sd_bus_error* error);
  static int onNameOwnerChanged(sd_bus_message* m, void* userdata, sd_bus_error* error);
  static int onPosted(sd_bus_message* m, void* userdata, sd_bus_error* error);
  static int onPostSenderUid(sd_bus_message* reply, void* userdata, sd_bus_error* error);
  // Posts name if uid may post notifications on this bus; logs it otherwise.
  void postFrom(const std::string& sender, std::uint32_t uid, const std::string& name);
  static int onMailbox(sd_event_source* s, int fd, std::uint32_t revents, void* userdata);
  static int onSignal(sd_event_source* s, const struct signalfd_siginfo* info, void* userdata);
  int connect(const Options& options);

  Logger& logger_;
  NotificationCenter& notifications_;
  ClientRegistry registry_;                  // bus thread only
  std::shared_ptr<BusMailbox> mailbox_ = std::make_shared<BusMailbox>();
  // The sd-bus and sd-event objects below belong to the bus thread while the loop
  // runs, and to close() (through the closed mailbox) after it.
  dbus::BusRef bus_;
  dbus::EventRef event_;
  dbus::SlotRef objectSlot_, orientationSlot_, debugSlot_, nameOwnerSlot_, postedSlot_;
  ServiceLimits limits_;                                  // set by open()
  dbus::DecodeLimits decodeLimits_;                       // set by open()
  std::function<Dictionary()> status_;                    // set by open()
  std::unordered_map<std::string, ClientUsage> usage_;    // by unique name; bus thread only
  std::map<std::string, std::uint64_t> limitsHit_;        // by limit name; bus thread only
  std::function<void(Orientation)> interfaceOrientation_;  // set by open(), read on the bus thread
  dbus::EventSourceRef mailboxSource_, termSource_, intSource_, hupSource_;
  std::map<std::string, std::unique_ptr<CredentialLookup>> lookups_;  // by name; bus thread only
  bool checkPostSender_ = false;  // set by open(): on the system bus
  std::uint32_t ownUid_ = 0;      // set by open()
  std::unordered_map<std::string, std::unique_ptr<PostSender>> postSenders_;  // by unique name; bus thread only
  std::thread thread_;  // the loop's thread when start() made one; owner's thread only
  bool closed_ = false; // owner's thread only
};

}  // namespace vireo::daemon
