// The orientation service on Linux. Device orientation comes from the sensor
// proxy on the system bus (net.hadess.SensorProxy, AccelerometerOrientation); the
// interface orientation is pushed by the shell through the daemon's
// SetInterfaceOrientation. Handlers run on this service's own thread, which runs
// an sd-event loop with a system bus connection of its own: the sensor lives on
// the system bus even when clients are served on a session bus.
//
// The proxy refuses a second claim from one connection, so the accelerometer is
// claimed once, while at least one device handler is registered, and released
// when the last one goes. When the proxy restarts, the claim is made again. A
// machine without the proxy (or without a system bus) records no device
// orientation and says so once.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <thread>

#include "base/mutex.h"
#include "daemon/bus_mailbox.h"
#include "platform/dbus/bus.h"
#include "platform/logger.h"
#include "platform/orientation.h"

namespace vireo::daemon {

class SensorOrientationService final : public OrientationService {
 public:
  explicit SensorOrientationService(Logger& logger);
  ~SensorOrientationService() override;  // stops
  SensorOrientationService(const SensorOrientationService&) = delete;
  SensorOrientationService& operator=(const SensorOrientationService&) = delete;

  // Starts the service's thread, which connects to the system bus.
  void start();
  // Ends the thread and drops every handler; an orientation pushed afterwards
  // runs on the pushing thread and reaches nobody.
  void stop();

  // The shell's interface orientation; any thread.
  void pushInterfaceOrientation(Orientation orientation);

  void registerDeviceOrientationHandler(const std::string& identifier, OrientationHandler handler) override;
  void registerInterfaceOrientationHandler(const std::string& identifier, OrientationHandler handler) override;
  void unregisterDeviceOrientationHandler(const std::string& identifier) override;
  void unregisterInterfaceOrientationHandler(const std::string& identifier) override;

 private:
  using Handlers = std::map<std::string, OrientationHandler>;
  enum class Claim { None, Pending, Held };

  void run();
  void connectSensor();
  void dropSensorBus();
  void proxyOwnerChanged(std::string owner);
  void reconcileClaim();
  enum class Kind { Device, Interface };
  Handlers& handlers(Kind kind) VIREO_REQUIRES(lock_) {
    return kind == Kind::Device ? deviceHandlers_ : interfaceHandlers_;
  }
  void deliver(Kind kind, Orientation orientation);
  OrientationHandler setHandler(Kind kind, const std::string& identifier, OrientationHandler handler);
  OrientationHandler removeHandler(Kind kind, const std::string& identifier);
  static int onNameOwnerChanged(sd_bus_message* m, void* userdata, sd_bus_error* error);
  static int onInitialOwner(sd_bus_message* m, void* userdata, sd_bus_error* error);
  static int onPropertiesChanged(sd_bus_message* m, void* userdata, sd_bus_error* error);
  static int onClaimed(sd_bus_message* m, void* userdata, sd_bus_error* error);
  static int onDisconnected(sd_bus_message* m, void* userdata, sd_bus_error* error);
  static int onMailbox(sd_event_source* s, int fd, std::uint32_t revents, void* userdata);

  Logger& logger_;
  Mutex lock_;  // guards deviceHandlers_, interfaceHandlers_ and stopped_
  Handlers deviceHandlers_ VIREO_GUARDED_BY(lock_);
  Handlers interfaceHandlers_ VIREO_GUARDED_BY(lock_);
  bool stopped_ VIREO_GUARDED_BY(lock_) = false;
  std::shared_ptr<BusMailbox> mailbox_ = std::make_shared<BusMailbox>();
  std::thread thread_;  // owner's thread only

  // The service thread's own (and, after stop, the mailbox's serialised tasks').
  dbus::EventRef event_;
  dbus::BusRef bus_;
  dbus::SlotRef ownerSlot_, propertiesSlot_, disconnectSlot_, initialOwnerSlot_, claimSlot_;
  dbus::EventSourceRef mailboxSource_;
  std::string proxyOwner_;      // the proxy's unique name; empty while it is absent
  bool ownerKnown_ = false;     // a name change has been seen, so the first lookup's answer is stale
  Claim claim_ = Claim::None;
  bool reportedAbsent_ = false;  // "not on the system bus" is said once
};

}  // namespace vireo::daemon
