// The inter-process connection service, as the service host sees it: a listener
// hands each new client connection to its delegate, which exports an object on it
// and attaches interruption and invalidation handlers.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

namespace vireo {

class VRReportingServiceProtocol;

class ClientConnection {
 public:
  virtual ~ClientConnection() = default;
  virtual std::int32_t processIdentifier() const = 0;
  // Text for log lines ("%@").
  virtual std::string description() const = 0;
  virtual void setExportedObject(std::shared_ptr<VRReportingServiceProtocol> object) = 0;
  // Handlers run on a thread of the connection service; they only queue work.
  virtual void setInterruptionHandler(std::function<void()> handler) = 0;
  virtual void setInvalidationHandler(std::function<void()> handler) = 0;
  virtual void resume() = 0;
};

class ListenerDelegate {
 public:
  virtual ~ListenerDelegate() = default;
  // listener:shouldAcceptNewConnection:
  virtual bool shouldAcceptNewConnection(ClientConnection& connection) = 0;
};

// Ends the process with a status, at once (killService:).
class ProcessControl {
 public:
  virtual ~ProcessControl() = default;
  [[noreturn]] virtual void exitProcess(int status) = 0;
};

}  // namespace vireo
