#include "service/service_delegate.h"

#include <algorithm>
#include <utility>

#include "platform/logger.h"
#include "service/server_instance.h"
#include "session/reporting_session.h"
#include "vocabulary/reporting_environment.h"

namespace vireo {

VRReportingServiceDelegate::VRReportingServiceDelegate(std::shared_ptr<ReportingEnvironment> env)
    : env_(std::move(env)),
      serverQueue_(env_->platform.dispatcher.makeSerialQueue(kServerQueueLabel, QoS::UserInteractive)) {}

std::shared_ptr<VRReportingServiceDelegate> VRReportingServiceDelegate::init(std::shared_ptr<ReportingEnvironment> env) {
  std::shared_ptr<VRReportingServiceDelegate> delegate(new VRReportingServiceDelegate(std::move(env)));
  // The registry starts empty and reporting on; the defaults are not read until the
  // first change notification.
  delegate->listenForDefaultsNotification();
  delegate->driverUtility_ = std::make_unique<VRReportingDriverUtility>(delegate->env_->platform.driverStats,
                                                                        delegate->env_->logger());
  return delegate;
}

bool VRReportingServiceDelegate::shouldAcceptNewConnection(ClientConnection& connection) {
  const std::int32_t pid = connection.processIdentifier();
  VR_LOG(env_->logger(), LogScope::Server, LogLevel::Default,
         "-[VRReportingServiceDelegate listener:shouldAcceptNewConnection:]", "newConnection: %s",
         connection.description().c_str());
  std::shared_ptr<VRReportingServerInstance> instance;
  {
    MutexLock guard(objectLock_);
    instance = VRReportingServerInstance::initWithPID(env_, serverQueue_, pid, weak_from_this());
    connection.setExportedObject(instance);
  }
  std::weak_ptr<VRReportingServerInstance> weakInstance = instance;
  instance.reset();  // the connection owns it; the closures below must not
  // Queued before the connection is resumed, so registration precedes every
  // operation of this client on the server queue.
  serverQueue_->async([weakSelf = weak_from_this(), weakInstance, pid] {
    if (auto self = weakSelf.lock()) self->registerClient(weakInstance, pid);
  });
  connection.setInterruptionHandler([env = env_, weakInstance] { connectionInterrupted(env, weakInstance); });
  connection.setInvalidationHandler(
      [env = env_, weakInstance, pid] { connectionInvalidated(env, weakInstance, pid); });
  connection.resume();
  return true;
}

// ---- registry ----

std::optional<Dictionary> VRReportingServiceDelegate::getDefaults() const {
  MutexLock guard(registryLock_);
  return defaults_;
}

std::vector<std::shared_ptr<VRReportingServerInstance>> VRReportingServiceDelegate::getAllClients() const {
  MutexLock guard(registryLock_);
  return clients_;
}

void VRReportingServiceDelegate::removeClient(const std::shared_ptr<VRReportingServerInstance>& client) {
  std::vector<std::shared_ptr<VRReportingServerInstance>> removed;
  {
    MutexLock guard(registryLock_);
    auto tail = std::stable_partition(clients_.begin(), clients_.end(), [&](const auto& c) { return c != client; });
    removed.assign(std::make_move_iterator(tail), std::make_move_iterator(clients_.end()));
    clients_.erase(tail, clients_.end());
  }
  // Released outside the lock: the last reference runs the instance's destructor.
}

std::shared_ptr<VRReportingSession> VRReportingServiceDelegate::findReportingSessionForID(std::int64_t reporterID) {
  constexpr const char* kLabel = "-[VRReportingServiceDelegate findReportingSessionForID:]";
  MutexLock guard(objectLock_);
  if (reporterID == 0) return nullptr;
  if (!reportingEnabled_.load()) return nullptr;
  for (const auto& client : getAllClients()) {
    if (auto session = client->findReportingSessionForID(reporterID, false)) {
      VR_LOG(env_->logger(), LogScope::Server, LogLevel::Info, kLabel, "found reporting session %lli for client %i",
             (long long)reporterID, client->processIdentifier());
      return session;
    }
  }
  VR_LOG(env_->logger(), LogScope::Server, LogLevel::Error, kLabel, "failed to find reporting session %lli",
         (long long)reporterID);
  return nullptr;
}

// ---- driver statistics ----

std::shared_ptr<DriverSnapshot> VRReportingServiceDelegate::getSnapShot() { return driverUtility_->getSnapShot(); }

std::optional<Dictionary> VRReportingServiceDelegate::getDriverStatisticsRelativeToSnapShot(
    const DriverSnapshot* snapshot) {
  return driverUtility_->getDriverStatisticsRelativeToSnapShot(snapshot);
}

// ---- defaults ----

Dictionary VRReportingServiceDelegate::VRReportingDefaults() const {
  DefaultsStore& store = env_->platform.defaults;
  Dictionary defaults;
  if (auto deviceName = store.stringForKey(kDefaultsSuite, "device_name")) defaults.set("device_name", *deviceName);
  if (store.stringForKey(kDefaultsSuite, "disable_reporting")) {
    defaults.set("disable_reporting", store.boolForKey(kDefaultsSuite, "disable_reporting"));
  } else {
    defaults.set("disable_reporting", 0);
  }
  return defaults;
}

void VRReportingServiceDelegate::listenForDefaultsNotification() {
  int token = -1;
  // Weak: the notification service keeps the handler for the life of the process.
  int status = env_->platform.notifications.registerDispatch(
      kDefaultsNotification, serverQueue_,
      [weakSelf = weak_from_this()](int delivered) {
        if (auto self = weakSelf.lock()) self->defaultsChanged(delivered);
      },
      &token);
  notifyToken_.store(token);
  VR_LOG(env_->logger(), LogScope::Server, LogLevel::Default,
         "-[VRReportingServiceDelegate listenForDefaultsNotification]", "notify setup result %i", status);
}

void VRReportingServiceDelegate::defaultsChanged(int token) {
  constexpr const char* kLabel = "-[VRReportingServiceDelegate listenForDefaultsNotification]";
  if (token != notifyToken_.load()) return;
  VR_LOG(env_->logger(), LogScope::Server, LogLevel::Default, kLabel, "re-reading vireo defaults");
  Dictionary defaults = VRReportingDefaults();
  {
    MutexLock guard(registryLock_);
    defaults_ = defaults;
  }
  VR_LOG(env_->logger(), LogScope::Server, LogLevel::Info, kLabel, "defaults %s", Value(defaults).text().c_str());
  // Started or not, every existing session merges the defaults; later sessions do not.
  for (const auto& client : getAllClients()) {
    for (const auto& entry : client->clientReportingSessionMap()) entry.second->updateDefaults(&defaults);
  }
  if (const Value* disable = defaults.find("disable_reporting")) {
    const bool* flag = disable->asBool();
    reportingEnabled_.store(!(flag ? *flag : disable->toInt64().value_or(0) != 0));
  }
}

}  // namespace vireo
