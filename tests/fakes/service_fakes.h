// A client connection the test ends by hand (D-Bus has no interruption: only invalidation),
// and a harness for the service host and server instance tests.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "fakes/fake_platform.h"
#include "service/server_instance.h"
#include "service/service_delegate.h"
#include "session/reporting_session.h"

namespace vireo::testing {

class FakeConnection : public ClientConnection {
 public:
  FakeConnection(std::int32_t pid, std::string description) : pid_(pid), description_(std::move(description)) {}

  std::int32_t processIdentifier() const override { return pid_; }
  std::string description() const override { return description_; }
  void setExportedObject(std::shared_ptr<VRReportingServiceProtocol> object) override { exported_ = std::move(object); }
  void setInterruptionHandler(std::function<void()>) override {}
  void setInvalidationHandler(std::function<void()> handler) override { invalidation_ = std::move(handler); }
  void resume() override { resumed_ = true; }

  bool resumed() const { return resumed_; }
  std::shared_ptr<VRReportingServerInstance> instance() const {
    return std::dynamic_pointer_cast<VRReportingServerInstance>(exported_);
  }
  VRReportingServiceProtocol& client() const { return *exported_; }
  void invalidate() const { invalidation_(); }

 private:
  const std::int32_t pid_;
  const std::string description_;
  std::shared_ptr<VRReportingServiceProtocol> exported_;
  std::function<void()> invalidation_;
  bool resumed_ = false;
};

// The service delegate over the fakes, with the server queue pumped by hand.
struct ServiceHarness {
  FakePlatform fake;
  std::shared_ptr<VRReportingServiceDelegate> delegate = VRReportingServiceDelegate::init(fake.env);

  // Runs the server queue (and sessions' queues) until idle; low-priority work stays held.
  void pump() { fake.dispatcher.runAll(); }

  // A connection accepted and registered, its process name known to the table.
  std::unique_ptr<FakeConnection> connect(std::int32_t pid, std::optional<std::string> name = std::nullopt) {
    if (name) fake.processes.setName(pid, *name);
    auto connection = std::make_unique<FakeConnection>(pid, "<connection pid " + std::to_string(pid) + ">");
    delegate->shouldAcceptNewConnection(*connection);
    pump();
    return connection;
  }

  void postDefaults() {
    fake.notifications.post(kDefaultsNotification);
    pump();
  }
};

// Collects every reply a callback receives.
template <typename T>
struct Replies {
  std::vector<T> values;
  std::function<void(T)> callback() {
    return [this](T v) { values.push_back(std::move(v)); };
  }
};

}  // namespace vireo::testing
