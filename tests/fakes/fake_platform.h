// Recording fakes of every platform interface, and FakePlatform, which owns one of
// each and hands them out as a Platform bundle and a ReportingEnvironment.
//
// Everything is deterministic: queued closures run only when a test asks
// (ManualDispatcher), time moves only when a test moves it, random numbers are
// scripted, and nothing touches the file system. Each fake's lock guards all of its
// fields: the thread tests share the fakes between pool threads.
#pragma once

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "platform/platform.h"
#include "vocabulary/reporting_environment.h"

namespace vireo::testing {

using Guard = std::lock_guard<std::mutex>;

// A copy of a field, taken under the lock that guards it.
template <typename T>
T locked(std::mutex& lock, const T& field) {
  Guard guard(lock);
  return field;
}

// Takes the oldest item out under the lock; nullopt when there is none.
template <typename T>
std::optional<T> popFront(std::mutex& lock, std::deque<T>& items) {
  Guard guard(lock);
  if (items.empty()) return std::nullopt;
  T item = std::move(items.front());
  items.pop_front();
  return item;
}

// Empties a field under the lock; the old contents (closures that may own engine
// objects) are destroyed after it is released.
template <typename T>
void dropAll(std::mutex& lock, T& field) {
  T dropped;
  Guard guard(lock);
  std::swap(dropped, field);
}

// ---------------------------------------------------------------- logging

struct LogEntry {
  LogScope scope;
  LogLevel level;
  std::string function;
  std::string message;
};

class RecordingLogger : public Logger {
 public:
  bool verbose(LogScope scope) const override { Guard guard(lock_); return verbose_.count(scope) != 0; }
  void write(LogScope scope, LogLevel level, const char*, int, const char* function,
             std::string_view message) override {
    Guard guard(lock_);
    entries_.push_back({scope, level, function ? function : "", std::string(message)});
  }
  void setVerbose(LogScope scope, bool on) {
    Guard guard(lock_);
    on ? (void)verbose_.insert(scope) : (void)verbose_.erase(scope);
  }
  std::vector<LogEntry> entries() const { return locked(lock_, entries_); }
  // Entries whose message contains text.
  std::vector<LogEntry> matching(std::string_view text) const {
    std::vector<LogEntry> out;
    for (auto& e : entries())
      if (e.message.find(text) != std::string::npos) out.push_back(e);
    return out;
  }
  bool contains(std::string_view text) const { return count(text) > 0; }
  std::size_t count(std::string_view text) const { return matching(text).size(); }
  std::size_t size() const { return entries().size(); }
  void clear() { Guard guard(lock_); entries_.clear(); }

 private:
  mutable std::mutex lock_;
  std::vector<LogEntry> entries_;
  std::set<LogScope> verbose_;
};

class RecordingTracer : public Tracer {
 public:
  void emit(std::uint32_t code) override { Guard guard(lock_); codes_.push_back(code); }
  std::size_t count(std::uint32_t code) const {
    Guard guard(lock_);
    return static_cast<std::size_t>(std::count(codes_.begin(), codes_.end(), code));
  }

 private:
  mutable std::mutex lock_;
  std::vector<std::uint32_t> codes_;
};

// ---------------------------------------------------------------- time and chance

class FakeClock : public Clock {
 public:
  WallTime now() const override { return locked(lock_, now_); }
  void advance(std::chrono::nanoseconds d) {
    Guard guard(lock_);
    now_ += std::chrono::duration_cast<WallTime::duration>(d);
  }

 private:
  mutable std::mutex lock_;
  WallTime now_ = WallTime(std::chrono::seconds(1'700'000'000));
};

// Returns the scripted values in order (each reduced below the bound), then 0.
class FakeRandom : public RandomSource {
 public:
  std::uint32_t uniformBelow(std::uint32_t bound) override {
    std::uint32_t v = popFront(lock_, script_).value_or(0);
    Guard guard(lock_);
    bounds_.push_back(bound);
    return bound == 0 ? 0 : v % bound;
  }
  void script(std::initializer_list<std::uint32_t> values) {
    Guard guard(lock_);
    script_.insert(script_.end(), values.begin(), values.end());
  }
  std::vector<std::uint32_t> boundsAsked() const { return locked(lock_, bounds_); }

 private:
  mutable std::mutex lock_;
  std::deque<std::uint32_t> script_;
  std::vector<std::uint32_t> bounds_;
};

// ---------------------------------------------------------------- dispatch

class ManualQueue : public SerialQueue {
 public:
  ManualQueue(std::string label, QoS qos) : label_(std::move(label)), qos_(qos) {}
  void async(Task task) override { Guard guard(lock_); tasks_.push_back(std::move(task)); }
  const std::string& label() const override { return label_; }
  QoS qos() const { return qos_; }

  // Runs the oldest held closure; false when there was none.
  bool runOne() {
    auto task = popFront(lock_, tasks_);
    if (task && *task) (*task)();
    return task.has_value();
  }
  void clear() { dropAll(lock_, tasks_); }

 private:
  const std::string label_;
  const QoS qos_;
  mutable std::mutex lock_;
  std::deque<Task> tasks_;
};

// Holds every submitted closure until the test runs it, on the test's thread;
// queues are visited in creation order. Low-priority delays are recorded, not waited.
class ManualDispatcher : public Dispatcher {
 public:
  ~ManualDispatcher() override { clear(); }

  std::shared_ptr<SerialQueue> makeSerialQueue(std::string label, QoS qos) override {
    auto q = std::make_shared<ManualQueue>(std::move(label), qos);
    Guard guard(lock_);
    queues_.push_back(q);
    return q;
  }
  void asyncLowPriority(std::chrono::nanoseconds delay, Task task) override {
    Guard guard(lock_);
    lowPriorityDelays_.push_back(delay);
    lowPriority_.push_back(std::move(task));
  }

  std::shared_ptr<ManualQueue> queue(std::string_view label) const {
    for (auto& q : queues())
      if (q->label() == label) return q;
    return nullptr;
  }
  // Runs serial-queue closures, including ones submitted meanwhile, until none is
  // left; low-priority closures stay held.
  void runAll() {
    for (bool ran = true; ran;) {
      ran = false;
      for (auto& q : queues()) ran = q->runOne() || ran;
    }
  }
  // Runs the held low-priority closures; returns how many ran.
  std::size_t runLowPriority() {
    std::size_t n = 0;
    for (std::optional<Task> t; (t = popFront(lock_, lowPriority_)); ++n)
      if (*t) (*t)();
    return n;
  }
  void runUntilIdle() {
    do runAll();
    while (runLowPriority() != 0);
  }
  std::size_t pendingLowPriority() const { Guard guard(lock_); return lowPriority_.size(); }
  std::vector<std::chrono::nanoseconds> lowPriorityDelays() const { return locked(lock_, lowPriorityDelays_); }
  // Drops every held closure without running it.
  void clear() {
    dropAll(lock_, lowPriority_);
    for (auto& q : queues()) q->clear();
  }

 private:
  std::vector<std::shared_ptr<ManualQueue>> queues() const {
    Guard guard(lock_);
    std::vector<std::shared_ptr<ManualQueue>> out;
    for (const auto& w : queues_)
      if (auto q = w.lock()) out.push_back(q);
    return out;
  }

  mutable std::mutex lock_;
  // Weak: a queue lives as long as its owner; the dispatcher only needs to find it.
  std::vector<std::weak_ptr<ManualQueue>> queues_;
  std::deque<Task> lowPriority_;
  std::vector<std::chrono::nanoseconds> lowPriorityDelays_;
};

// ---------------------------------------------------------------- telemetry

struct SentMessage {
  std::uint16_t category = 0;
  std::uint16_t type = 0;
  Dictionary payload;
};

struct OneShotMessage {
  Dictionary sessionInfo;
  Dictionary userInfo;
  std::uint16_t category = 0;
  std::uint16_t type = 0;
  Dictionary payload;
};

// How a telemetry session answers startConfiguration.
enum class BackendAnswer {
  List,       // the configured backends
  EmptyList,  // an empty list
  Nothing,    // no list at all
  Never,      // the completion is kept and never called
};

struct TelemetryBehaviour {
  BackendAnswer answer = BackendAnswer::List;
  // Answer from a separate thread, as the real service does.
  bool answerOnOwnThread = false;
  bool refuseSends = false;  // one-shot sends only
};

class FakeTelemetrySession : public TelemetrySession {
 public:
  explicit FakeTelemetrySession(TelemetryBehaviour behaviour) : behaviour_(behaviour) {}
  ~FakeTelemetrySession() override {
    if (answerThread_.joinable()) answerThread_.join();
  }

  void startConfiguration(std::function<void(std::optional<std::vector<std::string>>)> completion) override {
    std::optional<std::vector<std::string>> answer;
    {
      Guard guard(lock_);
      switch (behaviour_.answer) {
        case BackendAnswer::List: answer = std::vector<std::string>{"backend-1"}; break;
        case BackendAnswer::EmptyList: answer = std::vector<std::string>{}; break;
        case BackendAnswer::Nothing: break;
        case BackendAnswer::Never: heldCompletion_ = std::move(completion); return;
      }
      if (behaviour_.answerOnOwnThread) {
        answerThread_ = std::thread([completion = std::move(completion), answer] { completion(answer); });
        return;
      }
    }
    completion(answer);
  }
  bool sendMessage(std::uint16_t category, std::uint16_t type, const Dictionary& payload,
                   std::optional<Error>*) override {
    Guard guard(lock_);
    sent_.push_back({category, type, payload});
    return true;
  }
  void flushMessages(std::function<void(std::optional<Error>)> completion) override {
    { Guard guard(lock_); ++flushes_; }
    if (completion) completion(std::nullopt);
  }
  std::string description() const override { return "<FakeTelemetrySession>"; }

  std::vector<SentMessage> sent() const { return locked(lock_, sent_); }
  int flushes() const { return locked(lock_, flushes_); }
  // Drops a completion held by BackendAnswer::Never (it may hold engine objects).
  void dropHeld() { dropAll(lock_, heldCompletion_); }

 private:
  mutable std::mutex lock_;
  TelemetryBehaviour behaviour_;
  std::vector<SentMessage> sent_;
  int flushes_ = 0;
  std::function<void(std::optional<std::vector<std::string>>)> heldCompletion_;
  std::thread answerThread_;
};

struct CreatedSession {
  Dictionary sessionInfo;
  Dictionary userInfo;
  std::shared_ptr<FakeTelemetrySession> session;
};

class FakeTelemetryService : public TelemetryService {
 public:
  // Applies to sessions created and one-shot sends made from now on.
  void setBehaviour(TelemetryBehaviour behaviour) { Guard guard(lock_); behaviour_ = behaviour; }
  void setRefuseSends(bool refuse) { Guard guard(lock_); behaviour_.refuseSends = refuse; }

  std::shared_ptr<HierarchyToken> makeHierarchyToken() override {
    Guard guard(lock_);
    return std::make_shared<HierarchyToken>(HierarchyToken{"token-" + std::to_string(++tokens_)});
  }
  std::shared_ptr<TelemetrySession> createSession(const Dictionary& sessionInfo, const Dictionary& userInfo,
                                                  const std::vector<std::string>&) override {
    Guard guard(lock_);
    auto s = std::make_shared<FakeTelemetrySession>(behaviour_);
    created_.push_back({sessionInfo, userInfo, s});
    return s;
  }
  bool sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo, std::uint16_t category,
                      std::uint16_t type, const Dictionary& payload, std::optional<Error>* error) override {
    Guard guard(lock_);
    oneShots_.push_back({sessionInfo, userInfo, category, type, payload});
    if (behaviour_.refuseSends && error) *error = Error{kGeneralErrorDomain, 7, "refused by fake"};
    return !behaviour_.refuseSends;
  }

  std::vector<CreatedSession> created() const { return locked(lock_, created_); }
  std::shared_ptr<FakeTelemetrySession> lastSession() const {
    Guard guard(lock_);
    return created_.empty() ? nullptr : created_.back().session;
  }
  std::vector<OneShotMessage> oneShots() const { return locked(lock_, oneShots_); }
  void dropHeld() { for (auto& c : created()) c.session->dropHeld(); }

 private:
  mutable std::mutex lock_;
  TelemetryBehaviour behaviour_;
  int tokens_ = 0;
  std::vector<CreatedSession> created_;
  std::vector<OneShotMessage> oneShots_;
};

// ---------------------------------------------------------------- event sinks

struct AnalyticsEvent {
  std::string name;
  Dictionary payload;
};

class FakeAnalyticsService : public AnalyticsService {
 public:
  void sendEventLazy(std::string_view name, const std::function<Dictionary()>& payload) override {
    if (onCall) onCall();
    {
      Guard guard(lock_);
      if (unwanted_.count(std::string(name))) {
        skipped_.emplace_back(name);
        return;
      }
    }
    Dictionary d = payload ? payload() : Dictionary{};  // built outside the lock
    Guard guard(lock_);
    events_.push_back({std::string(name), std::move(d)});
  }
  // Events of this name are not wanted: their payload is never built.
  void addUnwanted(std::string name) { Guard guard(lock_); unwanted_.insert(std::move(name)); }
  std::vector<AnalyticsEvent> events() const { return locked(lock_, events_); }
  std::vector<std::string> skipped() const { return locked(lock_, skipped_); }
  std::function<void()> onCall;  // runs first in every call; set before any thread runs

 private:
  mutable std::mutex lock_;
  std::set<std::string> unwanted_;
  std::vector<AnalyticsEvent> events_;
  std::vector<std::string> skipped_;
};

struct EnergyEvent {
  int client = 0;
  std::string name;
  Dictionary event;
};

class FakeEnergyLogService : public EnergyLogService {
 public:
  void logEvent(int client, std::string_view name, const Dictionary& event) override {
    if (onCall) onCall();
    Guard guard(lock_);
    events_.push_back({client, std::string(name), event});
  }
  std::vector<EnergyEvent> events() const { return locked(lock_, events_); }
  std::function<void()> onCall;  // runs first in every call; set before any thread runs

 private:
  mutable std::mutex lock_;
  std::vector<EnergyEvent> events_;
};

// ---------------------------------------------------------------- defaults

class FakeDefaultsStore : public DefaultsStore {
 public:
  std::optional<std::string> stringForKey(std::string_view suite, std::string_view key) override {
    Guard guard(lock_);
    auto it = values_.find({std::string(suite), std::string(key)});
    if (it == values_.end()) return std::nullopt;
    return it->second;
  }
  // The tests only set lower-case booleans.
  bool boolForKey(std::string_view suite, std::string_view key) override {
    auto v = stringForKey(suite, key);
    return v == "1" || v == "yes" || v == "true" || v == "on";
  }
  void set(std::string suite, std::string key, std::string value) {
    Guard guard(lock_);
    values_[{std::move(suite), std::move(key)}] = std::move(value);
  }
  void remove(const std::string& suite, const std::string& key) { Guard guard(lock_); values_.erase({suite, key}); }

 private:
  mutable std::mutex lock_;
  std::map<std::pair<std::string, std::string>, std::string> values_;
};

struct NotificationRegistration {
  std::string name;
  std::shared_ptr<SerialQueue> queue;
  std::function<void(int)> handler;
  int token = 0;
};

class FakeNotificationService : public NotificationService {
 public:
  int registerDispatch(std::string name, std::shared_ptr<SerialQueue> queue, std::function<void(int)> handler,
                       int* token) override {
    Guard guard(lock_);
    int t = static_cast<int>(registrations_.size()) + 1;
    if (token) *token = t;
    registrations_.push_back({std::move(name), std::move(queue), std::move(handler), t});
    return 0;
  }
  // Queues every handler registered for name on its queue.
  void post(const std::string& name) {
    for (auto& r : locked(lock_, registrations_))
      if (r.name == name) r.queue->async([handler = r.handler, t = r.token] { handler(t); });
  }
  void clear() { dropAll(lock_, registrations_); }

 private:
  mutable std::mutex lock_;
  std::vector<NotificationRegistration> registrations_;
};

// ---------------------------------------------------------------- device

// Answers only "InternalBuild", when set.
class FakeDeviceProperties : public DeviceProperties {
 public:
  std::optional<bool> boolAnswer(std::string_view key) override {
    Guard guard(lock_);
    return key == "InternalBuild" ? internal_ : std::nullopt;
  }
  std::optional<std::int32_t> intAnswer(std::string_view) override { return std::nullopt; }
  void setInternalBuild(bool internal) { Guard guard(lock_); internal_ = internal; }

 private:
  mutable std::mutex lock_;
  std::optional<bool> internal_;
};

// This process is 4242 "vireod"; other names are set by the test.
class FakeProcessTable : public ProcessTable {
 public:
  std::int32_t selfPid() const override { return 4242; }
  std::optional<std::string> selfName() const override { return "vireod"; }
  std::optional<std::string> shortName(std::int32_t pid) const override {
    Guard guard(lock_);
    auto it = names_.find(pid);
    if (it == names_.end()) return std::nullopt;
    return it->second;
  }
  void setName(std::int32_t pid, std::string name) { Guard guard(lock_); names_[pid] = std::move(name); }

 private:
  mutable std::mutex lock_;
  std::map<std::int32_t, std::string> names_;
};

// In-memory files under a fixed log directory.
class FakeDiagnosticFiles : public DiagnosticFiles {
 public:
  std::string logDirectory() const override { return "/fake/logs"; }
  bool createDirectory(const std::string& path, unsigned, Error* error) override {
    Guard guard(lock_);
    if (createError_) {
      if (error) *error = *createError_;
      return false;
    }
    directories_.insert(path);
    return true;
  }
  bool writeAtomically(const std::string& path, std::string_view text, Error*) override {
    Guard guard(lock_);
    files_[path] = std::string(text);
    return true;
  }
  void failCreateDirectory(Error error) { Guard guard(lock_); createError_ = std::move(error); }
  std::map<std::string, std::string> files() const { return locked(lock_, files_); }
  std::set<std::string> directories() const { return locked(lock_, directories_); }

 private:
  mutable std::mutex lock_;
  std::optional<Error> createError_;
  std::map<std::string, std::string> files_;
  std::set<std::string> directories_;
};

// ---------------------------------------------------------------- driver statistics

// One driver ("Speaker", no subgroup) with one channel "X" whose value the test sets;
// deltas are later minus earlier. Every other driver has no channels.
class FakeDriverStats : public DriverStatsLibrary {
 public:
  struct Channels : DriverChannelSet {
    bool speaker = false;
  };
  struct Subscribed : DriverSubscribedChannels {
    std::unique_ptr<DriverSubscribedChannels> copy() const override { return std::make_unique<Subscribed>(); }
  };
  struct Samples : DriverSampleSet, DriverChannel {
    explicit Samples(std::int64_t v) : value(v) {}
    std::unique_ptr<DriverSampleSet> copy() const override { return std::make_unique<Samples>(value); }
    std::int64_t value;
  };

  void setValue(std::int64_t v) { Guard guard(lock_); value_ = v; }
  std::unique_ptr<DriverChannelSet> copyChannelsInGroup(const std::optional<std::string>& group,
                                                        const std::optional<std::string>&, std::uint64_t,
                                                        std::optional<DriverStatsError>*) override {
    auto set = std::make_unique<Channels>();
    set->speaker = group == "Speaker";
    return set;
  }
  std::int32_t channelCount(const DriverChannelSet& set) override {
    return static_cast<const Channels&>(set).speaker ? 1 : 0;
  }
  DriverSubscriptionHandle createSubscription(const DriverChannelSet&,
                                              std::unique_ptr<DriverSubscribedChannels>* subscribed) override {
    *subscribed = std::make_unique<Subscribed>();
    return this;
  }
  std::unique_ptr<DriverSampleSet> createSamples(DriverSubscriptionHandle, const DriverSubscribedChannels&,
                                                 std::optional<DriverStatsError>*) override {
    return std::make_unique<Samples>(locked(lock_, value_));
  }
  std::unique_ptr<DriverSampleSet> createSamplesDelta(const DriverSampleSet* earlier, const DriverSampleSet& later,
                                                      std::optional<DriverStatsError>*) override {
    std::int64_t before = earlier ? static_cast<const Samples*>(earlier)->value : 0;
    return std::make_unique<Samples>(static_cast<const Samples&>(later).value - before);
  }
  void iterate(const DriverSampleSet& samples,
               const std::function<DriverIterate(const DriverChannel&)>& visitor) override {
    visitor(static_cast<const Samples&>(samples));
  }
  std::optional<std::string> channelName(const DriverChannel&) override { return "X"; }
  std::int64_t simpleIntegerValue(const DriverChannel& channel) override {
    return static_cast<const Samples&>(channel).value;
  }

 private:
  mutable std::mutex lock_;
  std::int64_t value_ = 0;
};

// ---------------------------------------------------------------- process control

// Thrown by FakeProcessControl::exitProcess in place of ending the test.
struct ProcessExited {
  int status;
};

class FakeProcessControl : public ProcessControl {
 public:
  [[noreturn]] void exitProcess(int status) override { throw ProcessExited{status}; }
};

// ---------------------------------------------------------------- the bundle

// Owns one fake of each interface. Held closures are dropped first on destruction,
// while the fakes they may reach are still alive.
struct FakePlatform {
  RecordingLogger logger;
  RecordingTracer tracer;
  FakeClock clock;
  FakeRandom random;
  FakeTelemetryService telemetry;
  FakeAnalyticsService analytics;
  FakeEnergyLogService energyLog;
  FakeDefaultsStore defaults;
  FakeNotificationService notifications;
  FakeDeviceProperties device;
  FakeProcessTable processes;
  FakeDiagnosticFiles files;
  FakeDriverStats driverStats;
  FakeProcessControl process;
  ManualDispatcher dispatcher;

  Platform platform{logger,    tracer,        clock,  random,    dispatcher, telemetry,   analytics, energyLog,
                    defaults,  notifications, device, processes, files,      driverStats, process};
  std::shared_ptr<ReportingEnvironment> env = std::make_shared<ReportingEnvironment>(platform);

  FakePlatform() = default;
  FakePlatform(const FakePlatform&) = delete;
  FakePlatform& operator=(const FakePlatform&) = delete;
  ~FakePlatform() {
    analytics.onCall = energyLog.onCall = nullptr;
    telemetry.dropHeld();
    notifications.clear();
    dispatcher.clear();
  }

  void setInternalBuild(bool internal) { device.setInternalBuild(internal); }
};

}  // namespace vireo::testing
