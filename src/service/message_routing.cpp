// sendMessage:withCategory:andType:forReportingIDs:reply: of the server instance:
// which sessions receive a client's message, and the two event sinks beside them.
#include <string>

#include "platform/error.h"
#include "platform/logger.h"
#include "platform/tracer.h"
#include "service/server_instance.h"
#include "session/reporting_session.h"
#include "sinks/tallyhub_bridge.h"
#include "sinks/voltmark_utility.h"
#include "vocabulary/reporting_environment.h"

namespace vireo {

namespace {
constexpr const char* kSendLabel = "-[VRReportingServerInstance sendMessage:withCategory:andType:forReportingIDs:reply:]";
// Messages that belong to no session go out as the "standalone" service.
constexpr std::uint16_t kStandaloneServiceType = 5;

std::string idsText(const std::optional<std::vector<std::int64_t>>& reporterIDs) {
  if (!reporterIDs) return Value().text();
  Array ids;
  ids.reserve(reporterIDs->size());
  for (std::int64_t id : *reporterIDs) ids.emplace_back(id);
  return Value(std::move(ids)).text();
}

// "[session, session]", as the log lines show a list of sessions.
std::string sessionsText(const std::vector<std::shared_ptr<VRReportingSession>>& sessions) {
  std::string out = "[";
  for (const auto& session : sessions) {
    if (out.size() > 1) out += ", ";
    out += session->description();
  }
  return out + ']';
}
}  // namespace

void VRReportingServerInstance::sendMessage(Dictionary payload, std::uint32_t category, std::uint16_t type,
                                            std::optional<std::vector<std::int64_t>> reporterIDs, ErrorReply reply) {
  VR_DEBUG(env_->logger(), LogScope::Server, kSendLabel, "sending message for reporter %s",
           idsText(reporterIDs).c_str());
  // A message is routed and answered quickly: on an idle server queue, where the call
  // arrived, without waking another thread and back.
  serverQueue_->asyncOrRun([self = shared_from_this(), payload = std::move(payload), category, type,
                       reporterIDs = std::move(reporterIDs), reply = std::move(reply)] {
    self->doSendMessage(payload, category, type, reporterIDs, reply);
  });
}

void VRReportingServerInstance::doSendMessage(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                                              const std::optional<std::vector<std::int64_t>>& reporterIDs,
                                              const ErrorReply& reply) {
  env_->platform.tracer.emit(trace::kServerSend);
  auto delegate = delegate_.lock();
  // Decided before any session is looked at: nothing sees a message while disabled.
  if (!delegate || !delegate->isReportingEnabled()) {
    if (reply) reply(Error{kReportingErrorDomain, kReportingDisabledCode, "reporting is disabled"});
    return;
  }
  // Nothing below can fail the call, so the answer leaves first: the client's next
  // call crosses the bus while this one is routed.
  if (reply) reply(std::nullopt);
  if (reporterIDs) {
    sendAddressed(payload, category, type, *reporterIDs);
  } else {
    sendBroadcast(payload, category, type, delegate.get());
  }
}

void VRReportingServerInstance::sendAddressed(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                                              const std::vector<std::int64_t>& reporterIDs) {
  for (std::int64_t reporterID : reporterIDs) {
    if (reporterID == 0) continue;
    // Started or not: an addressed session takes the message either way. Unknown IDs
    // are logged by the registry lookup.
    auto session = findReportingSessionForID(reporterID, true);
    if (!session) continue;
    VRReportingTallyhubBridge::handleEvent(env_, &payload, category, type, *session);
    VRReportingVoltmarkUtility::handleEvent(env_, &payload, category, type, *session);
    session->sendMessage(payload, category, type, BoolReply{});
  }
}

void VRReportingServerInstance::sendBroadcast(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                                              VRReportingServiceDelegateProtocol* delegate) {
  std::vector<std::shared_ptr<VRReportingSession>> active;
  for (const auto& client : delegate->getAllClients()) {
    // One snapshot of the client's map serves both the log line and the filter.
    std::vector<std::shared_ptr<VRReportingSession>> sessions;
    for (auto& entry : client->clientReportingSessionMap()) sessions.push_back(std::move(entry.second));
    VR_LOG(env_->logger(), LogScope::Server, LogLevel::Default, kSendLabel, "sessions for client %i : %s",
           client->processIdentifier(), sessionsText(sessions).c_str());
    for (auto& session : sessions) {
      if (session->started()) active.push_back(std::move(session));
    }
  }
  VR_LOG(env_->logger(), LogScope::Server, LogLevel::Default, kSendLabel, "active reporting sessions %lu : %s",
         (unsigned long)active.size(), sessionsText(active).c_str());

  if (active.empty()) {
    VR_LOG(env_->logger(), LogScope::Server, LogLevel::Default, kSendLabel,
           "no active reporting sessions found, sending as standalone");
    auto defaults = delegate->getDefaults();
    VRReportingSession::sendSingleMessage(env_, payload, category, type, kStandaloneServiceType,
                                          defaults ? &*defaults : nullptr, ErrorReply{});
    return;
  }
  // Session first, then the sinks: the broadcast order differs from addressed delivery
  // and is kept so.
  for (const auto& session : active) {
    session->sendMessage(payload, category, type, BoolReply{});
    VRReportingTallyhubBridge::handleEvent(env_, &payload, category, type, *session);
    VRReportingVoltmarkUtility::handleEvent(env_, &payload, category, type, *session);
  }
}

}  // namespace vireo
