#include "daemon/client_registry.h"

#include <utility>

namespace vireo::daemon {

std::string PeerConnection::description() const {
  return "connection " + name_ + " (pid " + std::to_string(pid_) + ")";
}

void PeerConnection::setExportedObject(std::shared_ptr<VRReportingServiceProtocol> object) {
  MutexLock lock(mutex_);
  exported_ = std::move(object);
}

void PeerConnection::setInterruptionHandler(std::function<void()> handler) {
  MutexLock lock(mutex_);
  interruptionHandler_ = std::move(handler);
}

void PeerConnection::setInvalidationHandler(std::function<void()> handler) {
  MutexLock lock(mutex_);
  invalidationHandler_ = std::move(handler);
}

std::shared_ptr<VRReportingServiceProtocol> PeerConnection::exportedObject() const {
  MutexLock lock(mutex_);
  return exported_;
}

void PeerConnection::invalidate() {
  std::function<void()> handler;
  {
    MutexLock lock(mutex_);
    if (invalidated_) return;
    invalidated_ = true;
    handler = std::move(invalidationHandler_);
  }
  if (handler) handler();
}

void ClientRegistry::call(const std::string& name, Call call) {
  auto [it, isNew] = clients_.try_emplace(name);
  Client& client = it->second;
  if (client.connection) {
    call(client.accepted ? client.connection.get() : nullptr);
    return;
  }
  client.held.push_back(std::move(call));
  // Last: the lookup may answer at once (and change clients_) when it cannot start.
  if (isNew) lookup_(name);
}

void ClientRegistry::credentialsArrived(const std::string& name, std::int32_t pid) {
  auto it = clients_.find(name);
  if (it == clients_.end() || it->second.connection) return;
  auto connection = std::make_shared<PeerConnection>(name, pid);
  bool accepted = delegate_.shouldAcceptNewConnection(*connection);
  // The delegate may not call back into the registry, so the entry is still there.
  Client& client = it->second;
  client.connection = connection;
  client.accepted = accepted;
  std::vector<Call> held = std::move(client.held);
  bool vanished = client.vanished;
  if (vanished) clients_.erase(it);
  for (Call& c : held) c(accepted ? connection.get() : nullptr);
  if (vanished && accepted) connection->invalidate();
}

void ClientRegistry::nameVanished(const std::string& name) {
  auto it = clients_.find(name);
  if (it == clients_.end()) return;
  if (!it->second.connection) {
    it->second.vanished = true;  // finished when the lookup answers
    return;
  }
  auto connection = std::move(it->second.connection);
  bool accepted = it->second.accepted;
  clients_.erase(it);
  if (accepted) connection->invalidate();
}

}  // namespace vireo::daemon
