#include "vireo/client.h"

#include <poll.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "base/mutex.h"
#include "platform/dbus/value_codec.h"

namespace vireo::client {

namespace detail {

// The answer of a pending start, shared between the handle and the reply slot.
struct StartState {
  Mutex mu;  // guards result
  std::optional<Result<bool>> result VIREO_GUARDED_BY(mu);

  void set(Result<bool> r) {
    MutexLock lock(mu);
    if (!result) result.emplace(std::move(r));
  }
};

struct Connection {
  // Guards bus: sd-bus objects are not thread-safe. Recursive so that an async
  // callback may issue the next call on the same connection.
  mutable RecursiveMutex mu;
  sd_bus* bus VIREO_GUARDED_BY(mu) = nullptr;
  std::uint64_t timeoutUsec = 25'000'000;
  std::atomic<std::size_t> pending{0};

  ~Connection() {
    if (bus) sd_bus_flush_close_unref(bus);
  }

  // Dispatches everything already received; called with mu held. True when
  // something was dispatched.
  bool drain() VIREO_REQUIRES(mu) {
    bool progress = false;
    while (sd_bus_process(bus, nullptr) > 0) progress = true;
    return progress;
  }

  // Dispatches what has arrived; when nothing had, sleeps on the socket for at most
  // timeout without holding the lock, so other threads may call meanwhile.
  void pumpOnce(std::chrono::milliseconds timeout) {
    int fd;
    {
      RecursiveMutexLock lock(mu);
      if (drain()) return;
      fd = sd_bus_get_fd(bus);
    }
    if (fd < 0) return;
    pollfd p{fd, POLLIN, 0};
    ::poll(&p, 1, static_cast<int>(timeout.count()));
    RecursiveMutexLock lock(mu);
    drain();
  }
};

}  // namespace detail

namespace {

using detail::Connection;

constexpr const char* kDisconnected = "org.freedesktop.DBus.Error.Disconnected";

Error errorFromErrno(int r, const char* what) {
  sd_bus_error e = SD_BUS_ERROR_NULL;
  sd_bus_error_set_errno(&e, r);
  Error out{e.name ? e.name : "org.freedesktop.DBus.Error.Failed",
            std::string(what) + ": " + std::strerror(r < 0 ? -r : r), {}, 0};
  sd_bus_error_free(&e);
  return out;
}

Error errorFromBusError(const sd_bus_error* e, int r, const char* what) {
  if (e && sd_bus_error_is_set(e)) return errorFromDBus(e->name, e->message ? e->message : "");
  return errorFromErrno(r, what);
}

struct Message {
  sd_bus_message* m = nullptr;
  ~Message() { sd_bus_message_unref(m); }
};

// Owns one async call: the bus keeps the floating slot and calls destroy when the
// slot goes, whether the answer came or the connection closed.
struct PendingCall {
  Connection* conn;
  bool answered = false;
  std::function<void(sd_bus_message*)> done;  // nullptr message: connection gone

  static int onReply(sd_bus_message* m, void* userdata, sd_bus_error*) {
    auto* self = static_cast<PendingCall*>(userdata);
    self->answered = true;
    auto done = std::move(self->done);
    if (done) done(m);
    return 0;
  }
  static void onDestroy(void* userdata) {
    auto* self = static_cast<PendingCall*>(userdata);
    if (!self->answered && self->done) self->done(nullptr);
    self->conn->pending.fetch_sub(1);
    delete self;
  }
};

Result<std::unique_ptr<Client>> fail(int r, const char* what) { return errorFromErrno(r, what); }

BusKind resolveKind(BusKind kind) {
  if (kind != BusKind::Default) return kind;
  if (const char* env = std::getenv("VIREO_BUS")) {
    if (std::strcmp(env, "system") == 0) return BusKind::System;
    if (std::strcmp(env, "session") == 0) return BusKind::Session;
  }
  return geteuid() == 0 ? BusKind::System : BusKind::Session;
}

Status statusFromReply(sd_bus_message* reply) {
  if (!reply) return Error{kDisconnected, "connection closed before the answer", {}, 0};
  if (sd_bus_message_is_method_error(reply, nullptr)) {
    const sd_bus_error* e = sd_bus_message_get_error(reply);
    return errorFromDBus(e && e->name ? e->name : "", e && e->message ? e->message : "");
  }
  return Done{};
}

}  // namespace

bool Error::isTimeout() const {
  return name == "org.freedesktop.DBus.Error.Timeout" || name == "org.freedesktop.DBus.Error.NoReply" ||
         name == "org.freedesktop.DBus.Error.TimedOut";
}

Error errorFromDBus(const std::string& name, const std::string& message) {
  Error e{name, message, {}, 0};
  if (name == kReportingDisabledError) {
    e.domain = kReportingDomain;
    e.code = 1;
  }
  return e;
}

// ---- StartHandle ----

bool StartHandle::ready() const {
  if (!state_) return true;
  MutexLock lock(state_->mu);
  return state_->result.has_value();
}

std::optional<Result<bool>> StartHandle::waitFor(std::chrono::milliseconds timeout) const {
  if (!state_) return Result<bool>(Error{"org.freedesktop.DBus.Error.Failed", "no start was sent", {}, 0});
  auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    {
      MutexLock lock(state_->mu);
      if (state_->result) return *state_->result;
    }
    auto conn = conn_.lock();
    if (!conn) return Result<bool>(Error{kDisconnected, "client closed before the answer", {}, 0});
    auto now = std::chrono::steady_clock::now();
    if (now >= deadline) return std::nullopt;
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - now);
    conn->pumpOnce(std::min(left, std::chrono::milliseconds(100)) + std::chrono::milliseconds(1));
  }
}

Result<bool> StartHandle::wait() const {
  for (;;)
    if (auto r = waitFor(std::chrono::hours(1))) return *r;
}

// ---- Client ----

Client::Client(std::shared_ptr<detail::Connection> conn) : conn_(std::move(conn)) {}
Client::~Client() = default;

Result<std::unique_ptr<Client>> Client::connect(BusKind kind) {
  auto conn = std::make_shared<Connection>();
  RecursiveMutexLock lock(conn->mu);  // not shared yet; keeps the analysis simple
  int r = resolveKind(kind) == BusKind::System ? sd_bus_open_system(&conn->bus) : sd_bus_open_user(&conn->bus);
  if (r < 0) return fail(r, "cannot connect to the bus");
  return std::unique_ptr<Client>(new Client(std::move(conn)));
}

Result<std::unique_ptr<Client>> Client::connectAddress(const std::string& address) {
  auto conn = std::make_shared<Connection>();
  RecursiveMutexLock lock(conn->mu);  // not shared yet; keeps the analysis simple
  int r = sd_bus_new(&conn->bus);
  if (r < 0) return fail(r, "cannot create a bus connection");
  if ((r = sd_bus_set_address(conn->bus, address.c_str())) < 0) return fail(r, "bad bus address");
  sd_bus_set_bus_client(conn->bus, 1);
  if ((r = sd_bus_start(conn->bus)) < 0) return fail(r, "cannot connect to the bus");
  return std::unique_ptr<Client>(new Client(std::move(conn)));
}

void Client::setCallTimeout(std::chrono::microseconds timeout) {
  RecursiveMutexLock lock(conn_->mu);
  conn_->timeoutUsec = static_cast<std::uint64_t>(timeout.count());
}

std::string Client::uniqueName() const {
  RecursiveMutexLock lock(conn_->mu);
  const char* name = nullptr;
  if (sd_bus_get_unique_name(conn_->bus, &name) < 0 || !name) return {};
  return name;
}

namespace {

// Builds a call to the service; fill appends the arguments.
template <class Fill>
int newCall(sd_bus* bus, const char* method, Fill&& fill, sd_bus_message** out) {
  int r = sd_bus_message_new_method_call(bus, out, kServiceName, kObjectPath, kInterface, method);
  if (r < 0) return r;
  return fill(*out);
}

template <class Fill>
Result<sd_bus_message*> call(Connection& c, const char* method, Fill&& fill) {
  RecursiveMutexLock lock(c.mu);
  Message m;
  int r = newCall(c.bus, method, fill, &m.m);
  if (r < 0) return errorFromErrno(r, "cannot build the call");
  sd_bus_error e = SD_BUS_ERROR_NULL;
  sd_bus_message* reply = nullptr;
  r = sd_bus_call(c.bus, m.m, c.timeoutUsec, &e, &reply);
  if (r < 0) {
    Error err = errorFromBusError(&e, r, method);
    sd_bus_error_free(&e);
    return err;
  }
  return reply;
}

int noArgs(sd_bus_message*) { return 0; }

// An a{sv} answer.
Result<Dictionary> readDictionaryAnswer(sd_bus_message* m) {
  Dictionary d;
  sd_bus_error e = SD_BUS_ERROR_NULL;
  if (dbus::readDictionary(m, &d, &e) < 0) {
    Error err{"org.freedesktop.DBus.Error.InvalidSignature",
              std::string("unexpected answer: ") + (e.message ? e.message : ""), {}, 0};
    sd_bus_error_free(&e);
    return err;
  }
  return d;
}

Result<bool> boolCall(Connection& c, const char* method, auto&& fill) {
  auto reply = call(c, method, fill);
  if (!reply) return reply.error();
  Message owned{*reply};
  int b = 0;
  int r = sd_bus_message_read(owned.m, "b", &b);
  if (r < 0) return errorFromErrno(r, "unexpected answer");
  return b != 0;
}

int appendMessageArgs(sd_bus_message* m, const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                      const std::optional<std::vector<std::int64_t>>& ids) {
  int r = dbus::appendStringDictionary(m, payload);
  if (r < 0) return r;
  if ((r = sd_bus_message_append(m, "uqb", category, type, ids.has_value() ? 1 : 0)) < 0) return r;
  static const std::vector<std::int64_t> none;
  const auto& list = ids ? *ids : none;
  return sd_bus_message_append_array(m, 'x', list.data(), list.size() * sizeof(std::int64_t));
}

}  // namespace

Result<bool> Client::createReportingSession(std::int64_t id) {
  return boolCall(*conn_, "CreateReportingSession", [&](sd_bus_message* m) { return sd_bus_message_append(m, "x", id); });
}

Result<bool> Client::setServiceType(std::uint16_t serviceType, std::int64_t id) {
  return boolCall(*conn_, "SetServiceType",
                  [&](sd_bus_message* m) { return sd_bus_message_append(m, "qx", serviceType, id); });
}

Result<std::uint16_t> Client::getServiceNameForReporterID(std::int64_t id) {
  auto reply = call(*conn_, "GetServiceNameForReporterID",
                    [&](sd_bus_message* m) { return sd_bus_message_append(m, "x", id); });
  if (!reply) return reply.error();
  Message owned{*reply};
  std::uint16_t type = 0;
  int r = sd_bus_message_read(owned.m, "q", &type);
  if (r < 0) return errorFromErrno(r, "unexpected answer");
  return type;
}

Result<bool> Client::setConfiguration(const Dictionary& configuration, std::int64_t id) {
  return boolCall(*conn_, "SetConfiguration", [&](sd_bus_message* m) {
    int r = dbus::appendStringDictionary(m, configuration);
    return r < 0 ? r : sd_bus_message_append(m, "x", id);
  });
}

StartHandle Client::startReportingSessionForID(std::int64_t id) {
  StartHandle handle;
  handle.state_ = std::make_shared<detail::StartState>();
  handle.conn_ = conn_;
  RecursiveMutexLock lock(conn_->mu);
  Message m;
  int r = newCall(conn_->bus, "StartReportingSessionForID",
                  [&](sd_bus_message* msg) { return sd_bus_message_append(msg, "x", id); }, &m.m);
  auto* pending = new PendingCall{conn_.get(), false, [state = handle.state_](sd_bus_message* reply) {
                                    Status s = statusFromReply(reply);
                                    if (!s) return state->set(s.error());
                                    int b = 0;
                                    if (sd_bus_message_read(reply, "b", &b) < 0)
                                      return state->set(Error{"org.freedesktop.DBus.Error.InvalidSignature",
                                                              "unexpected answer", {}, 0});
                                    state->set(b != 0);
                                  }};
  sd_bus_slot* slot = nullptr;
  // No timeout: the answer comes when the session stops.
  if (r >= 0) r = sd_bus_call_async(conn_->bus, &slot, m.m, PendingCall::onReply, pending, UINT64_MAX);
  if (r < 0) {
    handle.state_->set(errorFromErrno(r, "StartReportingSessionForID"));
    delete pending;
    return handle;
  }
  conn_->pending.fetch_add(1);
  sd_bus_slot_set_destroy_callback(slot, PendingCall::onDestroy);
  // The bus keeps the slot from here on; drop the reference the call gave us.
  sd_bus_slot_set_floating(slot, 1);
  sd_bus_slot_unref(slot);
  return handle;
}

namespace {

template <class Fill>
Status sendNoReply(Connection& c, const char* method, Fill&& fill) {
  RecursiveMutexLock lock(c.mu);
  Message m;
  int r = newCall(c.bus, method, fill, &m.m);
  if (r >= 0) r = sd_bus_message_set_expect_reply(m.m, 0);
  if (r >= 0) r = sd_bus_send(c.bus, m.m, nullptr);
  if (r >= 0) r = sd_bus_flush(c.bus);
  if (r < 0) return errorFromErrno(r, method);
  return Done{};
}

}  // namespace

Status Client::startReportingSessionForIDNoWait(std::int64_t id) {
  return sendNoReply(*conn_, "StartReportingSessionForID",
                     [&](sd_bus_message* m) { return sd_bus_message_append(m, "x", id); });
}

Status Client::sendMessage(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                           const std::optional<std::vector<std::int64_t>>& ids) {
  auto reply = call(*conn_, "SendMessage",
                    [&](sd_bus_message* m) { return appendMessageArgs(m, payload, category, type, ids); });
  if (!reply) return reply.error();
  sd_bus_message_unref(*reply);
  return Done{};
}

Status Client::sendMessageAsync(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                                const std::optional<std::vector<std::int64_t>>& ids,
                                std::function<void(const Status&)> done) {
  RecursiveMutexLock lock(conn_->mu);
  Message m;
  int r = newCall(conn_->bus, "SendMessage",
                  [&](sd_bus_message* msg) { return appendMessageArgs(msg, payload, category, type, ids); }, &m.m);
  if (r < 0) return errorFromErrno(r, "cannot build the call");
  auto* pending = new PendingCall{conn_.get(), false, [cb = std::move(done)](sd_bus_message* reply) {
                                    if (cb) cb(statusFromReply(reply));
                                  }};
  sd_bus_slot* slot = nullptr;
  r = sd_bus_call_async(conn_->bus, &slot, m.m, PendingCall::onReply, pending, conn_->timeoutUsec);
  if (r < 0) {
    delete pending;
    return errorFromErrno(r, "SendMessage");
  }
  conn_->pending.fetch_add(1);
  sd_bus_slot_set_destroy_callback(slot, PendingCall::onDestroy);
  // The bus keeps the slot from here on; drop the reference the call gave us.
  sd_bus_slot_set_floating(slot, 1);
  sd_bus_slot_unref(slot);
  return Done{};
}

Result<bool> Client::stopReportingSessionForID(std::int64_t id) {
  return boolCall(*conn_, "StopReportingSessionForID",
                  [&](sd_bus_message* m) { return sd_bus_message_append(m, "x", id); });
}

Result<bool> Client::destroyReportingSession(std::int64_t id) {
  return boolCall(*conn_, "DestroyReportingSession",
                  [&](sd_bus_message* m) { return sd_bus_message_append(m, "x", id); });
}

Result<ReporterInfo> Client::reporterIDValid(std::int64_t id) {
  auto reply = call(*conn_, "ReporterIDValid", [&](sd_bus_message* m) { return sd_bus_message_append(m, "x", id); });
  if (!reply) return reply.error();
  Message owned{*reply};
  auto answer = readDictionaryAnswer(owned.m);
  if (!answer) return answer.error();
  const Dictionary& d = *answer;
  ReporterInfo info;
  if (const Value* v = d.find("reporterID")) info.reporterID = v->toInt64().value_or(0);
  if (const Value* v = d.find("serviceType")) info.serviceType = static_cast<std::uint16_t>(v->toInt64().value_or(0));
  return info;
}

Result<std::vector<std::int64_t>> Client::getAllReporters() {
  auto reply = call(*conn_, "GetAllReporters", noArgs);
  if (!reply) return reply.error();
  Message owned{*reply};
  const void* p = nullptr;
  size_t n = 0;
  int r = sd_bus_message_read_array(owned.m, 'x', &p, &n);
  if (r < 0) return errorFromErrno(r, "unexpected answer");
  const auto* ids = static_cast<const std::int64_t*>(p);
  return std::vector<std::int64_t>(ids, ids + n / sizeof(std::int64_t));
}

Status Client::killService() { return sendNoReply(*conn_, "KillService", noArgs); }

Status Client::ping() {
  RecursiveMutexLock lock(conn_->mu);
  sd_bus_error e = SD_BUS_ERROR_NULL;
  int r = sd_bus_call_method(conn_->bus, kServiceName, kObjectPath, "org.freedesktop.DBus.Peer", "Ping", &e, nullptr,
                             "");
  if (r < 0) {
    Error err = errorFromBusError(&e, r, "Ping");
    sd_bus_error_free(&e);
    return err;
  }
  return Done{};
}

Result<Dictionary> Client::getStatus() {
  RecursiveMutexLock lock(conn_->mu);
  sd_bus_error e = SD_BUS_ERROR_NULL;
  sd_bus_message* reply = nullptr;
  int r = sd_bus_call_method(conn_->bus, kServiceName, kObjectPath, bus::kDebugInterface, "GetStatus", &e, &reply, "");
  if (r < 0) {
    Error err = errorFromBusError(&e, r, "GetStatus");
    sd_bus_error_free(&e);
    return err;
  }
  Message owned{reply};
  return readDictionaryAnswer(owned.m);
}

Status Client::setInterfaceOrientation(const std::string& orientation) {
  RecursiveMutexLock lock(conn_->mu);
  sd_bus_error e = SD_BUS_ERROR_NULL;
  int r = sd_bus_call_method(conn_->bus, kServiceName, kObjectPath, bus::kOrientationInterface,
                             "SetInterfaceOrientation", &e, nullptr, "s", orientation.c_str());
  if (r < 0) {
    Error err = errorFromBusError(&e, r, "SetInterfaceOrientation");
    sd_bus_error_free(&e);
    return err;
  }
  return Done{};
}

std::size_t Client::pump(std::chrono::milliseconds timeout) {
  conn_->pumpOnce(timeout);
  return conn_->pending.load();
}

std::size_t Client::pendingCalls() const { return conn_->pending.load(); }

Status Client::postNotification(const std::string& name) {
  RecursiveMutexLock lock(conn_->mu);
  int r = sd_bus_emit_signal(conn_->bus, "/com/orvane/Notify1", "com.orvane.Notify1", "Posted", "s", name.c_str());
  if (r >= 0) r = sd_bus_flush(conn_->bus);
  if (r < 0) return errorFromErrno(r, "cannot post the notification");
  return Done{};
}

Status postNotification(const std::string& name, BusKind kind) {
  auto client = Client::connect(kind);
  if (!client) return client.error();
  return (*client)->postNotification(name);
}

}  // namespace vireo::client
