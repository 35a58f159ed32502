// The telemetry-session service: sessions with hierarchy tokens, backend discovery,
// message delivery, flush, and the one-shot send.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/value.h"
#include "platform/error.h"

namespace vireo {

// Keys of the session-info and user-info dictionaries.
namespace telemetry_keys {
inline constexpr const char* kClientType = "client_type";
inline constexpr const char* kClientVersion = "client_version";
inline constexpr const char* kSessionId = "session_id";
inline constexpr const char* kBatchEvent = "batch_event";
inline constexpr const char* kHierarchyToken = "hierarchy_token";
inline constexpr const char* kClientName = "client_name";
inline constexpr const char* kServiceName = "service_name";
}  // namespace telemetry_keys

// An opaque token naming a telemetry session in the service's hierarchy.
struct HierarchyToken {
  std::string text;
};

class TelemetrySession {
 public:
  virtual ~TelemetrySession() = default;
  // Discovers the backends; completion is called once, on a thread of the service's
  // own, with the backends found or with nothing at all.
  virtual void startConfiguration(std::function<void(std::optional<std::vector<std::string>> backends)> completion) = 0;
  // Queues one message; false when it was refused (error filled when there is one).
  virtual bool sendMessage(std::uint16_t category, std::uint16_t type, const Dictionary& payload,
                           std::optional<Error>* error) = 0;
  // Delivers what is queued; completion gets an error or nothing.
  virtual void flushMessages(std::function<void(std::optional<Error>)> completion) = 0;
  // Text for log lines ("%@").
  virtual std::string description() const = 0;
};

class TelemetryService {
 public:
  virtual ~TelemetryService() = default;
  virtual std::shared_ptr<HierarchyToken> makeHierarchyToken() = 0;
  virtual std::shared_ptr<TelemetrySession> createSession(const Dictionary& sessionInfo, const Dictionary& userInfo,
                                                          const std::vector<std::string>& frameworksToCheck) = 0;
  virtual bool sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo, std::uint16_t category,
                              std::uint16_t type, const Dictionary& payload, std::optional<Error>* error) = 0;
};

}  // namespace vireo
