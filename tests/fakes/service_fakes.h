// Fakes and a harness for the service host and server instance tests: a client
// connection the test ends by hand, and sinks that note what a watched session held
// when they were called.
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
  void setInterruptionHandler(std::function<void()> handler) override { interruption_ = std::move(handler); }
  void setInvalidationHandler(std::function<void()> handler) override { invalidation_ = std::move(handler); }
  void resume() override { resumed_ = true; }

  bool resumed() const { return resumed_; }
  std::shared_ptr<VRReportingServerInstance> instance() const {
    return std::dynamic_pointer_cast<VRReportingServerInstance>(exported_);
  }
  VRReportingServiceProtocol& client() const { return *exported_; }
  void interrupt() const { interruption_(); }
  void invalidate() const { invalidation_(); }
  // The connection service lets go of the exported object and the handlers.
  void release() {
    exported_.reset();
    interruption_ = nullptr;
    invalidation_ = nullptr;
  }

 private:
  const std::int32_t pid_;
  const std::string description_;
  std::shared_ptr<VRReportingServiceProtocol> exported_;
  std::function<void()> interruption_;
  std::function<void()> invalidation_;
  bool resumed_ = false;
};

// What the sinks saw, in call order, with the size of a watched session's payload
// array at that moment (-1 when nothing is watched or the session is stopped).
struct SinkCall {
  std::string sink;
  long watchedPayloads;
};

class SinkJournal {
 public:
  void watch(std::shared_ptr<VRReportingSession> session) { Guard guard(lock_); watched_ = std::move(session); }
  void note(std::string sink) {
    std::shared_ptr<VRReportingSession> session;
    {
      Guard guard(lock_);
      session = watched_;
    }
    long size = -1;
    if (session) {
      if (auto payloads = session->aggregatedPayloadData()) {
        Guard payloadGuard(payloads->lock);
        size = static_cast<long>(payloads->entries.size());
      }
    }
    Guard guard(lock_);
    calls_.push_back({std::move(sink), size});
  }
  std::vector<SinkCall> calls() const { Guard guard(lock_); return calls_; }

 private:
  mutable std::mutex lock_;  // guards watched_ and calls_
  std::shared_ptr<VRReportingSession> watched_;
  std::vector<SinkCall> calls_;
};

// Sinks that note the call in the journal, then pass it on.
struct JournalingAnalytics : AnalyticsService {
  JournalingAnalytics(AnalyticsService& inner, SinkJournal& journal) : inner(inner), journal(journal) {}
  void sendEventLazy(std::string_view name, const std::function<Dictionary()>& payload) override {
    journal.note("analytics");
    inner.sendEventLazy(name, payload);
  }
  AnalyticsService& inner;
  SinkJournal& journal;
};

struct JournalingEnergyLog : EnergyLogService {
  JournalingEnergyLog(EnergyLogService& inner, SinkJournal& journal) : inner(inner), journal(journal) {}
  void logEvent(int client, std::string_view name, const Dictionary& event) override {
    journal.note("energy");
    inner.logEvent(client, name, event);
  }
  EnergyLogService& inner;
  SinkJournal& journal;
};

// The service delegate over the fakes, with the server queue pumped by hand.
struct ServiceHarness {
  FakePlatform fake;
  FakeDriverStats& drivers = fake.driverStats;
  SinkJournal journal;
  JournalingAnalytics analytics{fake.analytics, journal};
  JournalingEnergyLog energyLog{fake.energyLog, journal};
  Platform platform{fake.logger,    fake.tracer,        fake.clock,    fake.random,    fake.dispatcher,
                    fake.telemetry, analytics,          energyLog,     fake.defaults,  fake.notifications,
                    fake.device,    fake.processes,     fake.files,    fake.driverStats, fake.process};
  std::shared_ptr<ReportingEnvironment> env = std::make_shared<ReportingEnvironment>(platform);
  std::shared_ptr<VRReportingServiceDelegate> delegate = VRReportingServiceDelegate::init(env);

  ServiceHarness() = default;
  ServiceHarness(const ServiceHarness&) = delete;
  ServiceHarness& operator=(const ServiceHarness&) = delete;
  // Held closures reach this platform, not the bundle's: drop them while it lives.
  ~ServiceHarness() {
    journal.watch(nullptr);
    delegate.reset();
    fake.telemetry.dropHeld();
    fake.notifications.clear();
    fake.dispatcher.clear();
  }

  std::shared_ptr<ManualQueue> serverQueue() const { return fake.dispatcher.queue(kServerQueueLabel); }
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
