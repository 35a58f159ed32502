// The bus clients the daemon knows, by unique name.
//
// D-Bus has no event for a new connection: a name is first seen when it calls.
// Its calls are then held, in arrival order, until the bus has told us its
// process identifier; only then is the connection offered to the listener
// delegate and the held calls run. When the bus reports the name gone, the
// connection is invalidated after its held calls have run, and forgotten.
//
// Everything here runs on the bus thread; the registry has no lock.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "base/mutex.h"
#include "platform/connection.h"

namespace vireo::daemon {

// One client connection: a bus unique name.
class PeerConnection final : public ClientConnection {
 public:
  PeerConnection(std::string name, std::int32_t pid) : name_(std::move(name)), pid_(pid) {}

  std::int32_t processIdentifier() const override { return pid_; }
  std::string description() const override;
  void setExportedObject(std::shared_ptr<VRReportingServiceProtocol> object) override;
  void setInterruptionHandler(std::function<void()> handler) override;
  void setInvalidationHandler(std::function<void()> handler) override;
  void resume() override {}

  const std::string& name() const { return name_; }
  std::shared_ptr<VRReportingServiceProtocol> exportedObject() const;
  // Runs the invalidation handler; only the first call does anything.
  void invalidate();

 private:
  const std::string name_;
  const std::int32_t pid_;
  mutable Mutex mutex_;  // guards exported_, the handlers and invalidated_
  std::shared_ptr<VRReportingServiceProtocol> exported_ VIREO_GUARDED_BY(mutex_);
  std::function<void()> interruptionHandler_ VIREO_GUARDED_BY(mutex_);  // kept, never called: D-Bus has no interruption
  std::function<void()> invalidationHandler_ VIREO_GUARDED_BY(mutex_);
  bool invalidated_ VIREO_GUARDED_BY(mutex_) = false;
};

class ClientRegistry {
 public:
  // A call to run once its client is known; connection is null when the
  // delegate refused the client.
  using Call = std::function<void(PeerConnection* connection)>;
  // Starts an asynchronous lookup of a name's process identifier; the answer
  // comes back through credentialsArrived().
  using LookupCredentials = std::function<void(const std::string& name)>;

  ClientRegistry(ListenerDelegate& delegate, LookupCredentials lookup)
      : delegate_(delegate), lookup_(std::move(lookup)) {}
  ClientRegistry(const ClientRegistry&) = delete;
  ClientRegistry& operator=(const ClientRegistry&) = delete;

  void call(const std::string& name, Call call);
  // pid is -1 when the bus could not tell.
  void credentialsArrived(const std::string& name, std::int32_t pid);
  void nameVanished(const std::string& name);

  std::size_t size() const { return clients_.size(); }
  bool contains(const std::string& name) const { return clients_.contains(name); }

 private:
  struct Client {
    std::shared_ptr<PeerConnection> connection;  // null while the lookup runs
    bool accepted = false;
    bool vanished = false;    // gone before its lookup answered
    std::vector<Call> held;   // calls that arrived before the lookup answered
  };

  ListenerDelegate& delegate_;
  LookupCredentials lookup_;
  std::unordered_map<std::string, Client> clients_;
};

}  // namespace vireo::daemon
