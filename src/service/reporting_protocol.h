// The whole interface a client sees: eleven asynchronous operations, each answering
// (if at all) through its reply callback.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <vector>

#include "base/value.h"
#include "platform/error.h"

namespace vireo {

using BoolReply = std::function<void(bool)>;
using ServiceTypeReply = std::function<void(std::uint16_t)>;
using ErrorReply = std::function<void(std::optional<Error>)>;
using DictionaryReply = std::function<void(Dictionary)>;
using ReporterListReply = std::function<void(std::vector<std::int64_t>)>;

// The answer to a start. A started session holds it and answers true when it
// stops; a session that goes away holding it unanswered (replaced by a new create)
// calls sessionEnded instead, so that no caller waits for ever.
struct StartReply {
  StartReply() = default;
  StartReply(std::nullptr_t) {}
  StartReply(BoolReply answer, std::function<void()> sessionEnded = nullptr)
      : answer(std::move(answer)), sessionEnded(std::move(sessionEnded)) {}
  BoolReply answer;
  std::function<void()> sessionEnded;
};

class VRReportingServiceProtocol {
 public:
  virtual ~VRReportingServiceProtocol() = default;
  // createReportingSession:reply:
  virtual void createReportingSession(std::int64_t reporterID, BoolReply reply) = 0;
  // setServiceType:reportingSession:reply:
  virtual void setServiceType(std::uint16_t serviceType, std::int64_t reporterID, BoolReply reply) = 0;
  // getServiceNameForReporterID:reply:
  virtual void getServiceNameForReporterID(std::int64_t reporterID, ServiceTypeReply reply) = 0;
  // setConfiguration:forReporterID:reply:
  virtual void setConfiguration(Dictionary configuration, std::int64_t reporterID, BoolReply reply) = 0;
  // startReportingSessionForID:reply:
  virtual void startReportingSessionForID(std::int64_t reporterID, StartReply reply) = 0;
  // sendMessage:withCategory:andType:forReportingIDs:reply: (no list: broadcast)
  virtual void sendMessage(Dictionary payload, std::uint32_t category, std::uint16_t type,
                           std::optional<std::vector<std::int64_t>> reporterIDs, ErrorReply reply) = 0;
  // stopReportingSessionForID:reply:
  virtual void stopReportingSessionForID(std::int64_t reporterID, BoolReply reply) = 0;
  // destroyReportingSession:reply:
  virtual void destroyReportingSession(std::int64_t reporterID, BoolReply reply) = 0;
  // reporterID:valid:
  virtual void reporterIDValid(std::int64_t reporterID, DictionaryReply reply) = 0;
  // getAllReporters:
  virtual void getAllReporters(ReporterListReply reply) = 0;
  // killService:
  virtual void killService(BoolReply reply) = 0;
};

}  // namespace vireo
