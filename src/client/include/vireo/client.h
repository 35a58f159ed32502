// libvireo-client: a small C++ client of the reporting service over D-Bus.
//
// One Client is one bus connection, and a reporting session lives only as long as
// the connection of the client that created it. A Client is safe to use from several
// threads (calls are serialised on its own lock); for throughput give each thread a
// Client of its own.
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
struct Error {
  std::string name;
  std::string message;
  std::string domain;  // kReportingDomain for the reporting-disabled error, else empty
  int code = 0;        // 1 for the reporting-disabled error
  bool isReportingDisabled() const { return domain == kReportingDomain && code == 1; }
  bool isTimeout() const;
};

struct Done {};

template <class T>
class Result {
 public:
  Result(T value) : v_(std::in_place_index<0>, std::move(value)) {}
  Result(Error error) : v_(std::in_place_index<1>, std::move(error)) {}

  bool ok() const noexcept { return v_.index() == 0; }
  explicit operator bool() const noexcept { return ok(); }
  const T& value() const { return std::get<0>(v_); }
  T& value() { return std::get<0>(v_); }
  const T& operator*() const { return std::get<0>(v_); }
  T& operator*() { return std::get<0>(v_); }
  const T* operator->() const { return &std::get<0>(v_); }
  T* operator->() { return &std::get<0>(v_); }
  const Error& error() const { return std::get<1>(v_); }

 private:
  std::variant<T, Error> v_;
};

using Status = Result<Done>;

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
class StartHandle {
 public:
  StartHandle() = default;
  bool valid() const noexcept { return state_ != nullptr; }
  // True once the answer (or an error) has arrived; does not block.
  bool ready() const;
  // Waits for the answer; nothing when the timeout passed first.
  std::optional<Result<bool>> waitFor(std::chrono::milliseconds timeout) const;
  Result<bool> wait() const;

 private:
  friend class Client;
  std::shared_ptr<detail::StartState> state_;
  std::weak_ptr<detail::Connection> conn_;
};

class Client {
 public:
  // Connects as platform.md's bus rules say (DBUS_*_BUS_ADDRESS honoured).
  static Result<std::unique_ptr<Client>> connect(BusKind kind = BusKind::Default);
  // Connects to an explicit bus address ("unix:path=...").
  static Result<std::unique_ptr<Client>> connectAddress(const std::string& address);

  ~Client();
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  // Timeout of every call that expects a prompt answer (default 25 s).
  void setCallTimeout(std::chrono::microseconds timeout);
  std::string uniqueName() const;

  Result<bool> createReportingSession(std::int64_t reporterID);
  Result<bool> setServiceType(std::uint16_t serviceType, std::int64_t reporterID);
  Result<std::uint16_t> getServiceNameForReporterID(std::int64_t reporterID);
  Result<bool> setConfiguration(const Dictionary& configuration, std::int64_t reporterID);
  // The answer arrives when the session stops; the call has no timeout.
  StartHandle startReportingSessionForID(std::int64_t reporterID);
  // Sends the start without asking for the answer.
  Status startReportingSessionForIDNoWait(std::int64_t reporterID);
  // reporterIDs absent broadcasts; present (even empty) addresses those sessions.
  Status sendMessage(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                     const std::optional<std::vector<std::int64_t>>& reporterIDs = std::nullopt);
  // Pipelined form: the callback runs from pump() (or any call) on this Client.
  Status sendMessageAsync(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                          const std::optional<std::vector<std::int64_t>>& reporterIDs,
                          std::function<void(const Status&)> done);
  Result<bool> stopReportingSessionForID(std::int64_t reporterID);
  Result<bool> destroyReportingSession(std::int64_t reporterID);
  Result<ReporterInfo> reporterIDValid(std::int64_t reporterID);
  Result<std::vector<std::int64_t>> getAllReporters();
  // The service exits without answering; this only sends the call.
  Status killService();

  // org.freedesktop.DBus.Peer.Ping of the service: the bus round trip alone.
  Status ping();
  // Processes incoming answers for up to timeout; returns the number of async calls
  // still waiting for an answer.
  std::size_t pump(std::chrono::milliseconds timeout);
  std::size_t pendingCalls() const;

  // Posts the notification (the Posted(s) signal of com.orvane.Notify1).
  Status postNotification(const std::string& name);
  // The daemon's live state (com.orvane.vireo.Debug1.GetStatus).
  Result<Dictionary> getStatus();
  // Reports the user interface's orientation ("normal", "bottom-up", "left-up",
  // "right-up" or "undefined"), as the shell does.
  Status setInterfaceOrientation(const std::string& orientation);

 private:
  explicit Client(std::shared_ptr<detail::Connection> conn);
  std::shared_ptr<detail::Connection> conn_;
};

// Posts the notification on a short-lived connection of its own.
Status postNotification(const std::string& name, BusKind kind = BusKind::Default);

// Maps an sd-bus error to a client Error (the reporting-disabled error gets its
// domain and code back).
Error errorFromDBus(const std::string& name, const std::string& message);

}  // namespace vireo::client
