// The telemetry-session service over the local store: each session is a
// telemetry_sessions row, each message a telemetry_messages row.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/linux/store/store.h"
#include "platform/telemetry_service.h"

namespace vireo::linux_platform {

struct LocalTelemetryCore;

class LocalTelemetryService : public TelemetryService {
 public:
  // configurationDirectory holds telemetry.conf.
  LocalTelemetryService(std::shared_ptr<LocalStore> store, std::string configurationDirectory);
  ~LocalTelemetryService() override;

  std::shared_ptr<HierarchyToken> makeHierarchyToken() override;
  std::shared_ptr<TelemetrySession> createSession(const Dictionary& sessionInfo, const Dictionary& userInfo,
                                                  const std::vector<std::string>& frameworksToCheck) override;
  bool sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo, std::uint16_t category,
                      std::uint16_t type, const Dictionary& payload, std::optional<Error>* error) override;

  // Backends= of telemetry.conf: ["local"] without the file or the key, nothing for
  // "none", an empty list for an empty value.
  static std::optional<std::vector<std::string>> readBackends(const std::string& configurationDirectory);

 private:
  std::shared_ptr<LocalTelemetryCore> core_;
};

class LocalTelemetrySession : public TelemetrySession {
 public:
  // rowId is absent when the session's row could not be handed to the store;
  // mark is the store's handedOver() from before that row.
  LocalTelemetrySession(std::shared_ptr<LocalTelemetryCore> core, std::optional<std::int64_t> rowId,
                        std::string token, std::uint64_t mark = 0);

  void startConfiguration(std::function<void(std::optional<std::vector<std::string>> backends)> completion) override;
  bool sendMessage(std::uint16_t category, std::uint16_t type, const Dictionary& payload,
                   std::optional<Error>* error) override;
  void flushMessages(std::function<void(std::optional<Error>)> completion) override;
  std::string description() const override;

  std::optional<std::int64_t> rowId() const { return rowId_; }

 private:
  const std::shared_ptr<LocalTelemetryCore> core_;
  const std::optional<std::int64_t> rowId_;
  const std::string token_;
  // A flush answers for the rows handed over since the previous one (other
  // sessions' rows among them): a row dropped long ago fails no later flush.
  std::atomic<std::uint64_t> flushMark_;
};

}  // namespace vireo::linux_platform
