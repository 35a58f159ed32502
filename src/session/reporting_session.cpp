#include "session/reporting_session.h"

#include <chrono>
#include <ctime>
#include <utility>

#include "platform/logger.h"
#include "platform/tracer.h"
#include "session/payload_keys.h"
#include "vocabulary/reporting_environment.h"
#include "vocabulary/reporting_utility.h"

namespace vireo {

namespace {

constexpr std::uint16_t kTestServiceType = 11;
constexpr const char* kClientName = "com.orvane.vireo";
constexpr std::int64_t kClientType = 19;
constexpr double kClientVersion = 2.0;
// Kept payload bytes past which a stop hands freed memory back to the system, once
// the store has had a moment to write what the session sent last.

}  // namespace

std::shared_ptr<VRReportingSession> VRReportingSession::initWithID(std::shared_ptr<ReportingEnvironment> env,
                                                                   std::int64_t reporterID,
                                                                   std::vector<std::int32_t> processIdentifiers) {
  std::shared_ptr<VRReportingSession> session(
      new VRReportingSession(std::move(env), reporterID, std::move(processIdentifiers)));
  VR_LOG(session->env_->logger(), LogScope::Session, LogLevel::Info,
         "-[VRReportingSession initWithID:processIdentifiers:]", "created reporting session for ID: %lli",
         static_cast<long long>(reporterID));
  session->env_->platform.tracer.emit(trace::kSessionCreate);
  return session;
}

VRReportingSession::VRReportingSession(std::shared_ptr<ReportingEnvironment> env, std::int64_t reporterID,
                                       std::vector<std::int32_t> processIdentifiers)
    : env_(std::move(env)),
      reporterID_(reporterID),
      processIdentifiers_(std::move(processIdentifiers)),
      skylarkReportingQueue_(
          env_->platform.dispatcher.makeSerialQueue("com.orvane.vireo.session.skylarkreporting", QoS::Utility)),
      aggregatedPayloadData_(std::make_shared<AggregatedPayloads>()) {}

VRReportingSession::~VRReportingSession() {
  env_->platform.tracer.emit(trace::kSessionDestroy);
  VR_LOG(env_->logger(), LogScope::Session, LogLevel::Info, "-[VRReportingSession dealloc]",
         "deallocing this session %lli", static_cast<long long>(reporterID_));
}

// ---------------------------------------------------------------- configuration

void VRReportingSession::setServiceType(std::uint16_t serviceType) {
  // Types without a label keep a usable name: telemetry sessions and summary files need one.
  std::string name = serviceNameOrUnknown(serviceType);
  serviceType_ = serviceType;
  {
    MutexLock guard(fieldsLock_);
    serviceName_ = name;
  }
  VR_LOG(env_->logger(), LogScope::Session, LogLevel::Info, "-[VRReportingSession setServiceType:]",
         "setting service type %s", name.c_str());
}

void VRReportingSession::setConfiguration(const Dictionary* configuration) {
  if (!configuration) return;
  MutexLock guard(fieldsLock_);
  userInfo_.merge(*configuration);
}

void VRReportingSession::updateDefaults(const Dictionary* defaults) { setConfiguration(defaults); }

// ---------------------------------------------------------------- lifecycle

void VRReportingSession::start() {
  Logger& logger = env_->logger();
  VR_DEBUG(logger, LogScope::Session, "-[VRReportingSession start]", "starting session owned by %lli",
           static_cast<long long>(reporterID_));
  if (started_.load()) {
    VR_LOG(logger, LogScope::Session, LogLevel::Info, "-[VRReportingSession start]", "%lli is already started",
           static_cast<long long>(reporterID_));
    return;
  }
  started_ = true;
  Dictionary userInfo;
  std::string serviceName;
  {
    MutexLock guard(fieldsLock_);
    aggregatedPayloadData_ = std::make_shared<AggregatedPayloads>();
    userInfo = userInfo_;
    serviceName = serviceName_;
  }
  env_->platform.tracer.emit(trace::kSessionStart);
  if (shouldReportOrientation()) registerOrientationHandlers();

  bool backendFound = skylarkReportingSessionStarted_.load();
  skylarkReportingQueue_->async([self = shared_from_this(), userInfo = std::move(userInfo),
                                 serviceName = std::move(serviceName), backendFound] {
    self->startBackendSession(userInfo, serviceName, backendFound);
  });
}

void VRReportingSession::stop() {
  Logger& logger = env_->logger();
  VR_DEBUG(logger, LogScope::Session, "-[VRReportingSession stop]", "ending session %lli",
           static_cast<long long>(reporterID_));
  // Runs whether or not the session is started.
  unregisterOrientationHandlers();
  if (!started_.load()) return;
  VR_DEBUG(logger, LogScope::Session, "-[VRReportingSession stop]", "ending session %lli",
           static_cast<long long>(reporterID_));
  env_->platform.tracer.emit(trace::kSessionStop);

  if (auto summary = createSummaryEventForSession()) {
    VR_LOG(logger, LogScope::Session, LogLevel::Default, "-[VRReportingSession stop]",
           "sending summary event for reporter %lli", static_cast<long long>(reporterID_));
    sendMessage(*summary, 0xFFFFFFFFu, 0xFFFF, true, nullptr);
  }

  skylarkReportingQueue_->async([self = shared_from_this()] {
    if (self->serviceType_.load() == kTestServiceType) return;
    std::shared_ptr<TelemetrySession> telemetry;
    {
      MutexLock guard(self->fieldsLock_);
      telemetry = std::move(self->skylarkReportingSession_);
      self->skylarkReportingSession_.reset();
    }
    if (!telemetry) return;
    telemetry->flushMessages([env = self->env_](std::optional<Error> error) {
      if (error)
        VR_LOG(env->logger(), LogScope::Session, LogLevel::Error, "-[VRReportingSession stop]_block_invoke_2",
               "flush error %s", error->description.c_str());
    });
  });

  if (auto payloads = aggregatedPayloadData()) {
    // Taken so that no append is half-way while the array is let go.
    MutexLock arrayGuard(payloads->lock);
    MutexLock guard(fieldsLock_);
    aggregatedPayloadData_.reset();
  }
  started_ = false;

  // Every started session was given a callback by its server instance; a missing one
  // must still not bring the daemon down.
  if (BoolReply block = transactionCompleteBlock()) block(true);
}

// ---------------------------------------------------------------- identifiers

std::string VRReportingSession::messageIdForCategory(std::uint32_t category, std::uint16_t type) {
  std::string kind = VRReportingCategoryName(category) + "_" + VRReportingTypeName(type);
  std::int64_t count = 1;
  {
    // Sends from different threads must not lose a count.
    MutexLock guard(fieldsLock_);
    if (const Value* existing = messageTypeCounts_.find(kind)) count = existing->toInt64().value_or(0) + 1;
    messageTypeCounts_.set(Value(kind), Value(static_cast<long long>(count)));
  }
  return kind + "_" + std::to_string(count);
}

// ---------------------------------------------------------------- sending

void VRReportingSession::sendMessage(const Dictionary& message, std::uint32_t category, std::uint16_t type,
                                     BoolReply reply) {
  sendMessage(message, category, type, false, std::move(reply));
}

void VRReportingSession::sendMessage(const Dictionary& message, std::uint32_t category, std::uint16_t type,
                                     bool /*sync: delivery is always asynchronous*/, BoolReply reply) {
  VR_DEBUG(env_->logger(), LogScope::Session, "-[VRReportingSession sendMessage:category:type:sync:reply:]",
           "sending message for session owned by %lli", static_cast<long long>(reporterID_));
  // One cleaned payload, shared by the aggregation list and the delivery closure.
  const Value cleaned(cleanPayloadKeys(message));
  std::string identifier = messageIdForCategory(category, type);
  if (auto payloads = aggregatedPayloadData()) {
    Dictionary entry;
    entry.set(Value(std::move(identifier)), cleaned);
    keep(*payloads, Value(std::move(entry)));
  }
  env_->platform.tracer.emit(trace::kSessionSend);

  const bool submittedWhileStarted = started_.load();
  // The message as received only appears in a debug line.
  Value received = env_->logger().verbose(LogScope::Session) ? Value(message) : Value();
  // Handing a row to the store is quick: on an idle queue it is done here, without
  // waking a pool thread.
  skylarkReportingQueue_->asyncOrRun([self = shared_from_this(), cleaned, received = std::move(received),
                                      submittedWhileStarted, category, type] {
    self->deliver(*cleaned.asDictionary(), received, submittedWhileStarted, category, type);
  });
  if (reply) reply(false);
}

void VRReportingSession::deliver(const Dictionary& cleaned, const Value& received, bool submittedWhileStarted,
                                 std::uint32_t category, std::uint16_t type) {
  static constexpr const char* kLabel = "-[VRReportingSession sendMessage:category:type:sync:reply:]_block_invoke";
  Logger& logger = env_->logger();
  if (!submittedWhileStarted) {
    VR_DEBUG(logger, LogScope::Session, kLabel, "session not started, will send as a single message");
    Dictionary info = userInfo();
    sendSingleMessage(env_, cleaned, category, type, serviceType_.load(), &info, nullptr);
    return;
  }
  if (serviceType_.load() == kTestServiceType) {
    VR_LOG(logger, LogScope::Session, LogLevel::Info, kLabel, "transactions aren't allowed on this platform");
    return;
  }
  std::shared_ptr<TelemetrySession> telemetry = skylarkReportingSession();
  if (!telemetry) {
    const Error error{kGeneralErrorDomain, -1, "No valid SkylarkReportingSession"};
    VR_LOG(logger, LogScope::Session, LogLevel::Error, kLabel, "%s", error.description.c_str());
    return;
  }
  std::optional<Error> error;
  // A refused send is dropped silently: nothing retries it.
  if (telemetry->sendMessage(static_cast<std::uint16_t>(category & 0xFFFFu), type, cleaned, &error)) {
    VR_DEBUG(logger, LogScope::Session, kLabel, "SkylarkReportingAgent %s : message %s : category %i : type %i",
             telemetry->description().c_str(), received.text().c_str(), static_cast<int>(category),
             static_cast<int>(type));
  }
}

std::size_t AggregatedPayloads::appendLocked(const Value& entry, std::size_t budget, bool front) {
  std::string packed = packValue(entry);
  packed.shrink_to_fit();
  keptBytes += packedFootprint(packed);
  if (front) {
    entries.push_front(std::move(packed));
  } else {
    entries.push_back(std::move(packed));
  }
  std::size_t droppedNow = 0;
  // The newest entry always stays, however big.
  while (keptBytes > budget && entries.size() > 1) {
    keptBytes -= packedFootprint(entries.front());
    entries.pop_front();
    ++droppedNow;
  }
  dropped += droppedNow;
  return droppedNow;
}

void VRReportingSession::keep(AggregatedPayloads& payloads, Value entry) {
  const std::size_t budget = env_->maxKeptBytesPerSession.load();
  std::size_t dropped;
  bool first;
  {
    MutexLock guard(payloads.lock);
    dropped = payloads.appendLocked(std::move(entry), budget);
    first = dropped > 0 && payloads.dropped == dropped;
  }
  if (dropped == 0) return;
  env_->keptPayloadsDropped += dropped;
  if (first)
    VR_LOG(env_->logger(), LogScope::Session, LogLevel::Default, "-[VRReportingSession sendMessage:category:type:sync:reply:]",
           "session %lli keeps more than MaxKeptBytesPerSession=%zu bytes for its summary: dropping the oldest",
           static_cast<long long>(reporterID_), budget);
}

// ---------------------------------------------------------------- telemetry backend

void VRReportingSession::startBackendSession(const Dictionary& userInfo, const std::string& serviceName,
                                             bool backendFound) {
  if (serviceType_.load() == kTestServiceType) return;
  TelemetryService& service = env_->platform.telemetry;

  std::shared_ptr<HierarchyToken> token = service.makeHierarchyToken();
  {
    MutexLock guard(fieldsLock_);
    skylarkReportingAgentToken_ = token;
  }

  Dictionary sessionInfo{
      {telemetry_keys::kClientType, Value(static_cast<long long>(kClientType))},
      {telemetry_keys::kClientVersion, Value(kClientVersion)},
      {telemetry_keys::kSessionId, Value(static_cast<long long>(reporterID_))},
      {telemetry_keys::kBatchEvent, Value(true)},
      {telemetry_keys::kHierarchyToken, Value(token ? token->text : std::string())},
  };
  Dictionary telemetryUserInfo{
      {telemetry_keys::kClientName, Value(kClientName)},
      {telemetry_keys::kServiceName, Value(serviceName + "_session")},
  };
  if (!userInfo.empty()) telemetryUserInfo.merge(userInfo);

  std::shared_ptr<TelemetrySession> telemetry = service.createSession(sessionInfo, telemetryUserInfo, {});
  {
    MutexLock guard(fieldsLock_);
    skylarkReportingSession_ = telemetry;
  }
  if (!telemetry) {
    // Nothing to configure; messages are dropped until the next start.
    skylarkReportingSessionStarted_ = false;
    return;
  }

  // Shared by the wait and the telemetry service's completion; lives as long as either holds it.
  auto discovery = std::make_shared<ReportingCondition>(backendFound);
  telemetry->startConfiguration([discovery, env = env_](std::optional<std::vector<std::string>> backends) {
    static constexpr const char* kLabel = "-[VRReportingSession start]_block_invoke_2";
    if (!backends) {
      VR_LOG(env->logger(), LogScope::Session, LogLevel::Error, kLabel,
             "No backends found, this session won't get sent to the server");
      return;
    }
    Array list;
    for (auto& name : *backends) list.emplace_back(name);
    VR_LOG(env->logger(), LogScope::Session, LogLevel::Default, kLabel, "List of backends %s",
           Value(std::move(list)).text().c_str());
    discovery->signalDone();
  });

  // The queue stays parked, holding no thread, until the wait ends; what was
  // submitted behind this closure runs after the outcome below.
  VRReportingUtilityWaitAsync(skylarkReportingQueue_, discovery, "waiting for skylarkreportingd to find backends",
                              "failed to find backend", env_->logger(), LogScope::Session,
                              env_->backendWaitInterval.load(), [self = shared_from_this()](bool ready) {
                                if (ready) return;
                                {
                                  MutexLock guard(self->fieldsLock_);
                                  self->skylarkReportingSession_.reset();
                                }
                                self->skylarkReportingSessionStarted_ = false;
                              });
}

// ---------------------------------------------------------------- single messages

void VRReportingSession::sendSingleMessage(const std::shared_ptr<ReportingEnvironment>& env,
                                           const Dictionary& message, std::uint32_t category, std::uint16_t type,
                                           std::uint16_t serviceType, const Dictionary* /*userInfo: not sent*/,
                                           ErrorReply reply) {
  static constexpr const char* kLabel = "+[VRReportingSession sendSingleMessage:category:type:serviceType:userInfo:reply:]";
  // Alarms are spread over a minute instead of all arriving at once.
  const long long delay = serviceType == 4 ? static_cast<long long>(env->platform.random.uniformBelow(60)) : 0;
  VR_DEBUG(env->logger(), LogScope::Session, kLabel, "sending single message after delta %lli for service %i", delay,
           static_cast<int>(serviceType));

  env->platform.dispatcher.asyncLowPriority(
      std::chrono::seconds(delay), [env, message, reply = std::move(reply), category, serviceType, type] {
        static constexpr const char* kSendLabel =
            "+[VRReportingSession sendSingleMessage:category:type:serviceType:userInfo:reply:]_block_invoke";
        Logger& logger = env->logger();
        env->platform.tracer.emit(trace::kSessionSend);
        VR_DEBUG(logger, LogScope::Session, kSendLabel, "sending single message");
        Dictionary sessionInfo{
            {telemetry_keys::kClientType, Value(static_cast<long long>(kClientType))},
            {telemetry_keys::kClientVersion, Value(kClientVersion)},
            {telemetry_keys::kSessionId, Value(-1)},
        };
        Dictionary userInfo{
            {telemetry_keys::kClientName, Value(kClientName)},
            {telemetry_keys::kServiceName, Value(serviceNameOrUnknown(serviceType))},
        };
        std::optional<Error> error;
        const bool sent = env->platform.telemetry.sendOneMessage(
            sessionInfo, userInfo, static_cast<std::uint16_t>(category & 0xFFFFu), type, cleanPayloadKeys(message),
            &error);
        if (!sent && error) {
          VR_LOG(logger, LogScope::Session, LogLevel::Error, kSendLabel, "sendOneMessageWithSessionInfo %s",
                 error->description.c_str());
        }
        if (sent) {
          VR_DEBUG(logger, LogScope::Session, kSendLabel, "message %s : category %i : type %i",
                   Value(message).text().c_str(), static_cast<int>(category), static_cast<int>(type));
        }
        if (reply) reply(sent ? std::nullopt : error);
      });
}

// ---------------------------------------------------------------- fields

Dictionary VRReportingSession::userInfo() const {
  MutexLock guard(fieldsLock_);
  return userInfo_;
}

std::shared_ptr<DriverSnapshot> VRReportingSession::driverSnapShot() const {
  MutexLock guard(fieldsLock_);
  return driverSnapShot_;
}

void VRReportingSession::setDriverSnapShot(std::shared_ptr<DriverSnapshot> snapshot) {
  MutexLock guard(fieldsLock_);
  driverSnapShot_ = std::move(snapshot);
}

BoolReply VRReportingSession::transactionCompleteBlock() const {
  MutexLock guard(fieldsLock_);
  return transactionCompleteBlock_;
}

void VRReportingSession::setTransactionCompleteBlock(BoolReply block) {
  MutexLock guard(fieldsLock_);
  transactionCompleteBlock_ = std::move(block);
}

std::shared_ptr<AggregatedPayloads> VRReportingSession::aggregatedPayloadData() const {
  MutexLock guard(fieldsLock_);
  return aggregatedPayloadData_;
}

Dictionary VRReportingSession::messageTypeCounts() const {
  MutexLock guard(fieldsLock_);
  return messageTypeCounts_;
}

std::string VRReportingSession::serviceName() const {
  MutexLock guard(fieldsLock_);
  return serviceName_;
}

std::optional<std::string> VRReportingSession::orientationCallbackID() const {
  MutexLock guard(fieldsLock_);
  return orientationCallbackID_;
}

std::optional<WallTime> VRReportingSession::startDate() const {
  MutexLock guard(fieldsLock_);
  return startDate_;
}

std::shared_ptr<TelemetrySession> VRReportingSession::skylarkReportingSession() const {
  MutexLock guard(fieldsLock_);
  return skylarkReportingSession_;
}

std::shared_ptr<HierarchyToken> VRReportingSession::skylarkReportingAgentToken() const {
  MutexLock guard(fieldsLock_);
  return skylarkReportingAgentToken_;
}

std::string VRReportingSession::description() const {
  return "<VRReportingSession reporterID: " + std::to_string(reporterID_) + " service: " + serviceName() +
         (started_.load() ? " started>" : " stopped>");
}

}  // namespace vireo
