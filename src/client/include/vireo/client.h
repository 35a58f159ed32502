// libvireo-client: a small C++ client of the reporting service over D-Bus.
//
// One Client is one bus connection, and a reporting session lives only as long as
// the connection of the client that created it. A Client is safe to use from several
// threads (calls are serialised on its own lock); for throughput give each thread a
// Client of its own.
//
// Every operation comes in two forms: a blocking one that returns the answer, and one
// that takes a callback and returns at once. Callbacks run on the thread that drives
// the connection, and only while it is driven: the host's own loop (fd(), events(),
// timeout(), process()), pump(), any blocking call, or the thread startEventThread()
// makes on request. The library starts no thread of its own otherwise.
//
// Nothing throws out of the library: failures come back as Error values, and an
// exception thrown by a callback is caught, reported on stderr and dropped.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <variant>
#include <vector>

#include "base/value.h"

#include "vireo/bus_names.h"

// The library's exported interface; everything else in it is hidden.
#define VIREO_CLIENT_API __attribute__((visibility("default")))

namespace vireo::client {

using bus::kInterface;
using bus::kObjectPath;
using bus::kReportingDisabledError;
using bus::kReportingNotification;
using bus::kServiceName;
inline constexpr const char* kReportingDomain = "com.orvane.audio.reporting";

// A failed call. name is the D-Bus error name (or a local one such as
// "org.freedesktop.DBus.Error.Disconnected"); the reporting-disabled error also
// carries its domain and code.
struct VIREO_CLIENT_API Error {
  std::string name;
  std::string message;
  std::string domain;  // kReportingDomain for the reporting-disabled error, else empty
  int code = 0;        // 1 for the reporting-disabled error
  bool isReportingDisabled() const noexcept { return domain == kReportingDomain && code == 1; }
  bool isTimeout() const noexcept;
};

struct Done {};

// A value or an Error. value() and friends require ok(): on an error they end the
// process rather than throw.
template <class T>
class Result {
 public:
  Result(T value) : v_(std::in_place_index<0>, std::move(value)) {}
  Result(Error error) : v_(std::in_place_index<1>, std::move(error)) {}

  bool ok() const noexcept { return v_.index() == 0; }
  explicit operator bool() const noexcept { return ok(); }
  const T& value() const noexcept { return std::get<0>(v_); }
  T& value() noexcept { return std::get<0>(v_); }
  const T& operator*() const noexcept { return std::get<0>(v_); }
  T& operator*() noexcept { return std::get<0>(v_); }
  const T* operator->() const noexcept { return &std::get<0>(v_); }
  T* operator->() noexcept { return &std::get<0>(v_); }
  const Error& error() const noexcept { return std::get<1>(v_); }

 private:
  std::variant<T, Error> v_;
};

using Status = Result<Done>;

// The answer of an asynchronous call. Called exactly once for every call that was
// sent (the returned Status was ok): with the answer, or with an error when the call
// timed out, the service went away or the Client was destroyed first.
template <class T>
using Callback = std::function<void(const Result<T>&)>;

enum class BusKind {
  Default,  // VIREO_BUS, else the system bus when running as root and the session bus otherwise
  System,
  Session,
};

struct ReporterInfo {
  std::int64_t reporterID = 0;
  std::uint16_t serviceType = 0xFFFF;
};

namespace detail {
struct Connection;
struct StartState;
}  // namespace detail

// The pending answer of StartReportingSessionForID, which the service gives only when
// the session stops (or is started again). Waiting drives the client's connection.
class VIREO_CLIENT_API StartHandle {
 public:
  StartHandle() = default;
  bool valid() const noexcept { return state_ != nullptr; }
  // True once the answer (or an error) has arrived; does not block.
  bool ready() const noexcept;
  // Waits for the answer; nothing when the timeout passed first.
  std::optional<Result<bool>> waitFor(std::chrono::milliseconds timeout) const noexcept;
  Result<bool> wait() const noexcept;

 private:
  friend class Client;
  std::shared_ptr<detail::StartState> state_;
  std::weak_ptr<detail::Connection> conn_;
};

class VIREO_CLIENT_API Client {
 public:
  // Connects as the bus rules of the service say (DBUS_*_BUS_ADDRESS honoured).
  static Result<std::unique_ptr<Client>> connect(BusKind kind = BusKind::Default) noexcept;
  // Connects to an explicit bus address ("unix:path=...").
  static Result<std::unique_ptr<Client>> connectAddress(const std::string& address) noexcept;

  // Stops the event thread, then closes the connection: callbacks still waiting get
  // org.freedesktop.DBus.Error.Disconnected (and must not use this Client any more).
  ~Client();
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  // Timeout of every call that expects a prompt answer (default 25 s).
  void setCallTimeout(std::chrono::microseconds timeout) noexcept;
  std::string uniqueName() const noexcept;

  // ---- Operations, blocking ----
  Result<bool> createReportingSession(std::int64_t reporterID) noexcept;
  Result<bool> setServiceType(std::uint16_t serviceType, std::int64_t reporterID) noexcept;
  Result<std::uint16_t> getServiceNameForReporterID(std::int64_t reporterID) noexcept;
  Result<bool> setConfiguration(const Dictionary& configuration, std::int64_t reporterID) noexcept;
  // The answer arrives when the session stops; the call has no timeout.
  StartHandle startReportingSessionForID(std::int64_t reporterID) noexcept;
  // Sends the start without asking for the answer.
  Status startReportingSessionForIDNoWait(std::int64_t reporterID) noexcept;
  // reporterIDs absent broadcasts; present (even empty) addresses those sessions.
  Status sendMessage(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                     const std::optional<std::vector<std::int64_t>>& reporterIDs = std::nullopt) noexcept;
  Result<bool> stopReportingSessionForID(std::int64_t reporterID) noexcept;
  Result<bool> destroyReportingSession(std::int64_t reporterID) noexcept;
  Result<ReporterInfo> reporterIDValid(std::int64_t reporterID) noexcept;
  Result<std::vector<std::int64_t>> getAllReporters() noexcept;
  // The service exits without answering; this only sends the call.
  Status killService() noexcept;

  // ---- Operations, with a callback ----
  // The returned Status says whether the call went out; only then does done run.
  Status createReportingSession(std::int64_t reporterID, Callback<bool> done) noexcept;
  Status setServiceType(std::uint16_t serviceType, std::int64_t reporterID, Callback<bool> done) noexcept;
  Status getServiceNameForReporterID(std::int64_t reporterID, Callback<std::uint16_t> done) noexcept;
  Status setConfiguration(const Dictionary& configuration, std::int64_t reporterID, Callback<bool> done) noexcept;
  // done runs when the session stops, is started again or goes away; no timeout.
  Status startReportingSessionForID(std::int64_t reporterID, Callback<bool> done) noexcept;
  Status sendMessage(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                     const std::optional<std::vector<std::int64_t>>& reporterIDs, Callback<Done> done) noexcept;
  Status sendMessageAsync(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                          const std::optional<std::vector<std::int64_t>>& reporterIDs, Callback<Done> done) noexcept {
    return sendMessage(payload, category, type, reporterIDs, std::move(done));
  }
  Status stopReportingSessionForID(std::int64_t reporterID, Callback<bool> done) noexcept;
  Status destroyReportingSession(std::int64_t reporterID, Callback<bool> done) noexcept;
  Status reporterIDValid(std::int64_t reporterID, Callback<ReporterInfo> done) noexcept;
  Status getAllReporters(Callback<std::vector<std::int64_t>> done) noexcept;

  // ---- Driving the connection from the host's loop ----
  // Watch fd() for events() (poll flags) with timeout() (milliseconds, -1 for none,
  // 0 when work is due), then call process(). Ask for events() and timeout() again
  // after every process() or call: both change as calls go out.
  int fd() const noexcept;
  int events() const noexcept;
  int timeout() const noexcept;
  // Dispatches whatever has arrived (running callbacks) without blocking; an error
  // once the connection is gone, after every waiting callback got its error.
  Status process() noexcept;
  // Or let the library run a thread of its own that does the same; callbacks then
  // run on it. stopEventThread() waits for the thread unless called from a callback.
  Status startEventThread() noexcept;
  void stopEventThread() noexcept;

  // Processes incoming answers for up to timeout; returns the number of async calls
  // still waiting for an answer.
  std::size_t pump(std::chrono::milliseconds timeout) noexcept;
  std::size_t pendingCalls() const noexcept;

  // org.freedesktop.DBus.Peer.Ping of the service: the bus round trip alone.
  Status ping() noexcept;
  // Posts the notification (the Posted(s) signal of com.orvane.Notify1).
  Status postNotification(const std::string& name) noexcept;
  // The daemon's live state (com.orvane.vireo.Debug1.GetStatus).
  Result<Dictionary> getStatus() noexcept;
  // Reports the user interface's orientation ("normal", "bottom-up", "left-up",
  // "right-up" or "undefined"), as the shell does.
  Status setInterfaceOrientation(const std::string& orientation) noexcept;

 private:
  explicit Client(std::shared_ptr<detail::Connection> conn);
  std::shared_ptr<detail::Connection> conn_;
};

// Posts the notification on a short-lived connection of its own.
VIREO_CLIENT_API Status postNotification(const std::string& name, BusKind kind = BusKind::Default) noexcept;

// Maps an sd-bus error to a client Error (the reporting-disabled error gets its
// domain and code back).
VIREO_CLIENT_API Error errorFromDBus(const std::string& name, const std::string& message) noexcept;

}  // namespace vireo::client
