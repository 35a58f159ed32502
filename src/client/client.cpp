#include "vireo/client.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <exception>
#include <thread>

#include "base/mutex.h"
#include "platform/dbus/value_codec.h"

namespace vireo::client {

namespace {

constexpr const char* kDisconnected = "org.freedesktop.DBus.Error.Disconnected";
constexpr const char* kPeerInterface = "org.freedesktop.DBus.Peer";

Error outOfMemory() noexcept { return Error{"org.freedesktop.DBus.Error.NoMemory", "out of memory", {}, 0}; }

// What a callback threw cannot go anywhere useful; the host's log is the best place.
void reportThrown(const char* what) noexcept {
  std::fprintf(stderr, "libvireo-client: a reply callback threw (%s); ignored\n", what);
}

std::uint64_t monotonicUsec() noexcept {
  timespec ts{};
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<std::uint64_t>(ts.tv_sec) * 1'000'000 + static_cast<std::uint64_t>(ts.tv_nsec) / 1000;
}

// An sd-bus deadline (absolute CLOCK_MONOTONIC microseconds, UINT64_MAX for none) as
// a poll() timeout, rounded up so that a poll that returns finds the work due.
int pollTimeout(std::uint64_t until) noexcept {
  if (until == UINT64_MAX) return -1;
  std::uint64_t now = monotonicUsec();
  if (until <= now) return 0;
  return static_cast<int>(std::min<std::uint64_t>((until - now + 999) / 1000, INT_MAX));
}

}  // namespace

namespace detail {

// The answer of a pending start, shared between the handle and the reply slot.
struct StartState {
  Mutex mu;  // guards result
  std::optional<Result<bool>> result VIREO_GUARDED_BY(mu);

  void set(const Result<bool>& r) {
    MutexLock lock(mu);
    if (!result) result.emplace(r);
  }
};

struct Connection : std::enable_shared_from_this<Connection> {
  // Guards bus: sd-bus objects are not thread-safe. Recursive so that an async
  // callback may make the next call on the same connection.
  mutable RecursiveMutex mu;
  sd_bus* bus VIREO_GUARDED_BY(mu) = nullptr;
  std::uint64_t timeoutUsec VIREO_GUARDED_BY(mu) = 25'000'000;
  std::atomic<std::size_t> pending{0};

  // The event thread, when asked for. A thread runs while generation is the one it
  // was started with, so a stop from its own callback needs no join.
  Mutex threadMu;
  std::thread thread VIREO_GUARDED_BY(threadMu);
  std::atomic<unsigned> generation{0};
  std::atomic<bool> threadActive{false};
  // Wakes the event thread when another thread changed what it must wait for (a
  // blocking call may have queued answers, a call may have a nearer deadline).
  std::atomic<int> wakeFd{-1};

  ~Connection() {
    if (bus) sd_bus_flush_close_unref(bus);
    if (int fd = wakeFd.load(); fd >= 0) ::close(fd);
  }

  void wake() noexcept {
    int fd = wakeFd.load();
    std::uint64_t one = 1;
    if (threadActive.load() && fd >= 0 && ::write(fd, &one, sizeof one) < 0) {
      // Full counter: the thread has a wake-up pending anyway.
    }
  }

  // Dispatches everything already received; true when something was dispatched.
  bool drain() VIREO_REQUIRES(mu) {
    bool progress = false;
    while (sd_bus_process(bus, nullptr) > 0) progress = true;
    return progress;
  }

  // Dispatches what has arrived; when nothing had, sleeps on the socket (and the wake
  // descriptor, when given) for at most maxMs without holding the lock, so other
  // threads may call meanwhile.
  void pumpOnce(int maxMs, int extraFd = -1) {
    pollfd p[2] = {{-1, 0, 0}, {extraFd, POLLIN, 0}};
    int wait = maxMs;
    {
      RecursiveMutexLock lock(mu);
      if (drain()) return;
      int events = sd_bus_get_events(bus);
      std::uint64_t until = UINT64_MAX;
      if (events >= 0) {
        p[0].fd = sd_bus_get_fd(bus);
        p[0].events = static_cast<short>(events);
        if (sd_bus_get_timeout(bus, &until) >= 0) {
          int due = pollTimeout(until);
          if (due >= 0 && (wait < 0 || due < wait)) wait = due;
        }
      }
    }
    ::poll(p, 2, wait);
    if (p[1].revents & POLLIN) {
      std::uint64_t n;
      if (::read(extraFd, &n, sizeof n) < 0) {
        // Already drained by an earlier wake-up.
      }
    }
    RecursiveMutexLock lock(mu);
    drain();
  }

  void runEvents(unsigned mine) {
    while (generation.load() == mine) pumpOnce(-1, wakeFd.load());
  }
};

namespace {

// Holds the connection; on release wakes the event thread, whose wait may be stale now.
class VIREO_SCOPED_CAPABILITY BusLock {
 public:
  explicit BusLock(Connection& c) VIREO_ACQUIRE(c.mu) : c_(c) { c_.mu.lock(); }
  ~BusLock() VIREO_RELEASE() {
    c_.mu.unlock();
    c_.wake();
  }
  BusLock(const BusLock&) = delete;
  BusLock& operator=(const BusLock&) = delete;

 private:
  Connection& c_;
};

}  // namespace
}  // namespace detail

namespace {

using detail::BusLock;
using detail::Connection;

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

Error badAnswer(int r) { return errorFromErrno(r, "unexpected answer"); }

struct Message {
  sd_bus_message* m = nullptr;
  ~Message() { sd_bus_message_unref(m); }
};

// Owns one async call: the bus keeps the floating slot and calls destroy when the
// slot goes, whether the answer came or the connection closed. done runs once, with
// the answer or with nullptr when there never was one.
struct PendingCall {
  Connection* conn;
  bool answered = false;
  std::function<void(sd_bus_message*)> done;

  // Nothing may unwind through sd-bus.
  static void run(std::function<void(sd_bus_message*)>& done, sd_bus_message* m) noexcept {
    auto f = std::move(done);
    if (!f) return;
    try {
      f(m);
    } catch (const std::exception& e) {
      reportThrown(e.what());
    } catch (...) {
      reportThrown("not a std::exception");
    }
  }
  static int onReply(sd_bus_message* m, void* userdata, sd_bus_error*) noexcept {
    auto* self = static_cast<PendingCall*>(userdata);
    self->answered = true;
    run(self->done, m);
    return 0;
  }
  static void onDestroy(void* userdata) noexcept {
    auto* self = static_cast<PendingCall*>(userdata);
    if (!self->answered) run(self->done, nullptr);
    self->conn->pending.fetch_sub(1);
    delete self;
  }
};

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

// ---- Answers ----

Result<Done> readNothing(sd_bus_message*) { return Done{}; }

Result<bool> readBool(sd_bus_message* m) {
  int b = 0;
  if (int r = sd_bus_message_read(m, "b", &b); r < 0) return badAnswer(r);
  return b != 0;
}

Result<std::uint16_t> readServiceType(sd_bus_message* m) {
  std::uint16_t type = 0;
  if (int r = sd_bus_message_read(m, "q", &type); r < 0) return badAnswer(r);
  return type;
}

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

Result<ReporterInfo> readReporterInfo(sd_bus_message* m) {
  auto answer = readDictionaryAnswer(m);
  if (!answer) return answer.error();
  ReporterInfo info;
  if (const Value* v = answer->find("reporterID")) info.reporterID = v->toInt64().value_or(0);
  if (const Value* v = answer->find("serviceType"))
    info.serviceType = static_cast<std::uint16_t>(v->toInt64().value_or(0));
  return info;
}

Result<std::vector<std::int64_t>> readIDs(sd_bus_message* m) {
  const void* p = nullptr;
  size_t n = 0;
  if (int r = sd_bus_message_read_array(m, 'x', &p, &n); r < 0) return badAnswer(r);
  const auto* ids = static_cast<const std::int64_t*>(p);
  return std::vector<std::int64_t>(ids, ids + n / sizeof(std::int64_t));
}

// ---- Calls ----

int noArgs(sd_bus_message*) { return 0; }

auto idArg(std::int64_t id) {
  return [id](sd_bus_message* m) { return sd_bus_message_append(m, "x", id); };
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

// Builds a call to the service; fill appends the arguments.
template <class Fill>
int newCall(sd_bus* bus, const char* interface, const char* method, Fill& fill, sd_bus_message** out) {
  int r = sd_bus_message_new_method_call(bus, out, kServiceName, kObjectPath, interface, method);
  return r < 0 ? r : fill(*out);
}

template <class T, class Fill, class Read>
Result<T> callSync(Connection& c, const char* interface, const char* method, Fill fill, Read read) noexcept {
  try {
    BusLock lock(c);
    Message m;
    if (int r = newCall(c.bus, interface, method, fill, &m.m); r < 0) return errorFromErrno(r, "cannot build the call");
    sd_bus_error e = SD_BUS_ERROR_NULL;
    Message reply;
    if (int r = sd_bus_call(c.bus, m.m, c.timeoutUsec, &e, &reply.m); r < 0) {
      Error err = errorFromBusError(&e, r, method);
      sd_bus_error_free(&e);
      return err;
    }
    return read(reply.m);
  } catch (...) {
    return outOfMemory();
  }
}

template <class T, class Fill>
Result<T> call(Connection& c, const char* method, Fill fill, Result<T> (*read)(sd_bus_message*)) noexcept {
  return callSync<T>(c, kInterface, method, std::move(fill), read);
}

template <class T, class Fill>
Status callAsync(Connection& c, const char* method, Fill fill, Result<T> (*read)(sd_bus_message*),
                 Callback<T> done, std::uint64_t timeoutUsec = 0) noexcept {
  try {
    BusLock lock(c);
    Message m;
    if (int r = newCall(c.bus, kInterface, method, fill, &m.m); r < 0) return errorFromErrno(r, "cannot build the call");
    auto* pending = new PendingCall{&c, false, [read, cb = std::move(done)](sd_bus_message* reply) {
                                      if (!cb) return;
                                      Status s = statusFromReply(reply);
                                      if (!s) return cb(Result<T>(s.error()));
                                      cb(read(reply));
                                    }};
    sd_bus_slot* slot = nullptr;
    int r = sd_bus_call_async(c.bus, &slot, m.m, PendingCall::onReply, pending, timeoutUsec ? timeoutUsec : c.timeoutUsec);
    if (r < 0) {
      delete pending;
      return errorFromErrno(r, method);
    }
    c.pending.fetch_add(1);
    sd_bus_slot_set_destroy_callback(slot, PendingCall::onDestroy);
    // The bus keeps the slot from here on; drop the reference the call gave us.
    sd_bus_slot_set_floating(slot, 1);
    sd_bus_slot_unref(slot);
    return Done{};
  } catch (...) {
    return outOfMemory();
  }
}

template <class Fill>
Status sendNoReply(Connection& c, const char* method, Fill fill) noexcept {
  try {
    BusLock lock(c);
    Message m;
    int r = newCall(c.bus, kInterface, method, fill, &m.m);
    if (r >= 0) r = sd_bus_message_set_expect_reply(m.m, 0);
    if (r >= 0) r = sd_bus_send(c.bus, m.m, nullptr);
    if (r >= 0) r = sd_bus_flush(c.bus);
    if (r < 0) return errorFromErrno(r, method);
    return Done{};
  } catch (...) {
    return outOfMemory();
  }
}

}  // namespace

bool Error::isTimeout() const noexcept {
  return name == "org.freedesktop.DBus.Error.Timeout" || name == "org.freedesktop.DBus.Error.NoReply" ||
         name == "org.freedesktop.DBus.Error.TimedOut";
}

Error errorFromDBus(const std::string& name, const std::string& message) noexcept {
  Error e{name, message, {}, 0};
  if (name == kReportingDisabledError) {
    e.domain = kReportingDomain;
    e.code = 1;
  }
  return e;
}

// ---- StartHandle ----

bool StartHandle::ready() const noexcept {
  if (!state_) return true;
  MutexLock lock(state_->mu);
  return state_->result.has_value();
}

std::optional<Result<bool>> StartHandle::waitFor(std::chrono::milliseconds timeout) const noexcept {
  try {
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
      conn->pumpOnce(static_cast<int>(std::min<std::chrono::milliseconds>(left, std::chrono::milliseconds(100)).count()) + 1);
    }
  } catch (...) {
    return Result<bool>(outOfMemory());
  }
}

Result<bool> StartHandle::wait() const noexcept {
  for (;;)
    if (auto r = waitFor(std::chrono::hours(1))) return *r;
}

// ---- Client ----

Client::Client(std::shared_ptr<detail::Connection> conn) : conn_(std::move(conn)) {}

Client::~Client() { stopEventThread(); }

Result<std::unique_ptr<Client>> Client::connect(BusKind kind) noexcept {
  try {
    auto conn = std::make_shared<Connection>();
    RecursiveMutexLock lock(conn->mu);  // not shared yet; keeps the analysis simple
    int r = resolveKind(kind) == BusKind::System ? sd_bus_open_system(&conn->bus) : sd_bus_open_user(&conn->bus);
    if (r < 0) return errorFromErrno(r, "cannot connect to the bus");
    return std::unique_ptr<Client>(new Client(std::move(conn)));
  } catch (...) {
    return outOfMemory();
  }
}

Result<std::unique_ptr<Client>> Client::connectAddress(const std::string& address) noexcept {
  try {
    auto conn = std::make_shared<Connection>();
    RecursiveMutexLock lock(conn->mu);  // not shared yet; keeps the analysis simple
    int r = sd_bus_new(&conn->bus);
    if (r < 0) return errorFromErrno(r, "cannot create a bus connection");
    if ((r = sd_bus_set_address(conn->bus, address.c_str())) < 0) return errorFromErrno(r, "bad bus address");
    sd_bus_set_bus_client(conn->bus, 1);
    if ((r = sd_bus_start(conn->bus)) < 0) return errorFromErrno(r, "cannot connect to the bus");
    return std::unique_ptr<Client>(new Client(std::move(conn)));
  } catch (...) {
    return outOfMemory();
  }
}

void Client::setCallTimeout(std::chrono::microseconds timeout) noexcept {
  RecursiveMutexLock lock(conn_->mu);
  conn_->timeoutUsec = static_cast<std::uint64_t>(timeout.count());
}

std::string Client::uniqueName() const noexcept {
  try {
    RecursiveMutexLock lock(conn_->mu);
    const char* name = nullptr;
    if (sd_bus_get_unique_name(conn_->bus, &name) < 0 || !name) return {};
    return name;
  } catch (...) {
    return {};
  }
}

// ---- Operations, blocking ----

Result<bool> Client::createReportingSession(std::int64_t id) noexcept {
  return call(*conn_, "CreateReportingSession", idArg(id), readBool);
}

Result<bool> Client::setServiceType(std::uint16_t serviceType, std::int64_t id) noexcept {
  return call(*conn_, "SetServiceType", [&](sd_bus_message* m) { return sd_bus_message_append(m, "qx", serviceType, id); },
              readBool);
}

Result<std::uint16_t> Client::getServiceNameForReporterID(std::int64_t id) noexcept {
  return call(*conn_, "GetServiceNameForReporterID", idArg(id), readServiceType);
}

Result<bool> Client::setConfiguration(const Dictionary& configuration, std::int64_t id) noexcept {
  return call(*conn_, "SetConfiguration", [&](sd_bus_message* m) {
    int r = dbus::appendStringDictionary(m, configuration);
    return r < 0 ? r : sd_bus_message_append(m, "x", id);
  }, readBool);
}

StartHandle Client::startReportingSessionForID(std::int64_t id) noexcept {
  StartHandle handle;
  try {
    handle.state_ = std::make_shared<detail::StartState>();
    handle.conn_ = conn_;
    Status sent = startReportingSessionForID(id, [state = handle.state_](const Result<bool>& r) { state->set(r); });
    if (!sent) handle.state_->set(sent.error());
  } catch (...) {
    handle.state_.reset();  // invalid: waiting on it answers at once with an error
  }
  return handle;
}

Status Client::startReportingSessionForIDNoWait(std::int64_t id) noexcept {
  return sendNoReply(*conn_, "StartReportingSessionForID", idArg(id));
}

Status Client::sendMessage(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                           const std::optional<std::vector<std::int64_t>>& ids) noexcept {
  return call(*conn_, "SendMessage",
              [&](sd_bus_message* m) { return appendMessageArgs(m, payload, category, type, ids); }, readNothing);
}

Result<bool> Client::stopReportingSessionForID(std::int64_t id) noexcept {
  return call(*conn_, "StopReportingSessionForID", idArg(id), readBool);
}

Result<bool> Client::destroyReportingSession(std::int64_t id) noexcept {
  return call(*conn_, "DestroyReportingSession", idArg(id), readBool);
}

Result<ReporterInfo> Client::reporterIDValid(std::int64_t id) noexcept {
  return call(*conn_, "ReporterIDValid", idArg(id), readReporterInfo);
}

Result<std::vector<std::int64_t>> Client::getAllReporters() noexcept {
  return call(*conn_, "GetAllReporters", noArgs, readIDs);
}

Status Client::killService() noexcept { return sendNoReply(*conn_, "KillService", noArgs); }

// ---- Operations, with a callback ----

Status Client::createReportingSession(std::int64_t id, Callback<bool> done) noexcept {
  return callAsync(*conn_, "CreateReportingSession", idArg(id), readBool, std::move(done));
}

Status Client::setServiceType(std::uint16_t serviceType, std::int64_t id, Callback<bool> done) noexcept {
  return callAsync(*conn_, "SetServiceType",
                   [&](sd_bus_message* m) { return sd_bus_message_append(m, "qx", serviceType, id); }, readBool,
                   std::move(done));
}

Status Client::getServiceNameForReporterID(std::int64_t id, Callback<std::uint16_t> done) noexcept {
  return callAsync(*conn_, "GetServiceNameForReporterID", idArg(id), readServiceType, std::move(done));
}

Status Client::setConfiguration(const Dictionary& configuration, std::int64_t id, Callback<bool> done) noexcept {
  return callAsync(*conn_, "SetConfiguration", [&](sd_bus_message* m) {
    int r = dbus::appendStringDictionary(m, configuration);
    return r < 0 ? r : sd_bus_message_append(m, "x", id);
  }, readBool, std::move(done));
}

Status Client::startReportingSessionForID(std::int64_t id, Callback<bool> done) noexcept {
  // No timeout: the answer comes when the session stops.
  return callAsync(*conn_, "StartReportingSessionForID", idArg(id), readBool, std::move(done), UINT64_MAX);
}

Status Client::sendMessage(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                           const std::optional<std::vector<std::int64_t>>& ids, Callback<Done> done) noexcept {
  return callAsync(*conn_, "SendMessage",
                   [&](sd_bus_message* m) { return appendMessageArgs(m, payload, category, type, ids); }, readNothing,
                   std::move(done));
}

Status Client::stopReportingSessionForID(std::int64_t id, Callback<bool> done) noexcept {
  return callAsync(*conn_, "StopReportingSessionForID", idArg(id), readBool, std::move(done));
}

Status Client::destroyReportingSession(std::int64_t id, Callback<bool> done) noexcept {
  return callAsync(*conn_, "DestroyReportingSession", idArg(id), readBool, std::move(done));
}

Status Client::reporterIDValid(std::int64_t id, Callback<ReporterInfo> done) noexcept {
  return callAsync(*conn_, "ReporterIDValid", idArg(id), readReporterInfo, std::move(done));
}

Status Client::getAllReporters(Callback<std::vector<std::int64_t>> done) noexcept {
  return callAsync(*conn_, "GetAllReporters", noArgs, readIDs, std::move(done));
}

// ---- Driving the connection ----

int Client::fd() const noexcept {
  RecursiveMutexLock lock(conn_->mu);
  return sd_bus_get_fd(conn_->bus);
}

int Client::events() const noexcept {
  RecursiveMutexLock lock(conn_->mu);
  return sd_bus_get_events(conn_->bus);
}

int Client::timeout() const noexcept {
  RecursiveMutexLock lock(conn_->mu);
  std::uint64_t until = UINT64_MAX;
  // A closed connection still has errors to hand out: process() at once.
  if (sd_bus_get_timeout(conn_->bus, &until) < 0) return 0;
  return pollTimeout(until);
}

Status Client::process() noexcept {
  try {
    RecursiveMutexLock lock(conn_->mu);
    int r;
    while ((r = sd_bus_process(conn_->bus, nullptr)) > 0) {
    }
    if (r < 0) return errorFromErrno(r, "connection closed");
    return Done{};
  } catch (...) {
    return outOfMemory();
  }
}

Status Client::startEventThread() noexcept {
  Connection& c = *conn_;
  try {
    MutexLock lock(c.threadMu);
    if (c.threadActive.load()) return Done{};
    if (c.wakeFd.load() < 0) {
      int fd = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
      if (fd < 0) return errorFromErrno(-errno, "cannot create the event thread's wake-up");
      c.wakeFd.store(fd);
    }
    // A thread stopped from its own callback may still be finishing it; it ends after.
    unsigned mine = c.generation.fetch_add(1) + 1;
    // The thread keeps the connection alive until it has seen its stop.
    c.thread = std::thread([conn = c.shared_from_this(), mine] { conn->runEvents(mine); });
    c.threadActive.store(true);
    return Done{};
  } catch (...) {
    return Error{"org.freedesktop.DBus.Error.Failed", "cannot start the event thread", {}, 0};
  }
}

void Client::stopEventThread() noexcept {
  Connection& c = *conn_;
  std::thread t;
  {
    MutexLock lock(c.threadMu);
    if (!c.threadActive.load()) return;
    c.generation.fetch_add(1);
    c.threadActive.store(false);
    t = std::move(c.thread);
  }
  std::uint64_t one = 1;
  if (::write(c.wakeFd.load(), &one, sizeof one) < 0) {
    // Full counter: the thread is being woken anyway.
  }
  if (t.get_id() == std::this_thread::get_id())
    t.detach();  // called from a callback: the thread ends when the callback returns
  else if (t.joinable())
    t.join();
}

std::size_t Client::pump(std::chrono::milliseconds timeout) noexcept {
  conn_->pumpOnce(static_cast<int>(std::clamp<std::int64_t>(timeout.count(), 0, INT_MAX)));
  return conn_->pending.load();
}

std::size_t Client::pendingCalls() const noexcept { return conn_->pending.load(); }

Status Client::ping() noexcept { return callSync<Done>(*conn_, kPeerInterface, "Ping", noArgs, readNothing); }

Result<Dictionary> Client::getStatus() noexcept {
  return callSync<Dictionary>(*conn_, bus::kDebugInterface, "GetStatus", noArgs, readDictionaryAnswer);
}

Status Client::setInterfaceOrientation(const std::string& orientation) noexcept {
  return callSync<Done>(*conn_, bus::kOrientationInterface, "SetInterfaceOrientation",
                        [&](sd_bus_message* m) { return sd_bus_message_append(m, "s", orientation.c_str()); },
                        readNothing);
}

Status Client::postNotification(const std::string& name) noexcept {
  try {
    BusLock lock(*conn_);
    int r = sd_bus_emit_signal(conn_->bus, bus::kNotifyPath, bus::kNotifyInterface, "Posted", "s", name.c_str());
    if (r >= 0) r = sd_bus_flush(conn_->bus);
    if (r < 0) return errorFromErrno(r, "cannot post the notification");
    // On the system bus the daemon asks the bus who posted, which needs this connection
    // still there. Its answer to a ping leaves after it has read the post and asked, so
    // staying for that answer is enough. The ping neither starts a daemon that is not
    // running nor decides the outcome: the post is out either way.
    Message ping;
    if (sd_bus_message_new_method_call(conn_->bus, &ping.m, kServiceName, kObjectPath, "org.freedesktop.DBus.Peer",
                                       "Ping") >= 0 &&
        sd_bus_message_set_auto_start(ping.m, 0) >= 0)
      sd_bus_call(conn_->bus, ping.m, conn_->timeoutUsec, nullptr, nullptr);
    return Done{};
  } catch (...) {
    return outOfMemory();
  }
}

Status postNotification(const std::string& name, BusKind kind) noexcept {
  auto client = Client::connect(kind);
  if (!client) return client.error();
  return (*client)->postNotification(name);
}

}  // namespace vireo::client
