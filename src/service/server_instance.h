// VRReportingServerInstance: the exported object of one client connection. Owns the
// client's sessions and carries out the protocol operations.
//
// Every operation only logs and submits its work to the one server queue, so it may
// be called from any thread; that queue alone orders a client's create, start, send,
// stop and destroy, and all changes of the session map happen on it.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/mutex.h"
#include "dispatch/dispatch.h"
#include "platform/clock.h"
#include "service/reporting_protocol.h"
#include "service/reporting_session_map.h"
#include "service/service_delegate_protocol.h"

namespace vireo {

class ReportingEnvironment;

class VRReportingServerInstance final : public VRReportingServiceProtocol,
                                        public std::enable_shared_from_this<VRReportingServerInstance> {
 public:
  // initWithPID:delegate:
  static std::shared_ptr<VRReportingServerInstance> initWithPID(
      std::shared_ptr<ReportingEnvironment> env, std::shared_ptr<SerialQueue> serverQueue, std::int32_t pid,
      std::weak_ptr<VRReportingServiceDelegateProtocol> delegate);
  ~VRReportingServerInstance() override;
  VRReportingServerInstance(const VRReportingServerInstance&) = delete;
  VRReportingServerInstance& operator=(const VRReportingServerInstance&) = delete;

  // ---- VRReportingServiceProtocol ----
  void createReportingSession(std::int64_t reporterID, BoolReply reply) override;
  void setServiceType(std::uint16_t serviceType, std::int64_t reporterID, BoolReply reply) override;
  void getServiceNameForReporterID(std::int64_t reporterID, ServiceTypeReply reply) override;
  void setConfiguration(Dictionary configuration, std::int64_t reporterID, BoolReply reply) override;
  void startReportingSessionForID(std::int64_t reporterID, StartReply reply) override;
  void sendMessage(Dictionary payload, std::uint32_t category, std::uint16_t type,
                   std::optional<std::vector<std::int64_t>> reporterIDs, ErrorReply reply) override;
  void stopReportingSessionForID(std::int64_t reporterID, BoolReply reply) override;
  void destroyReportingSession(std::int64_t reporterID, BoolReply reply) override;
  void reporterIDValid(std::int64_t reporterID, DictionaryReply reply) override;
  void getAllReporters(ReporterListReply reply) override;
  void killService(BoolReply reply) override;

  // findReportingSessionForID:acrossAllClients:
  std::shared_ptr<VRReportingSession> findReportingSessionForID(std::int64_t reporterID, bool acrossAllClients) const;
  // Stops the client's running sessions and leaves the registry; queued, and only the
  // first call after registration acts.
  void handleConnectionError();

  // ---- properties ----
  std::int32_t processIdentifier() const { return processIdentifier_; }
  std::optional<WallTime> clientStartDate() const;
  void setClientStartDate(std::optional<WallTime> date);
  std::optional<std::string> clientProcessName() const;
  void setClientProcessName(std::optional<std::string> name);
  // clientReportingSessionMap, as a snapshot in map order.
  std::vector<ReportingSessionMap::Entry> clientReportingSessionMap() const;

 private:
  VRReportingServerInstance(std::shared_ptr<ReportingEnvironment> env, std::shared_ptr<SerialQueue> serverQueue,
                            std::int32_t pid, std::weak_ptr<VRReportingServiceDelegateProtocol> delegate);

  // Queued halves of the operations; they run on the server queue only.
  void doStart(std::int64_t reporterID, StartReply reply);
  void doStop(std::int64_t reporterID, BoolReply reply);
  void doDestroy(std::int64_t reporterID, BoolReply reply);
  void doSendMessage(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                     const std::optional<std::vector<std::int64_t>>& reporterIDs, const ErrorReply& reply);
  void sendAddressed(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                     const std::vector<std::int64_t>& reporterIDs);
  void sendBroadcast(const Dictionary& payload, std::uint32_t category, std::uint16_t type,
                     VRReportingServiceDelegateProtocol* delegate);
  void doHandleConnectionError();

  const std::shared_ptr<ReportingEnvironment> env_;
  const std::shared_ptr<SerialQueue> serverQueue_;
  const std::int32_t processIdentifier_;
  const std::weak_ptr<VRReportingServiceDelegateProtocol> delegate_;

  // Guards the three fields below, and nothing else. They change on the server queue
  // only, but the connection handlers and the registry lookup read them from other
  // threads. Never held while calling out (sessions, sinks, replies, the delegate).
  mutable Mutex propertiesLock_;
  std::optional<WallTime> clientStartDate_ VIREO_GUARDED_BY(propertiesLock_);
  std::optional<std::string> clientProcessName_ VIREO_GUARDED_BY(propertiesLock_);
  ReportingSessionMap clientReportingSessionMap_ VIREO_GUARDED_BY(propertiesLock_);
};

}  // namespace vireo
