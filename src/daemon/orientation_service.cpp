#include "daemon/orientation_service.h"

#include <sys/epoll.h>

#include <cerrno>
#include <cstring>
#include <utility>
#include <vector>

namespace vireo::daemon {

namespace {
constexpr const char* kProxyName = "net.hadess.SensorProxy";
constexpr const char* kProxyPath = "/net/hadess/SensorProxy";
constexpr const char* kProxyInterface = "net.hadess.SensorProxy";
constexpr const char* kOrientationProperty = "AccelerometerOrientation";
constexpr const char* kBusDriver = "org.freedesktop.DBus";
constexpr const char* kBusDriverPath = "/org/freedesktop/DBus";
constexpr const char* kLabel = "SensorOrientationService";

// The AccelerometerOrientation entry of a PropertiesChanged a{sv}, if any.
std::optional<std::string> readOrientationChange(sd_bus_message* m) {
  const char* interface = nullptr;
  if (sd_bus_message_read(m, "s", &interface) < 0 || std::strcmp(interface, kProxyInterface) != 0)
    return std::nullopt;
  if (sd_bus_message_enter_container(m, 'a', "{sv}") <= 0) return std::nullopt;
  std::optional<std::string> found;
  while (sd_bus_message_enter_container(m, 'e', "sv") > 0) {
    const char* name = nullptr;
    if (sd_bus_message_read(m, "s", &name) < 0) return found;
    const char* text = nullptr;
    if (std::strcmp(name, kOrientationProperty) == 0 && sd_bus_message_read(m, "v", "s", &text) >= 0)
      found = text;
    else if (sd_bus_message_skip(m, "v") < 0)
      return found;
    if (sd_bus_message_exit_container(m) < 0) return found;
  }
  return found;
}
}  // namespace

SensorOrientationService::SensorOrientationService(Logger& logger) : logger_(logger) {}

SensorOrientationService::~SensorOrientationService() {
  stop();
  // Never started: what was posted runs now, while everything it touches is alive.
  mailbox_->close();
}

void SensorOrientationService::start() {
  if (thread_.joinable()) return;
  int r = sd_event_new(event_.out());
  if (r >= 0 && mailbox_->fd() >= 0)
    r = sd_event_add_io(event_.get(), mailboxSource_.out(), mailbox_->fd(), EPOLLIN, onMailbox, this);
  if (r < 0 || mailbox_->fd() < 0) {
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, kLabel,
           "cannot make the orientation event loop: %s; orientation handlers run on the caller's thread",
           std::strerror(r < 0 ? -r : EMFILE));
    mailboxSource_.reset();
    event_.reset();
    mailbox_->close();
    return;
  }
  thread_ = std::thread([this] { run(); });
}

void SensorOrientationService::stop() {
  if (thread_.joinable()) {
    mailbox_->post([this] { sd_event_exit(event_.get(), 0); });
    thread_.join();
  }
  // The handlers hold sessions: they go now, while the rest of the process they
  // reach is still there, not when this object is destroyed.
  Handlers device, interface;
  {
    MutexLock guard(lock_);
    stopped_ = true;
    device.swap(deviceHandlers_);
    interface.swap(interfaceHandlers_);
  }
}

void SensorOrientationService::run() {
  connectSensor();
  sd_event_loop(event_.get());
  // Leaving the bus ends our claim with the proxy.
  dropSensorBus();
  mailboxSource_.reset();
  event_.reset();
  mailbox_->close();
}

void SensorOrientationService::connectSensor() {
  // sd_bus_open_system honours DBUS_SYSTEM_BUS_ADDRESS.
  int r = sd_bus_open_system(bus_.out());
  if (r >= 0) r = sd_bus_attach_event(bus_.get(), event_.get(), SD_EVENT_PRIORITY_NORMAL);
  if (r >= 0)
    r = sd_bus_match_signal(bus_.get(), ownerSlot_.out(), kBusDriver, kBusDriverPath, kBusDriver, "NameOwnerChanged",
                            onNameOwnerChanged, this);
  if (r >= 0)
    r = sd_bus_match_signal(bus_.get(), propertiesSlot_.out(), nullptr, kProxyPath,
                            "org.freedesktop.DBus.Properties", "PropertiesChanged", onPropertiesChanged, this);
  if (r >= 0)
    r = sd_bus_match_signal(bus_.get(), disconnectSlot_.out(), "org.freedesktop.DBus.Local",
                            "/org/freedesktop/DBus/Local", "org.freedesktop.DBus.Local", "Disconnected",
                            onDisconnected, this);
  if (r >= 0)
    r = sd_bus_call_method_async(bus_.get(), initialOwnerSlot_.out(), kBusDriver, kBusDriverPath, kBusDriver,
                                 "GetNameOwner", onInitialOwner, this, "s", kProxyName);
  if (r < 0) {
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Default, kLabel,
           "no system bus (%s): device orientation is not recorded", std::strerror(-r));
    dropSensorBus();
  }
}

void SensorOrientationService::dropSensorBus() {
  ownerSlot_.reset();
  propertiesSlot_.reset();
  disconnectSlot_.reset();
  initialOwnerSlot_.reset();
  claimSlot_.reset();
  if (bus_) sd_bus_detach_event(bus_.get());
  bus_.reset();
  proxyOwner_.clear();
  claim_ = Claim::None;
}

void SensorOrientationService::proxyOwnerChanged(std::string owner) {
  // A claim in flight was made with the previous owner: forget it.
  claimSlot_.reset();
  claim_ = Claim::None;
  proxyOwner_ = std::move(owner);
  if (proxyOwner_.empty()) {
    if (!reportedAbsent_)
      VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Default, kLabel,
             "%s is not on the system bus: device orientation is not recorded while it is away", kProxyName);
    reportedAbsent_ = true;
    return;
  }
  VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Info, kLabel, "%s is %s", kProxyName, proxyOwner_.c_str());
  reportedAbsent_ = false;
  reconcileClaim();
}

// Claims the accelerometer while device handlers exist, releases it when none is left.
void SensorOrientationService::reconcileClaim() {
  if (!bus_ || proxyOwner_.empty() || claim_ == Claim::Pending) return;
  bool wanted;
  {
    MutexLock guard(lock_);
    wanted = !deviceHandlers_.empty();
  }
  if (wanted && claim_ == Claim::None) {
    int r = sd_bus_call_method_async(bus_.get(), claimSlot_.out(), kProxyName, kProxyPath, kProxyInterface,
                                     "ClaimAccelerometer", onClaimed, this, "");
    if (r < 0) {
      VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, kLabel, "cannot claim the accelerometer: %s",
             std::strerror(-r));
      return;
    }
    claim_ = Claim::Pending;
  } else if (!wanted && claim_ == Claim::Held) {
    int r = sd_bus_call_method_async(bus_.get(), nullptr, kProxyName, kProxyPath, kProxyInterface,
                                     "ReleaseAccelerometer", nullptr, nullptr, "");
    if (r < 0)
      VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, kLabel, "cannot release the accelerometer: %s",
             std::strerror(-r));
    claim_ = Claim::None;
  }
}

void SensorOrientationService::deliver(Kind kind, Orientation orientation) {
  std::vector<OrientationHandler> calls;
  {
    MutexLock guard(lock_);
    for (auto& [identifier, handler] : handlers(kind)) calls.push_back(handler);
  }
  // Outside the lock: a handler may register or unregister.
  for (auto& handler : calls) {
    try {
      handler(orientation);
    } catch (const std::exception& e) {
      VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, kLabel, "an orientation handler failed: %s", e.what());
    } catch (...) {
      VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, kLabel, "an orientation handler failed");
    }
  }
}

void SensorOrientationService::pushInterfaceOrientation(Orientation orientation) {
  mailbox_->post([this, orientation] { deliver(Kind::Interface, orientation); });
}

// Both return the handler they take out, to be released outside the lock: it may hold a session.
OrientationHandler SensorOrientationService::setHandler(Kind kind, const std::string& identifier,
                                                        OrientationHandler handler) {
  MutexLock guard(lock_);
  if (stopped_) return handler;  // shutting down: nothing is kept
  return std::exchange(handlers(kind)[identifier], std::move(handler));
}

OrientationHandler SensorOrientationService::removeHandler(Kind kind, const std::string& identifier) {
  MutexLock guard(lock_);
  auto it = handlers(kind).find(identifier);
  if (it == handlers(kind).end()) return {};
  OrientationHandler removed = std::move(it->second);
  handlers(kind).erase(it);
  return removed;
}

void SensorOrientationService::registerDeviceOrientationHandler(const std::string& identifier,
                                                                OrientationHandler handler) {
  setHandler(Kind::Device, identifier, std::move(handler));
  mailbox_->post([this] { reconcileClaim(); });
}

void SensorOrientationService::registerInterfaceOrientationHandler(const std::string& identifier,
                                                                   OrientationHandler handler) {
  setHandler(Kind::Interface, identifier, std::move(handler));
}

void SensorOrientationService::unregisterDeviceOrientationHandler(const std::string& identifier) {
  removeHandler(Kind::Device, identifier);
  mailbox_->post([this] { reconcileClaim(); });
}

void SensorOrientationService::unregisterInterfaceOrientationHandler(const std::string& identifier) {
  removeHandler(Kind::Interface, identifier);
}

int SensorOrientationService::onNameOwnerChanged(sd_bus_message* m, void* userdata, sd_bus_error*) {
  auto& self = *static_cast<SensorOrientationService*>(userdata);
  const char *name = nullptr, *oldOwner = nullptr, *newOwner = nullptr;
  if (sd_bus_message_read(m, "sss", &name, &oldOwner, &newOwner) < 0 || std::strcmp(name, kProxyName) != 0) return 0;
  self.ownerKnown_ = true;
  self.initialOwnerSlot_.reset();
  self.proxyOwnerChanged(newOwner);
  return 0;
}

int SensorOrientationService::onInitialOwner(sd_bus_message* m, void* userdata, sd_bus_error*) {
  auto& self = *static_cast<SensorOrientationService*>(userdata);
  self.initialOwnerSlot_.reset();
  if (self.ownerKnown_) return 0;
  const char* owner = "";
  if (!sd_bus_message_is_method_error(m, nullptr) && sd_bus_message_read(m, "s", &owner) < 0) owner = "";
  self.proxyOwnerChanged(owner);
  return 0;
}

int SensorOrientationService::onClaimed(sd_bus_message* m, void* userdata, sd_bus_error*) {
  auto& self = *static_cast<SensorOrientationService*>(userdata);
  self.claimSlot_.reset();
  if (const sd_bus_error* error = sd_bus_message_get_error(m)) {
    VR_LOG(self.logger_, LogScope::DefaultLog, LogLevel::Error, kLabel, "ClaimAccelerometer failed: %s",
           error->message ? error->message : error->name);
    self.claim_ = Claim::None;
    return 0;
  }
  self.claim_ = Claim::Held;
  // Handlers may have gone while the claim was on its way.
  self.reconcileClaim();
  return 0;
}

int SensorOrientationService::onPropertiesChanged(sd_bus_message* m, void* userdata, sd_bus_error*) {
  auto& self = *static_cast<SensorOrientationService*>(userdata);
  const char* sender = sd_bus_message_get_sender(m);
  if (self.proxyOwner_.empty() || !sender || self.proxyOwner_ != sender) return 0;
  if (auto text = readOrientationChange(m))
    self.deliver(Kind::Device, orientationFromText(*text).value_or(Orientation::Undefined));
  return 0;
}

int SensorOrientationService::onDisconnected(sd_bus_message*, void* userdata, sd_bus_error*) {
  auto& self = *static_cast<SensorOrientationService*>(userdata);
  VR_LOG(self.logger_, LogScope::DefaultLog, LogLevel::Default, kLabel,
         "lost the system bus: device orientation is no longer recorded");
  // Not from inside the bus's own dispatch.
  self.mailbox_->post([&self] { self.dropSensorBus(); });
  return 0;
}

int SensorOrientationService::onMailbox(sd_event_source*, int, std::uint32_t, void* userdata) {
  static_cast<SensorOrientationService*>(userdata)->mailbox_->drain();
  return 0;
}

}  // namespace vireo::daemon
