#include "service/server_instance.h"

#include <atomic>
#include <memory>
#include <utility>

#include "platform/logger.h"
#include "platform/tracer.h"
#include "session/reporting_session.h"
#include "vocabulary/reporting_environment.h"

namespace vireo {

namespace {
constexpr std::uint16_t kUnknownServiceType = 0xFFFF;
// Driver statistics go out as "HWReporting" (no area bits), type 0.
constexpr std::uint32_t kDriverStatisticsCategory = 9;
constexpr std::uint16_t kDriverStatisticsType = 0;
}  // namespace

VRReportingServerInstance::VRReportingServerInstance(std::shared_ptr<ReportingEnvironment> env,
                                                     std::shared_ptr<SerialQueue> serverQueue, std::int32_t pid,
                                                     std::weak_ptr<VRReportingServiceDelegateProtocol> delegate)
    : env_(std::move(env)),
      serverQueue_(std::move(serverQueue)),
      processIdentifier_(pid),
      delegate_(std::move(delegate)) {}

std::shared_ptr<VRReportingServerInstance> VRReportingServerInstance::initWithPID(
    std::shared_ptr<ReportingEnvironment> env, std::shared_ptr<SerialQueue> serverQueue, std::int32_t pid,
    std::weak_ptr<VRReportingServiceDelegateProtocol> delegate) {
  VR_LOG(env->logger(), LogScope::Server, LogLevel::Default, "-[VRReportingServerInstance initWithPID:delegate:]",
         "new client with pid %lu", static_cast<unsigned long>(pid));
  return std::shared_ptr<VRReportingServerInstance>(
      new VRReportingServerInstance(std::move(env), std::move(serverQueue), pid, std::move(delegate)));
}

VRReportingServerInstance::~VRReportingServerInstance() {
  VR_LOG(env_->logger(), LogScope::Server, LogLevel::Default, "-[VRReportingServerInstance dealloc]",
         "dealloc %i from the server client list", processIdentifier_);
}

// ---- properties ----

std::optional<WallTime> VRReportingServerInstance::clientStartDate() const {
  MutexLock guard(propertiesLock_);
  return clientStartDate_;
}

void VRReportingServerInstance::setClientStartDate(std::optional<WallTime> date) {
  MutexLock guard(propertiesLock_);
  clientStartDate_ = date;
}

std::optional<std::string> VRReportingServerInstance::clientProcessName() const {
  MutexLock guard(propertiesLock_);
  return clientProcessName_;
}

void VRReportingServerInstance::setClientProcessName(std::optional<std::string> name) {
  MutexLock guard(propertiesLock_);
  clientProcessName_ = std::move(name);
}

std::vector<ReportingSessionMap::Entry> VRReportingServerInstance::clientReportingSessionMap() const {
  MutexLock guard(propertiesLock_);
  return clientReportingSessionMap_.entries();
}

std::shared_ptr<VRReportingSession> VRReportingServerInstance::findReportingSessionForID(std::int64_t reporterID,
                                                                                        bool acrossAllClients) const {
  {
    MutexLock guard(propertiesLock_);
    if (auto session = clientReportingSessionMap_.find(reporterID)) return session;
  }
  if (!acrossAllClients) return nullptr;
  auto delegate = delegate_.lock();
  return delegate ? delegate->findReportingSessionForID(reporterID) : nullptr;
}

// ---- operations ----

namespace {
// The start answer a session keeps: answered once, by the stop (or a restart);
// when the last copy goes unanswered, the session went away without a stop.
BoolReply holdUntilStopped(StartReply reply) {
  struct Held {
    explicit Held(StartReply r) : reply(std::move(r)) {}
    ~Held() {
      if (!answered.load() && reply.sessionEnded) reply.sessionEnded();
    }
    StartReply reply;
    std::atomic<bool> answered{false};
  };
  auto held = std::make_shared<Held>(std::move(reply));
  return [held](bool ok) {
    if (!held->answered.exchange(true) && held->reply.answer) held->reply.answer(ok);
  };
}
}  // namespace

void VRReportingServerInstance::createReportingSession(std::int64_t reporterID, BoolReply reply) {
  constexpr const char* kLabel = "-[VRReportingServerInstance createReportingSession:reply:]";
  VR_DEBUG(env_->logger(), LogScope::Server, kLabel, "creating session for reporter %lli", (long long)reporterID);
  serverQueue_->async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    self->env_->platform.tracer.emit(trace::kServerCreate);
    // Duplicates and 0 are accepted: a new session replaces the old one unstopped.
    auto session = VRReportingSession::initWithID(self->env_, reporterID, {self->processIdentifier_});
    if (session) {
      std::shared_ptr<VRReportingSession> replaced;
      {
        MutexLock guard(self->propertiesLock_);
        replaced = self->clientReportingSessionMap_.find(reporterID);
        self->clientReportingSessionMap_.set(reporterID, std::move(session));
      }
      replaced.reset();  // released outside the lock: its destructor logs
      VR_LOG(self->env_->logger(), LogScope::Server, LogLevel::Default, kLabel, "session created for reporter %lli",
             (long long)reporterID);
    }
    if (reply) reply(true);
  });
}

void VRReportingServerInstance::setServiceType(std::uint16_t serviceType, std::int64_t reporterID, BoolReply reply) {
  constexpr const char* kLabel = "-[VRReportingServerInstance setServiceType:reportingSession:reply:]";
  VR_DEBUG(env_->logger(), LogScope::Server, kLabel, "setting service type %i for reporter %lli", (int)serviceType,
           (long long)reporterID);
  serverQueue_->async([self = shared_from_this(), serviceType, reporterID, reply = std::move(reply)] {
    if (reporterID != 0) {
      if (auto session = self->findReportingSessionForID(reporterID, false)) {
        session->setServiceType(serviceType);
        VR_LOG(self->env_->logger(), LogScope::Server, LogLevel::Default, kLabel,
               "service type %i set for reporter  %lli", (int)serviceType, (long long)reporterID);
      }
    }
    if (reply) reply(true);
  });
}

void VRReportingServerInstance::getServiceNameForReporterID(std::int64_t reporterID, ServiceTypeReply reply) {
  constexpr const char* kLabel = "-[VRReportingServerInstance getServiceNameForReporterID:reply:]";
  VR_DEBUG(env_->logger(), LogScope::Server, kLabel, "fetching seviceType");
  serverQueue_->async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    // ID 0 answers at once and then carries on to answer again: clients rely on the
    // established double reply.
    if (reporterID == 0 && reply) reply(kUnknownServiceType);
    auto session = self->findReportingSessionForID(reporterID, true);
    std::uint16_t serviceType = session ? session->serviceType() : kUnknownServiceType;
    if (reply) reply(serviceType);
    VR_LOG(self->env_->logger(), LogScope::Server, LogLevel::Default, kLabel,
           "returnning service type %i for reporter  %lli", (int)serviceType, (long long)reporterID);
  });
}

void VRReportingServerInstance::setConfiguration(Dictionary configuration, std::int64_t reporterID, BoolReply reply) {
  constexpr const char* kLabel = "-[VRReportingServerInstance setConfiguration:forReporterID:reply:]";
  VR_DEBUG(env_->logger(), LogScope::Server, kLabel, "setting configuration");
  serverQueue_->async(
      [self = shared_from_this(), configuration = std::move(configuration), reporterID, reply = std::move(reply)] {
        if (auto session = self->findReportingSessionForID(reporterID, false)) session->setConfiguration(&configuration);
        if (reply) reply(true);
      });
}

void VRReportingServerInstance::startReportingSessionForID(std::int64_t reporterID, StartReply reply) {
  VR_DEBUG(env_->logger(), LogScope::Server, "-[VRReportingServerInstance startReportingSessionForID:reply:]",
           "starting session for reporter %lli", (long long)reporterID);
  serverQueue_->async([self = shared_from_this(), reporterID, reply = std::move(reply)]() mutable {
    self->doStart(reporterID, std::move(reply));
  });
}

void VRReportingServerInstance::doStart(std::int64_t reporterID, StartReply reply) {
  env_->platform.tracer.emit(trace::kServerStart);
  if (reporterID == 0) {
    if (reply.answer) reply.answer(true);
    return;
  }
  auto session = findReportingSessionForID(reporterID, true);
  // Unknown and running sessions never answer: the client's start stays pending.
  if (!session || session->started()) return;
  session->start();
  auto delegate = delegate_.lock();
  session->setDriverSnapShot(delegate ? delegate->getSnapShot() : nullptr);
  // A session started again answers the previous start now.
  if (auto previous = session->transactionCompleteBlock()) previous(true);
  // The start is answered when the session stops.
  session->setTransactionCompleteBlock(holdUntilStopped(std::move(reply)));
}

void VRReportingServerInstance::stopReportingSessionForID(std::int64_t reporterID, BoolReply reply) {
  VR_DEBUG(env_->logger(), LogScope::Server, "-[VRReportingServerInstance stopReportingSessionForID:reply:]",
           "stopping session for reporter %lli", (long long)reporterID);
  serverQueue_->async([self = shared_from_this(), reporterID, reply = std::move(reply)]() mutable {
    self->doStop(reporterID, std::move(reply));
  });
}

void VRReportingServerInstance::doStop(std::int64_t reporterID, BoolReply reply) {
  constexpr const char* kLabel = "-[VRReportingServerInstance stopReportingSessionForID:reply:]";
  env_->platform.tracer.emit(trace::kServerStop);
  if (reporterID == 0) {
    if (reply) reply(true);
    return;
  }
  if (auto session = findReportingSessionForID(reporterID, false)) {
    auto delegate = delegate_.lock();
    auto snapshot = session->driverSnapShot();
    std::optional<Dictionary> delta =
        delegate ? delegate->getDriverStatisticsRelativeToSnapShot(snapshot.get()) : std::nullopt;
    if (delta) {
      // Handed over before the stop, so it is aggregated into this session.
      session->sendMessage(*delta, kDriverStatisticsCategory, kDriverStatisticsType, BoolReply{});
      VR_LOG(env_->logger(), LogScope::Server, LogLevel::Default, kLabel, "fetching driver logs %s",
             Value(*delta).text().c_str());
    } else {
      VR_LOG(env_->logger(), LogScope::Server, LogLevel::Default, kLabel,
             "nothing interesting to fetch from the drivers");
    }
    session->setDriverSnapShot(nullptr);
    session->stop();
  }
  VR_LOG(env_->logger(), LogScope::Server, LogLevel::Default, kLabel, "stopping %lli", (long long)reporterID);
  if (reply) reply(true);
}

void VRReportingServerInstance::destroyReportingSession(std::int64_t reporterID, BoolReply reply) {
  VR_DEBUG(env_->logger(), LogScope::Server, "-[VRReportingServerInstance destroyReportingSession:reply:]",
           "destroying session for reporter %lli", (long long)reporterID);
  serverQueue_->async([self = shared_from_this(), reporterID, reply = std::move(reply)]() mutable {
    self->doDestroy(reporterID, std::move(reply));
  });
}

void VRReportingServerInstance::doDestroy(std::int64_t reporterID, BoolReply reply) {
  env_->platform.tracer.emit(trace::kServerDestroy);
  if (reporterID == 0) {
    if (reply) reply(true);
    return;
  }
  if (auto session = findReportingSessionForID(reporterID, false)) {
    if (session->started()) session->stop();
    MutexLock guard(propertiesLock_);
    clientReportingSessionMap_.erase(reporterID);
  }  // the session is released here, outside the lock
  VR_LOG(env_->logger(), LogScope::Server, LogLevel::Default,
         "-[VRReportingServerInstance destroyReportingSession:reply:]", "destroying %lli", (long long)reporterID);
  if (reply) reply(true);
}

void VRReportingServerInstance::reporterIDValid(std::int64_t reporterID, DictionaryReply reply) {
  constexpr const char* kLabel = "-[VRReportingServerInstance reporterID:valid:]";
  VR_DEBUG(env_->logger(), LogScope::Server, kLabel, "validating reporter %lli", (long long)reporterID);
  serverQueue_->async([self = shared_from_this(), reporterID, reply = std::move(reply)] {
    // Signed 64-bit ID and unsigned 16-bit type, as the bus carries them.
    Dictionary result{{"reporterID", Value(std::int64_t{0})}, {"serviceType", Value(unsigned{kUnknownServiceType})}};
    if (auto session = self->findReportingSessionForID(reporterID, true)) {
      result.set("reporterID", Value(std::int64_t{reporterID}));
      result.set("serviceType", Value(unsigned{session->serviceType()}));
    }
    VR_LOG(self->env_->logger(), LogScope::Server, LogLevel::Default, kLabel, "validating reporter %lli",
           (long long)reporterID);
    if (reply) reply(std::move(result));
  });
}

void VRReportingServerInstance::getAllReporters(ReporterListReply reply) {
  serverQueue_->async([self = shared_from_this(), reply = std::move(reply)] {
    std::vector<std::int64_t> reporters;
    if (auto delegate = self->delegate_.lock()) {
      for (const auto& client : delegate->getAllClients()) {
        for (const auto& entry : client->clientReportingSessionMap()) reporters.push_back(entry.first);
      }
    }
    if (reply) reply(std::move(reporters));
  });
}

void VRReportingServerInstance::killService(BoolReply /*reply: never called*/) {
  VR_LOG(env_->logger(), LogScope::Server, LogLevel::Default, "-[VRReportingServerInstance killService:]",
         "DESTROYING SERVICE");
  env_->platform.process.exitProcess(2);
}

// ---- connection end ----

void VRReportingServerInstance::handleConnectionError() {
  serverQueue_->async([self = shared_from_this()] { self->doHandleConnectionError(); });
}

void VRReportingServerInstance::doHandleConnectionError() {
  auto delegate = delegate_.lock();
  if (!delegate) return;
  auto self = shared_from_this();
  bool registered = false;
  for (const auto& client : delegate->getAllClients()) registered = registered || client == self;
  // Interruption followed by invalidation: only the first finds us registered.
  if (!registered) return;
  for (const auto& entry : clientReportingSessionMap()) {
    if (entry.second->started()) entry.second->stop();
  }
  delegate->removeClient(self);
  VR_LOG(env_->logger(), LogScope::Server, LogLevel::Default, "-[VRReportingServerInstance handleConnectionError]",
         "removing %i from the server client list", processIdentifier_);
}

}  // namespace vireo
