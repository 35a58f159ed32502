#include "daemon/bus_service.h"

#include <signal.h>
#include <sys/epoll.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <new>
#include <optional>
#include <utility>
#include <vector>

#include "daemon/pending_call.h"
#include "platform/dbus/send_message_arguments.h"
#include "platform/dbus/value_codec.h"
#include "platform/error.h"
#include "service/reporting_protocol.h"

namespace vireo::daemon {

namespace {

constexpr const char* kBusDriver = "org.freedesktop.DBus";
constexpr const char* kBusDriverPath = "/org/freedesktop/DBus";
constexpr const char* kReportingDisabledMessage = "reporting is disabled (com.orvane.audio.reporting, code 1)";

Reply boolReply(bool b) {
  return {{}, {}, [b](sd_bus_message* m) {
            int v = b ? 1 : 0;
            return sd_bus_message_append_basic(m, 'b', &v);
          }};
}

Reply serviceTypeReply(std::uint16_t type) {
  return {{}, {}, [type](sd_bus_message* m) { return sd_bus_message_append_basic(m, 'q', &type); }};
}

Reply errorReply(const std::optional<Error>& error) {
  if (!error) return {};
  if (error->domain == kReportingErrorDomain && error->code == kReportingDisabledCode)
    return Reply::error(kReportingDisabledError, kReportingDisabledMessage);
  return Reply::error("org.freedesktop.DBus.Error.Failed",
                      error->description + " (" + error->domain + ", code " + std::to_string(error->code) + ")");
}

// a{sv}, with the two fields the interface fixes written in their own types.
int appendReporterInfo(sd_bus_message* m, const Dictionary& info) {
  int r = sd_bus_message_open_container(m, 'a', "{sv}");
  if (r < 0) return r;
  for (const auto& [key, value] : info) {
    const std::string* name = key.asString();
    if (!name) continue;
    if ((r = sd_bus_message_open_container(m, 'e', "sv")) < 0) return r;
    if ((r = sd_bus_message_append_basic(m, 's', name->c_str())) < 0) return r;
    auto number = value.toInt64();
    if (*name == "reporterID" && number)
      r = sd_bus_message_append(m, "v", "x", *number);
    else if (*name == "serviceType" && number)
      r = sd_bus_message_append(m, "v", "q", static_cast<std::uint16_t>(*number));
    else
      r = dbus::appendVariant(m, value);
    if (r < 0) return r;
    if ((r = sd_bus_message_close_container(m)) < 0) return r;
  }
  return sd_bus_message_close_container(m);
}

Reply reporterInfoReply(Dictionary info) {
  return {{}, {}, [info = std::move(info)](sd_bus_message* m) { return appendReporterInfo(m, info); }};
}

Reply reporterListReply(std::vector<std::int64_t> ids) {
  return {{}, {}, [ids = std::move(ids)](sd_bus_message* m) {
            return sd_bus_message_append_array(m, 'x', ids.data(), ids.size() * sizeof(std::int64_t));
          }};
}

BoolReply answerBool(const std::shared_ptr<PendingCall>& p) {
  return [p](bool b) { p->answer(boolReply(b)); };
}

}  // namespace

void blockServiceSignals() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGTERM);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGHUP);
  pthread_sigmask(SIG_BLOCK, &set, nullptr);
}

struct BusService::CredentialLookup {
  BusService* service;
  std::string name;
  dbus::SlotRef slot;
};

// A connection that posted on the system bus: its uid once the bus answered, and
// until then the names it posted (distinct, a few at most), in order.
struct BusService::PostSender {
  static constexpr std::size_t kMaxWaiting = 16;
  BusService* service;
  std::string name;
  std::optional<std::uint32_t> uid;
  std::vector<std::string> waiting;
  dbus::SlotRef slot;
};

// The method handlers: parse on the bus thread, then hand over to the client's object.
struct BusServiceAccess {
  // sd-bus calls these from C; nothing may be thrown through it.
  template <typename F>
  static int guarded(sd_bus_error* error, F&& f) {
    try {
      return f();
    } catch (const std::bad_alloc&) {
      return -ENOMEM;
    } catch (...) {
      return sd_bus_error_set(error, "org.freedesktop.DBus.Error.Failed", "internal error");
    }
  }
  static BusService& self(void* userdata) { return *static_cast<BusService*>(userdata); }

  static int createReportingSession(sd_bus_message* m, void* userdata, sd_bus_error* error) {
    return guarded(error, [&] {
      std::int64_t id = 0;
      int r = sd_bus_message_read(m, "x", &id);
      if (r < 0) return r;
      BusService& service = self(userdata);
      // Creates and destroys are run in order, so this mirrors the client's session map.
      auto& sessions = service.usageOf(m).sessions;
      if (!sessions.contains(id) && sessions.size() >= service.limits_.maxSessionsPerClient)
        return service.refuse(error, "MaxSessionsPerClient", service.limits_.maxSessionsPerClient,
                              "more sessions than this client may hold");
      sessions.insert(id);
      return self(userdata).submit(m, error, [id](auto& object, auto& p) { object.createReportingSession(id, answerBool(p)); });
    });
  }

  static int setServiceType(sd_bus_message* m, void* userdata, sd_bus_error* error) {
    return guarded(error, [&] {
      std::uint16_t type = 0;
      std::int64_t id = 0;
      int r = sd_bus_message_read(m, "qx", &type, &id);
      if (r < 0) return r;
      return self(userdata).submit(m, error, [type, id](auto& object, auto& p) { object.setServiceType(type, id, answerBool(p)); });
    });
  }

  static int getServiceNameForReporterID(sd_bus_message* m, void* userdata, sd_bus_error* error) {
    return guarded(error, [&] {
      std::int64_t id = 0;
      int r = sd_bus_message_read(m, "x", &id);
      if (r < 0) return r;
      return self(userdata).submit(m, error, [id](auto& object, auto& p) {
        object.getServiceNameForReporterID(id, [p](std::uint16_t type) { p->answer(serviceTypeReply(type)); });
      });
    });
  }

  static int setConfiguration(sd_bus_message* m, void* userdata, sd_bus_error* error) {
    return guarded(error, [&] {
      Dictionary configuration;
      int r = dbus::readDictionary(m, &configuration, error, self(userdata).decodeLimits_);
      if (r < 0) return self(userdata).countDecodeRefusal(error), r;
      std::int64_t id = 0;
      if ((r = sd_bus_message_read(m, "x", &id)) < 0) return r;
      return self(userdata).submit(m, error, [configuration = std::move(configuration), id](auto& object, auto& p) {
        object.setConfiguration(configuration, id, answerBool(p));
      });
    });
  }

  static int startReportingSessionForID(sd_bus_message* m, void* userdata, sd_bus_error* error) {
    return guarded(error, [&] {
      std::int64_t id = 0;
      int r = sd_bus_message_read(m, "x", &id);
      if (r < 0) return r;
      BusService& service = self(userdata);
      auto held = service.usageOf(m).heldStarts;
      if (held->load() >= service.limits_.maxHeldStartsPerClient)
        return service.refuse(error, "MaxHeldStartsPerClient", service.limits_.maxHeldStartsPerClient,
                              "more unanswered starts than this client may have");
      // Counts the start until it is answered, or dropped unanswered.
      struct HeldStart {
        explicit HeldStart(std::shared_ptr<std::atomic<std::size_t>> c) : count(std::move(c)) { ++*count; }
        ~HeldStart() { release(); }
        void release() {
          if (!released.exchange(true)) --*count;
        }
        std::shared_ptr<std::atomic<std::size_t>> count;
        std::atomic<bool> released{false};
      };
      auto token = std::make_shared<HeldStart>(std::move(held));
      return service.submit(m, error, [id, token](auto& object, auto& p) {
        object.startReportingSessionForID(id, StartReply(
                                                  [p, token](bool b) {
                                                    token->release();
                                                    p->answer(boolReply(b));
                                                  },
                                                  [p, token] {
                                                    token->release();
                                                    p->answer(Reply::error(bus::kSessionEndedError,
                                                                           "the session ended without a stop"));
                                                  }));
      });
    });
  }

  static int sendMessage(sd_bus_message* m, void* userdata, sd_bus_error* error) {
    return guarded(error, [&] {
      dbus::SendMessageArguments args;
      int r = dbus::readSendMessageArguments(m, &args, error, self(userdata).decodeLimits_);
      if (r < 0) return self(userdata).countDecodeRefusal(error), r;
      // Each submitted operation runs once, so its arguments are moved on, not copied.
      return self(userdata).submit(m, error, [args = std::move(args)](auto& object, auto& p) mutable {
        object.sendMessage(std::move(args.payload), args.category, args.type, std::move(args.reporterIDs),
                           [p](std::optional<Error> e) { p->answer(errorReply(e)); });
      });
    });
  }

  static int stopReportingSessionForID(sd_bus_message* m, void* userdata, sd_bus_error* error) {
    return guarded(error, [&] {
      std::int64_t id = 0;
      int r = sd_bus_message_read(m, "x", &id);
      if (r < 0) return r;
      return self(userdata).submit(m, error, [id](auto& object, auto& p) { object.stopReportingSessionForID(id, answerBool(p)); });
    });
  }

  static int destroyReportingSession(sd_bus_message* m, void* userdata, sd_bus_error* error) {
    return guarded(error, [&] {
      std::int64_t id = 0;
      int r = sd_bus_message_read(m, "x", &id);
      if (r < 0) return r;
      // ID 0 is never destroyed.
      if (id != 0) self(userdata).usageOf(m).sessions.erase(id);
      return self(userdata).submit(m, error, [id](auto& object, auto& p) { object.destroyReportingSession(id, answerBool(p)); });
    });
  }

  static int reporterIDValid(sd_bus_message* m, void* userdata, sd_bus_error* error) {
    return guarded(error, [&] {
      std::int64_t id = 0;
      int r = sd_bus_message_read(m, "x", &id);
      if (r < 0) return r;
      return self(userdata).submit(m, error, [id](auto& object, auto& p) {
        object.reporterIDValid(id, [p](Dictionary info) { p->answer(reporterInfoReply(std::move(info))); });
      });
    });
  }

  static int getAllReporters(sd_bus_message* m, void* userdata, sd_bus_error* error) {
    return guarded(error, [&] {
      return self(userdata).submit(m, error, [](auto& object, auto& p) {
        object.getAllReporters([p](std::vector<std::int64_t> ids) { p->answer(reporterListReply(std::move(ids))); });
      });
    });
  }

  static int setInterfaceOrientation(sd_bus_message* m, void* userdata, sd_bus_error* error) {
    return guarded(error, [&] {
      const char* text = nullptr;
      int r = sd_bus_message_read(m, "s", &text);
      if (r < 0) return r;
      auto orientation = OrientationService::orientationFromText(text);
      if (!orientation)
        return sd_bus_error_setf(error, dbus::kInvalidArgs,
                                 "unknown orientation \"%s\" (normal, bottom-up, left-up, right-up or undefined)",
                                 text);
      if (auto& sink = self(userdata).interfaceOrientation_) sink(*orientation);
      return sd_bus_reply_method_return(m, "");
    });
  }

  static int getStatus(sd_bus_message* m, void* userdata, sd_bus_error* error) {
    return guarded(error, [&] {
      dbus::MessageRef reply;
      int r = sd_bus_message_new_method_return(m, reply.out());
      if (r < 0) return r;
      if ((r = dbus::appendStringDictionary(reply.get(), self(userdata).status())) < 0) return r;
      return sd_bus_send(nullptr, reply.get(), nullptr);
    });
  }

  static int killService(sd_bus_message* m, void* userdata, sd_bus_error* error) {
    return guarded(error, [&] {
      return self(userdata).submit(m, error, [](auto& object, auto& p) { object.killService(answerBool(p)); });
    });
  }
};

namespace {

constexpr std::uint64_t kMethodFlags = SD_BUS_VTABLE_UNPRIVILEGED;

const sd_bus_vtable kReportingVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_NAMES("CreateReportingSession", "x", SD_BUS_PARAM(reporterID), "b", SD_BUS_PARAM(success),
                             BusServiceAccess::createReportingSession, kMethodFlags),
    SD_BUS_METHOD_WITH_NAMES("SetServiceType", "qx", SD_BUS_PARAM(serviceType) SD_BUS_PARAM(reporterID), "b",
                             SD_BUS_PARAM(success), BusServiceAccess::setServiceType, kMethodFlags),
    SD_BUS_METHOD_WITH_NAMES("GetServiceNameForReporterID", "x", SD_BUS_PARAM(reporterID), "q",
                             SD_BUS_PARAM(serviceType), BusServiceAccess::getServiceNameForReporterID, kMethodFlags),
    SD_BUS_METHOD_WITH_NAMES("SetConfiguration", "a{sv}x", SD_BUS_PARAM(configuration) SD_BUS_PARAM(reporterID), "b",
                             SD_BUS_PARAM(success), BusServiceAccess::setConfiguration, kMethodFlags),
    SD_BUS_METHOD_WITH_NAMES("StartReportingSessionForID", "x", SD_BUS_PARAM(reporterID), "b", SD_BUS_PARAM(success),
                             BusServiceAccess::startReportingSessionForID, kMethodFlags),
    SD_BUS_METHOD_WITH_NAMES("SendMessage", "a{sv}uqbax",
                             SD_BUS_PARAM(payload) SD_BUS_PARAM(category) SD_BUS_PARAM(type) SD_BUS_PARAM(addressed)
                                 SD_BUS_PARAM(reporterIDs),
                             "", "", BusServiceAccess::sendMessage, kMethodFlags),
    SD_BUS_METHOD_WITH_NAMES("StopReportingSessionForID", "x", SD_BUS_PARAM(reporterID), "b", SD_BUS_PARAM(success),
                             BusServiceAccess::stopReportingSessionForID, kMethodFlags),
    SD_BUS_METHOD_WITH_NAMES("DestroyReportingSession", "x", SD_BUS_PARAM(reporterID), "b", SD_BUS_PARAM(success),
                             BusServiceAccess::destroyReportingSession, kMethodFlags),
    SD_BUS_METHOD_WITH_NAMES("ReporterIDValid", "x", SD_BUS_PARAM(reporterID), "a{sv}", SD_BUS_PARAM(reporter),
                             BusServiceAccess::reporterIDValid, kMethodFlags),
    SD_BUS_METHOD_WITH_NAMES("GetAllReporters", "", "", "ax", SD_BUS_PARAM(reporterIDs),
                             BusServiceAccess::getAllReporters, kMethodFlags),
    // Never answered: the process ends.
    SD_BUS_METHOD("KillService", "", "", BusServiceAccess::killService,
                  kMethodFlags | SD_BUS_VTABLE_METHOD_NO_REPLY),
    SD_BUS_VTABLE_END};

const sd_bus_vtable kDebugVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_NAMES("GetStatus", "", "", "a{sv}", SD_BUS_PARAM(status), BusServiceAccess::getStatus,
                             kMethodFlags),
    SD_BUS_VTABLE_END};

const sd_bus_vtable kOrientationVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_NAMES("SetInterfaceOrientation", "s", SD_BUS_PARAM(orientation), "", "",
                             BusServiceAccess::setInterfaceOrientation, kMethodFlags),
    SD_BUS_VTABLE_END};

}  // namespace

BusService::BusService(Logger& logger, ListenerDelegate& delegate, NotificationCenter& notifications)
    : logger_(logger),
      notifications_(notifications),
      registry_(delegate, [this](const std::string& name) { lookupCredentials(name); }) {}

BusService::~BusService() {
  stop();
  close();
}

namespace {
// The standard address of a bus, as sd_bus_open_system/user would find it.
std::string standardAddress(BusKind kind) {
  const char* variable = std::getenv(kind == BusKind::System ? "DBUS_SYSTEM_BUS_ADDRESS" : "DBUS_SESSION_BUS_ADDRESS");
  if (variable && *variable) return variable;
  if (kind == BusKind::System) return "unix:path=/run/dbus/system_bus_socket";
  const char* runtime = std::getenv("XDG_RUNTIME_DIR");
  return runtime && *runtime ? std::string("unix:path=") + runtime + "/bus" : std::string();
}
}  // namespace

int BusService::connect(const Options& options) {
  const std::string address = options.address.empty() ? standardAddress(options.bus) : options.address;
  if (address.empty()) return -ENOMEDIUM;
  int r = sd_bus_new(bus_.out());
  if (r < 0) return r;
  if ((r = sd_bus_set_address(bus_.get(), address.c_str())) < 0) return r;
  if ((r = sd_bus_set_bus_client(bus_.get(), 1)) < 0) return r;
  // No file descriptors: the bus refuses calls that carry them, so a client
  // cannot make us hold any.
  if ((r = sd_bus_negotiate_fds(bus_.get(), 0)) < 0) return r;
  return sd_bus_start(bus_.get());
}

int BusService::open(const Options& options) {
  const char* label = "BusService::open";
  const char* busName = options.address.empty() ? busKindName(options.bus) : options.address.c_str();
  int r = connect(options);
  if (r < 0) {
    bus_.reset();
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, label, "could not connect to the %s bus: %s", busName,
           std::strerror(-r));
    return r;
  }
  sd_bus_set_description(bus_.get(), "vireo-reportingd");
  // Losing the bus ends the loop with a failure status.
  sd_bus_set_exit_on_disconnect(bus_.get(), 1);

  auto fail = [&](const char* what) {
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, label, "%s failed: %s", what, std::strerror(-r));
    return r;
  };
  if ((r = sd_bus_add_object_vtable(bus_.get(), objectSlot_.out(), kObjectPath, kInterfaceName, kReportingVtable,
                                    this)) < 0)
    return fail("exporting the object");
  interfaceOrientation_ = options.interfaceOrientation;
  limits_ = options.limits;
  decodeLimits_ = {limits_.maxPayloadBytes, limits_.maxPayloadEntries, limits_.maxReporterIDsPerCall};
  status_ = options.status;
  checkPostSender_ = options.bus == BusKind::System;
  ownUid_ = geteuid();
  if ((r = sd_bus_add_object_vtable(bus_.get(), debugSlot_.out(), kObjectPath, kDebugInterfaceName, kDebugVtable,
                                    this)) < 0)
    return fail("exporting the status interface");
  if ((r = sd_bus_add_object_vtable(bus_.get(), orientationSlot_.out(), kObjectPath, kOrientationInterfaceName,
                                    kOrientationVtable, this)) < 0)
    return fail("exporting the orientation interface");
  if ((r = sd_bus_match_signal(bus_.get(), nameOwnerSlot_.out(), kBusDriver, kBusDriverPath, kBusDriver,
                               "NameOwnerChanged", onNameOwnerChanged, this)) < 0)
    return fail("watching NameOwnerChanged");
  if ((r = sd_bus_match_signal(bus_.get(), postedSlot_.out(), nullptr, kNotifyPath, kNotifyInterface, "Posted",
                               onPosted, this)) < 0)
    return fail("watching the notification signal");
  if ((r = sd_event_new(event_.out())) < 0) return fail("making the event loop");
  if ((r = sd_bus_attach_event(bus_.get(), event_.get(), SD_EVENT_PRIORITY_NORMAL)) < 0)
    return fail("attaching the bus");
  if (mailbox_->fd() < 0) {
    r = -EMFILE;
    return fail("making the reply eventfd");
  }
  if ((r = sd_event_add_io(event_.get(), mailboxSource_.out(), mailbox_->fd(), EPOLLIN, onMailbox, this)) < 0)
    return fail("watching the reply eventfd");
  if (options.handleSignals) {
    if ((r = sd_event_add_signal(event_.get(), termSource_.out(), SIGTERM | SD_EVENT_SIGNAL_PROCMASK, onSignal, this)) <
            0 ||
        (r = sd_event_add_signal(event_.get(), intSource_.out(), SIGINT | SD_EVENT_SIGNAL_PROCMASK, onSignal, this)) <
            0 ||
        (r = sd_event_add_signal(event_.get(), hupSource_.out(), SIGHUP | SD_EVENT_SIGNAL_PROCMASK, onSignal, this)) <
            0)
      return fail("handling signals");
  }
  // Last, so that no call arrives before everything above is in place.
  if ((r = sd_bus_request_name(bus_.get(), kServiceName, 0)) < 0) {
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, label, "could not acquire the name %s on the %s bus: %s",
           kServiceName, busName, std::strerror(-r));
    return r;
  }
  return 0;
}

int BusService::run() {
  if (!event_) return -ENOTCONN;
  mailbox_->bindToCurrentThread();
  int r = sd_event_loop(event_.get());
  if (r != 0)
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, "BusService::run", "the bus loop ended: %s",
           r < 0 ? std::strerror(-r) : "the bus connection was lost");
  return r;
}

void BusService::start() {
  thread_ = std::thread([this] { run(); });
}

void BusService::stop() {
  mailbox_->post([this] {
    if (event_) sd_event_exit(event_.get(), 0);
  });
  if (thread_.joinable()) thread_.join();
}

void BusService::close() {
  if (closed_) return;
  closed_ = true;
  mailbox_->close();
  mailbox_->post([this] {
    lookups_.clear();
    postSenders_.clear();
    objectSlot_.reset();
    orientationSlot_.reset();
    debugSlot_.reset();
    nameOwnerSlot_.reset();
    postedSlot_.reset();
    mailboxSource_.reset();
    termSource_.reset();
    intSource_.reset();
    hupSource_.reset();
    if (bus_) sd_bus_detach_event(bus_.get());
    bus_.reset();
    event_.reset();
  });
}

int BusService::submit(sd_bus_message* call, sd_bus_error* error, Invocation invocation) {
  const char* sender = sd_bus_message_get_sender(call);
  const std::string name = sender ? sender : "";
  if (!registry_.contains(name) && registry_.size() >= limits_.maxClients)
    return refuse(error, "MaxClients", limits_.maxClients, "more clients than the service takes at once");
  auto pending = std::make_shared<PendingCall>(mailbox_, call);
  registry_.call(name, [pending, invocation = std::move(invocation)](PeerConnection* connection) {
    auto object = connection ? connection->exportedObject() : nullptr;
    if (!object) {
      pending->answer(Reply::error("org.freedesktop.DBus.Error.AccessDenied", "the connection was not accepted"));
      return;
    }
    invocation(*object, pending);
  });
  return 1;
}

BusService::ClientUsage& BusService::usageOf(sd_bus_message* call) {
  const char* sender = sd_bus_message_get_sender(call);
  return usage_[sender ? sender : ""];
}

int BusService::refuse(sd_bus_error* error, const char* limit, std::size_t value, const char* what) {
  ++limitsHit_[limit];
  return sd_bus_error_setf(error, bus::kLimitsExceededError, "%s (%s=%zu)", what, limit, value);
}

void BusService::countDecodeRefusal(const sd_bus_error* error) {
  if (!sd_bus_error_has_name(error, bus::kLimitsExceededError) || !error->message) return;
  // The message names the limit as "MaxName=value".
  std::string message = error->message;
  auto begin = message.find("Max");
  if (begin == std::string::npos) return;
  ++limitsHit_[message.substr(begin, message.find('=', begin) - begin)];
}

Dictionary BusService::status() const {
  Dictionary status = status_ ? status_() : Dictionary{};
  status.set("bus_clients", Value(static_cast<unsigned long long>(registry_.size())));
  Dictionary hits;
  for (const auto& [limit, count] : limitsHit_) hits.set(Value(limit), Value(static_cast<unsigned long long>(count)));
  status.set("limits_hit", Value(std::move(hits)));
  return status;
}

void BusService::lookupCredentials(const std::string& name) {
  auto lookup = std::make_unique<CredentialLookup>(CredentialLookup{this, name, {}});
  int r = sd_bus_call_method_async(bus_.get(), lookup->slot.out(), kBusDriver, kBusDriverPath, kBusDriver,
                                   "GetConnectionCredentials", onCredentials, lookup.get(), "s", name.c_str());
  if (r < 0) {
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, "BusService::lookupCredentials",
           "could not ask for the credentials of %s: %s", name.c_str(), std::strerror(-r));
    registry_.credentialsArrived(name, -1);
    return;
  }
  lookups_[name] = std::move(lookup);
}

int BusService::onCredentials(sd_bus_message* reply, void* userdata, sd_bus_error*) {
  auto* lookup = static_cast<CredentialLookup*>(userdata);
  BusService& self = *lookup->service;
  std::string name = lookup->name;
  std::int32_t pid = -1;
  if (!sd_bus_message_is_method_error(reply, nullptr)) {
    Dictionary credentials;
    dbus::BusError error;
    if (dbus::readDictionary(reply, &credentials, error.get()) > 0)
      if (const Value* v = credentials.find("ProcessID"))
        if (auto n = v->toInt64(); n && *n > 0 && *n <= INT32_MAX) pid = static_cast<std::int32_t>(*n);
  }
  // Drops the slot (and lookup); sd-bus keeps its own reference while this runs.
  self.lookups_.erase(name);
  try {
    self.registry_.credentialsArrived(name, pid);
  } catch (...) {
  }
  return 0;
}

int BusService::onNameOwnerChanged(sd_bus_message* m, void* userdata, sd_bus_error*) {
  const char *name = nullptr, *oldOwner = nullptr, *newOwner = nullptr;
  if (sd_bus_message_read(m, "sss", &name, &oldOwner, &newOwner) < 0) return 0;
  if (name[0] != ':' || newOwner[0] != '\0') return 0;
  try {
    auto& self = *static_cast<BusService*>(userdata);
    self.usage_.erase(name);
    self.postSenders_.erase(name);
    self.registry_.nameVanished(name);
  } catch (...) {
  }
  return 0;
}

int BusService::onPosted(sd_bus_message* m, void* userdata, sd_bus_error*) {
  const char* name = nullptr;
  if (sd_bus_message_read(m, "s", &name) < 0) return 0;
  auto& self = *static_cast<BusService*>(userdata);
  try {
    if (!self.checkPostSender_) {
      self.notifications_.post(name);
      return 0;
    }
    const char* senderName = sd_bus_message_get_sender(m);
    if (!senderName) return 0;
    auto& sender = self.postSenders_[senderName];
    if (!sender) {
      sender = std::make_unique<PostSender>(PostSender{&self, senderName, {}, {}, {}});
      int r = sd_bus_call_method_async(self.bus_.get(), sender->slot.out(), kBusDriver, kBusDriverPath, kBusDriver,
                                       "GetConnectionUnixUser", onPostSenderUid, sender.get(), "s", senderName);
      if (r < 0) {
        VR_LOG(self.logger_, LogScope::DefaultLog, LogLevel::Error, "BusService::onPosted",
               "could not ask for the user of %s: %s", senderName, std::strerror(-r));
        self.postSenders_.erase(senderName);
        return 0;
      }
    }
    if (sender->uid) {
      self.postFrom(sender->name, *sender->uid, name);
    } else if (std::find(sender->waiting.begin(), sender->waiting.end(), name) == sender->waiting.end()) {
      // Posting a name again before the first is delivered changes nothing.
      if (sender->waiting.size() < PostSender::kMaxWaiting) sender->waiting.emplace_back(name);
    }
  } catch (...) {
  }
  return 0;
}

int BusService::onPostSenderUid(sd_bus_message* reply, void* userdata, sd_bus_error*) {
  auto& sender = *static_cast<PostSender*>(userdata);
  BusService& self = *sender.service;
  std::uint32_t uid = 0;
  if (sd_bus_message_is_method_error(reply, nullptr) || sd_bus_message_read(reply, "u", &uid) < 0) {
    // Most likely gone already; what it posted is dropped, and a later post asks again.
    // Erasing drops the slot too; sd-bus keeps its own reference while this runs.
    const std::string name = sender.name;
    self.postSenders_.erase(name);
    return 0;
  }
  sender.uid = uid;
  sender.slot.reset();
  try {
    for (const auto& name : std::exchange(sender.waiting, {})) self.postFrom(sender.name, uid, name);
  } catch (...) {
  }
  return 0;
}

void BusService::postFrom(const std::string& sender, std::uint32_t uid, const std::string& name) {
  if (uid == 0 || uid == ownUid_) {
    notifications_.post(name);
    return;
  }
  VR_DEBUG(logger_, LogScope::Server, "BusService::onPosted", "ignored the notification %s from %s (uid %u)",
           name.c_str(), sender.c_str(), uid);
}

int BusService::onMailbox(sd_event_source*, int, std::uint32_t, void* userdata) {
  static_cast<BusService*>(userdata)->mailbox_->drain();
  return 0;
}

int BusService::onSignal(sd_event_source* source, const struct signalfd_siginfo* info, void* userdata) {
  auto& self = *static_cast<BusService*>(userdata);
  if (info->ssi_signo == SIGHUP) {
    self.notifications_.post(kDefaultsNotification);
    return 0;
  }
  VR_LOG(self.logger_, LogScope::DefaultLog, LogLevel::Default, "BusService::onSignal", "received %s, shutting down",
         strsignal(static_cast<int>(info->ssi_signo)));
  return sd_event_exit(sd_event_source_get_event(source), 0);
}

}  // namespace vireo::daemon
