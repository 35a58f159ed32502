// Recording fakes of every platform interface, bundled by FakePlatform. Deterministic: queued closures
// run and time moves only when a test asks, random numbers are scripted, no file is touched.
#pragma once

#include <algorithm>
#include <atomic>
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

// A value and the lock that guards it (the thread tests share the fakes between pool threads).
// with() runs f on the value under the lock; a Locked member called as a function returns a copy.
template <typename T>
class Locked {
 public:
  template <typename F>
  auto with(F&& f) const {
    std::lock_guard guard(lock_);
    return f(value_);
  }
  T get() const { return with([](T& v) { return v; }); }
  T operator()() const { return get(); }
  // The old value (closures that may own engine objects) dies after the lock is released.
  void set(T value) { with([&](T& old) { std::swap(old, value); }); }

 private:
  mutable std::mutex lock_;
  mutable T value_{};
};

// The calls a fake received, in order.
template <typename T>
struct Recorder : Locked<std::vector<T>> {
  void add(T item) { this->with([&](std::vector<T>& v) { v.push_back(std::move(item)); }); }
};

template <typename T>
std::optional<T> popFront(Locked<std::deque<T>>& items) {
  return items.with([](std::deque<T>& d) -> std::optional<T> {
    if (d.empty()) return std::nullopt;
    std::optional<T> item(std::move(d.front()));
    d.pop_front();
    return item;
  });
}

template <typename M>
std::optional<typename M::mapped_type> lookup(const Locked<M>& map, const typename M::key_type& key) {
  return map.with([&](M& m) -> std::optional<typename M::mapped_type> {
    auto it = m.find(key);
    return it == m.end() ? std::nullopt : std::optional(it->second);
  });
}

struct LogEntry { LogScope scope; LogLevel level; std::string function, message; };

struct RecordingLogger : Logger {
  bool verbose(LogScope scope) const override { return verbose_.with([&](auto& s) { return s.count(scope) != 0; }); }
  void write(LogScope scope, LogLevel level, const char*, int, const char* function,
             std::string_view message) override {
    entries.add({scope, level, function ? function : "", std::string(message)});
  }
  void setVerbose(LogScope scope, bool on) {
    verbose_.with([&](auto& s) { on ? (void)s.insert(scope) : (void)s.erase(scope); });
  }
  std::vector<LogEntry> matching(std::string_view text) const {
    auto all = entries();
    std::erase_if(all, [&](auto& e) { return e.message.find(text) == std::string::npos; });
    return all;
  }
  bool contains(std::string_view text) const { return count(text) > 0; }
  std::size_t count(std::string_view text) const { return matching(text).size(); }
  std::size_t size() const { return entries().size(); }
  void clear() { entries.set({}); }
  Recorder<LogEntry> entries;
  Locked<std::set<LogScope>> verbose_;
};

struct RecordingTracer : Tracer {
  void emit(std::uint32_t code) override { codes.add(code); }
  std::size_t count(std::uint32_t code) const {
    auto all = codes();
    return static_cast<std::size_t>(std::count(all.begin(), all.end(), code));
  }
  Recorder<std::uint32_t> codes;
};

struct FakeClock : Clock {
  WallTime now() const override { return WallTime(std::chrono::seconds(1'700'000'000)) + moved(); }
  void advance(std::chrono::nanoseconds d) {
    moved.with([&](WallTime::duration& m) { m += std::chrono::duration_cast<WallTime::duration>(d); });
  }
  Locked<WallTime::duration> moved;
};

// Returns the scripted values in order (each reduced below the bound), then 0.
struct FakeRandom : RandomSource {
  std::uint32_t uniformBelow(std::uint32_t bound) override {
    boundsAsked.add(bound);
    std::uint32_t v = popFront(script_).value_or(0);
    return bound == 0 ? 0 : v % bound;
  }
  void script(std::initializer_list<std::uint32_t> values) {
    script_.with([&](auto& s) { s.insert(s.end(), values); });
  }
  Recorder<std::uint32_t> boundsAsked;
  Locked<std::deque<std::uint32_t>> script_;
};

class ManualQueue;

// A park of a ManualQueue; it holds the queue and the timeout closure until it ends.
class ManualParking : public Parking {
 public:
  ManualParking() = default;  // spent from the start
  ManualParking(std::shared_ptr<ManualQueue> queue, Task onTimeout) {
    held_.set(Held{std::move(queue), std::move(onTimeout)});
  }
  inline bool resume(Task next) override;
  inline bool expire();
  // Lets go of the queue and the timeout closure unrun.
  void spend() { held_.set({}); }

 private:
  struct Held { std::shared_ptr<ManualQueue> queue; Task onTimeout; };
  inline bool end(Task next, bool timedOut);
  Locked<Held> held_;
};

// A serial queue run by hand. A park stops it until resumed, or until its dispatcher's
// manual time passes the deadline (ManualDispatcher::advance).
class ManualQueue : public SerialQueue, public std::enable_shared_from_this<ManualQueue> {
 public:
  using Nanos = std::chrono::nanoseconds;
  // now: the manual time deadlines are measured on (the dispatcher's); a queue of its own otherwise.
  ManualQueue(std::string label, QoS qos, std::shared_ptr<Locked<Nanos>> now = std::make_shared<Locked<Nanos>>())
      : label_(std::move(label)), qos_(qos), now_(std::move(now)) {}
  void async(Task task) override { state_.with([&](State& s) { s.tasks.push_back(std::move(task)); }); }
  const std::string& label() const override { return label_; }
  std::shared_ptr<Parking> park(Nanos timeout, Task onTimeout) override {
    parkTimeouts.add(timeout);
    auto parking = std::make_shared<ManualParking>(shared_from_this(), std::move(onTimeout));
    const Nanos due = now_->get() + timeout;
    bool taken = state_.with([&](State& s) {
      if (s.park) return false;
      s.park = parking;
      s.due = due;
      return true;
    });
    if (taken) return parking;
    parking->spend();
    return std::make_shared<ManualParking>();
  }
  QoS qos() const { return qos_; }
  // Runs the next closure unless the queue is parked.
  bool runOne() {
    auto task = state_.with([](State& s) -> std::optional<Task> {
      if (s.park || s.tasks.empty()) return std::nullopt;
      std::optional<Task> t(std::move(s.tasks.front()));
      s.tasks.pop_front();
      return t;
    });
    if (task && *task) (*task)();
    return task.has_value();
  }
  bool parked() const { return state_.with([](State& s) { return s.park != nullptr; }); }
  // The deadline of the pending park, on the manual time.
  std::optional<Nanos> deadline() const {
    return state_.with([](State& s) { return s.park ? std::optional(s.due) : std::nullopt; });
  }
  // Times the pending park out when its deadline has come.
  bool expireIfDue() {
    auto park = state_.with([&](State& s) { return s.park && s.due <= now_->get() ? s.park : nullptr; });
    return park && park->expire();
  }
  // Drops the queued closures and a pending park, whose timeout closure never runs.
  void clear() {
    State old = state_.with([](State& s) { return std::exchange(s, State{}); });
    if (old.park) old.park->spend();
  }
  // The park ended: first goes to the head of the line.
  void unpark(const ManualParking* which, Task first) {
    std::shared_ptr<ManualParking> ended;  // released outside the lock
    state_.with([&](State& s) {
      if (s.park.get() == which) ended = std::exchange(s.park, nullptr);
      if (first) s.tasks.push_front(std::move(first));
    });
  }
  Recorder<Nanos> parkTimeouts;

 private:
  struct State {
    std::deque<Task> tasks;
    std::shared_ptr<ManualParking> park;
    Nanos due{};
  };
  const std::string label_;
  const QoS qos_;
  const std::shared_ptr<Locked<Nanos>> now_;
  Locked<State> state_;
};

bool ManualParking::resume(Task next) { return end(std::move(next), false); }
bool ManualParking::expire() { return end(nullptr, true); }
bool ManualParking::end(Task next, bool timedOut) {
  Held held = held_.with([](Held& h) { return std::exchange(h, Held{}); });
  if (!held.queue) return false;
  held.queue->unpark(this, timedOut ? std::move(held.onTimeout) : std::move(next));
  return true;
}

// Holds every submitted closure until the test runs it, on the test's thread;
// queues are visited in creation order. Low-priority delays are recorded, not waited.
// Parked queues wait for a resume or for advance() to pass their deadline.
class ManualDispatcher : public Dispatcher {
 public:
  ~ManualDispatcher() override { clear(); }
  std::shared_ptr<SerialQueue> makeSerialQueue(std::string label, QoS qos) override {
    auto q = std::make_shared<ManualQueue>(std::move(label), qos, now_);
    queues_.add(q);
    return q;
  }
  void asyncLowPriority(std::chrono::nanoseconds delay, Task task) override {
    lowPriorityDelays.add(delay);
    lowPriority_.with([&](auto& l) { l.push_back(std::move(task)); });
  }

  std::shared_ptr<ManualQueue> queue(std::string_view label) const {
    for (auto& q : queues())
      if (q->label() == label) return q;
    return nullptr;
  }
  // Runs serial-queue closures, including ones submitted meanwhile, until none is
  // left that may run; low-priority closures stay held, parked queues stay parked.
  void runAll() {
    for (bool ran = true; ran;) {
      ran = false;
      for (auto& q : queues()) ran = q->runOne() || ran;
    }
  }
  std::size_t runLowPriority() {
    std::size_t n = 0;
    for (std::optional<Task> t; (t = popFront(lowPriority_)); ++n)
      if (*t) (*t)();
    return n;
  }
  void runUntilIdle() { do runAll(); while (runLowPriority() != 0); }
  std::size_t pendingLowPriority() const { return lowPriority_.with([](auto& l) { return l.size(); }); }
  Recorder<std::chrono::nanoseconds> lowPriorityDelays;

  // Moves the manual time on; parks whose deadline passes time out, earliest first
  // (their timeout closures then wait for runAll).
  std::size_t advance(std::chrono::nanoseconds d) {
    now_->with([&](auto& now) { now += d; });
    std::vector<std::pair<std::chrono::nanoseconds, std::shared_ptr<ManualQueue>>> due;
    for (auto& q : queues())
      if (auto at = q->deadline(); at && *at <= now_->get()) due.emplace_back(*at, q);
    std::stable_sort(due.begin(), due.end(), [](auto& a, auto& b) { return a.first < b.first; });
    std::size_t n = 0;
    for (auto& [at, q] : due) n += q->expireIfDue() ? 1 : 0;
    return n;
  }
  std::size_t parkedCount() const {
    auto all = queues();
    return static_cast<std::size_t>(std::count_if(all.begin(), all.end(), [](auto& q) { return q->parked(); }));
  }
  // Waits (on the real clock) until another thread has resumed every parked queue.
  bool awaitUnparked(std::chrono::milliseconds budget = std::chrono::seconds(10)) const {
    for (auto until = std::chrono::steady_clock::now() + budget; parkedCount() != 0;) {
      if (std::chrono::steady_clock::now() > until) return false;
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return true;
  }
  void clear() {
    lowPriority_.set({});
    for (auto& q : queues()) q->clear();
  }

 private:
  std::vector<std::shared_ptr<ManualQueue>> queues() const {
    std::vector<std::shared_ptr<ManualQueue>> out;
    for (const auto& w : queues_.get())
      if (auto q = w.lock()) out.push_back(q);
    return out;
  }

  // Weak: a queue lives as long as its owner; the dispatcher only needs to find it.
  Recorder<std::weak_ptr<ManualQueue>> queues_;
  Locked<std::deque<Task>> lowPriority_;
  // The manual time of the queues' deadlines.
  std::shared_ptr<Locked<std::chrono::nanoseconds>> now_ = std::make_shared<Locked<std::chrono::nanoseconds>>();
};

struct SentMessage {
  std::uint16_t category, type;
  Dictionary payload;
  bool operator==(const SentMessage&) const = default;
};
struct OneShotMessage : SentMessage {
  Dictionary sessionInfo, userInfo;
  bool operator==(const OneShotMessage&) const = default;
};

// How a telemetry session answers startConfiguration: with a list of backends, an
// empty list, no list at all, or never (the completion is kept).
enum class BackendAnswer { List, EmptyList, Nothing, Never };

// Answering on its own thread is what the real service does; refusal applies to one-shot sends.
struct TelemetryBehaviour {
  BackendAnswer answer = BackendAnswer::List;
  bool answerOnOwnThread = false, refuseSends = false;
};

class FakeTelemetrySession : public TelemetrySession {
 public:
  using Completion = std::function<void(std::optional<std::vector<std::string>>)>;
  explicit FakeTelemetrySession(TelemetryBehaviour behaviour) : behaviour_(behaviour) {}
  ~FakeTelemetrySession() override { if (answerThread_.joinable()) answerThread_.join(); }

  void startConfiguration(Completion completion) override {
    std::optional<std::vector<std::string>> answer;
    if (behaviour_.answer == BackendAnswer::List) answer = std::vector<std::string>{"backend-1"};
    if (behaviour_.answer == BackendAnswer::EmptyList) answer.emplace();
    if (behaviour_.answer == BackendAnswer::Never) return held_.set(std::move(completion));
    if (!behaviour_.answerOnOwnThread) return completion(answer);
    answerThread_ = std::thread([completion = std::move(completion), answer] { completion(answer); });
  }
  bool sendMessage(std::uint16_t category, std::uint16_t type, const Dictionary& payload,
                   std::optional<Error>*) override {
    sent.add({category, type, payload});
    return true;
  }
  void flushMessages(std::function<void(std::optional<Error>)> completion) override {
    ++flushes_;
    if (completion) completion(std::nullopt);
  }
  std::string description() const override { return "<FakeTelemetrySession>"; }

  int flushes() const { return flushes_; }
  // Drops a completion held by BackendAnswer::Never (it may hold engine objects).
  void dropHeld() { held_.set(nullptr); }
  Recorder<SentMessage> sent;

 private:
  const TelemetryBehaviour behaviour_;
  std::atomic<int> flushes_{0};
  Locked<Completion> held_;
  std::thread answerThread_;  // set by the one startConfiguration call, joined on destruction
};

struct CreatedSession { Dictionary sessionInfo, userInfo; std::shared_ptr<FakeTelemetrySession> session; };

class FakeTelemetryService : public TelemetryService {
 public:
  // Applies to sessions created and one-shot sends made from now on.
  void setBehaviour(TelemetryBehaviour behaviour) { behaviour_.set(behaviour); }

  std::shared_ptr<HierarchyToken> makeHierarchyToken() override {
    return std::make_shared<HierarchyToken>(HierarchyToken{"token-" + std::to_string(++tokens_)});
  }
  std::shared_ptr<TelemetrySession> createSession(const Dictionary& sessionInfo, const Dictionary& userInfo,
                                                  const std::vector<std::string>&) override {
    auto s = std::make_shared<FakeTelemetrySession>(behaviour_.get());
    created.add({sessionInfo, userInfo, s});
    return s;
  }
  bool sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo, std::uint16_t category,
                      std::uint16_t type, const Dictionary& payload, std::optional<Error>* error) override {
    oneShots.add({{category, type, payload}, sessionInfo, userInfo});
    if (!behaviour_.get().refuseSends) return true;
    if (error) *error = Error{kGeneralErrorDomain, 7, "refused by fake"};
    return false;
  }

  std::shared_ptr<FakeTelemetrySession> lastSession() const {
    auto all = created();
    return all.empty() ? nullptr : all.back().session;
  }
  void dropHeld() { for (auto& c : created()) c.session->dropHeld(); }
  Recorder<CreatedSession> created;
  Recorder<OneShotMessage> oneShots;

 private:
  Locked<TelemetryBehaviour> behaviour_;
  std::atomic<int> tokens_{0};
};

struct AnalyticsEvent { std::string name; Dictionary payload; };

struct FakeAnalyticsService : AnalyticsService {
  void sendEventLazy(std::string_view name, const std::function<Dictionary()>& payload) override {
    if (onCall) onCall();
    if (unwanted_.with([&](auto& u) { return u.count(std::string(name)) != 0; })) return skipped.add(std::string(name));
    events.add({std::string(name), payload ? payload() : Dictionary{}});  // built outside the lock
  }
  // Events of this name are not wanted: their payload is never built.
  void addUnwanted(std::string name) { unwanted_.with([&](auto& u) { u.insert(std::move(name)); }); }
  std::function<void()> onCall;  // runs first in every call; set before any thread runs
  Recorder<AnalyticsEvent> events;
  Recorder<std::string> skipped;
  Locked<std::set<std::string>> unwanted_;
};

struct EnergyEvent { int client = 0; std::string name; Dictionary event; };

struct FakeEnergyLogService : EnergyLogService {
  void logEvent(int client, std::string_view name, const Dictionary& event) override {
    if (onCall) onCall();
    events.add({client, std::string(name), event});
  }
  std::function<void()> onCall;  // runs first in every call; set before any thread runs
  Recorder<EnergyEvent> events;
};

struct FakeDefaultsStore : DefaultsStore {
  std::optional<std::string> stringForKey(std::string_view suite, std::string_view key) override {
    return lookup(values_, {std::string(suite), std::string(key)});
  }
  // The tests only set lower-case booleans.
  bool boolForKey(std::string_view suite, std::string_view key) override {
    auto v = stringForKey(suite, key);
    return v == "1" || v == "yes" || v == "true" || v == "on";
  }
  void set(std::string suite, std::string key, std::string value) {
    values_.with([&](auto& v) { v[{std::move(suite), std::move(key)}] = std::move(value); });
  }
  void remove(const std::string& suite, const std::string& key) {
    values_.with([&](auto& v) { v.erase({suite, key}); });
  }
  Locked<std::map<std::pair<std::string, std::string>, std::string>> values_;
};

struct FakeNotificationService : NotificationService {
  int registerDispatch(std::string name, std::shared_ptr<SerialQueue> queue, std::function<void(int)> handler,
                       int* token) override {
    int t = registrations_.with([&](auto& r) {
      r.push_back({std::move(name), std::move(queue), std::move(handler), static_cast<int>(r.size()) + 1});
      return r.back().token;
    });
    if (token) *token = t;
    return 0;
  }
  void post(const std::string& name) {
    for (auto& r : registrations_.get())
      if (r.name == name) r.queue->async([handler = r.handler, t = r.token] { handler(t); });
  }
  void clear() { registrations_.set({}); }
  struct Registration {
    std::string name; std::shared_ptr<SerialQueue> queue; std::function<void(int)> handler; int token;
  };
  Recorder<Registration> registrations_;
};

// Answers "InternalBuild" and "DeviceClassNumber", when set.
struct FakeDeviceProperties : DeviceProperties {
  std::optional<bool> boolAnswer(std::string_view key) override {
    return key == "InternalBuild" ? internalBuild() : std::nullopt;
  }
  std::optional<std::int32_t> intAnswer(std::string_view key) override {
    return key == "DeviceClassNumber" ? deviceClass() : std::nullopt;
  }
  Locked<std::optional<bool>> internalBuild;
  Locked<std::optional<std::int32_t>> deviceClass;
};

// This process is 4242 "vireod"; other names are set by the test.
struct FakeProcessTable : ProcessTable {
  std::int32_t selfPid() const override { return 4242; }
  std::optional<std::string> selfName() const override { return "vireod"; }
  std::optional<std::string> shortName(std::int32_t pid) const override { return lookup(names_, pid); }
  void setName(std::int32_t pid, std::string name) { names_.with([&](auto& n) { n[pid] = std::move(name); }); }
  Locked<std::map<std::int32_t, std::string>> names_;
};

// In-memory files under a fixed log directory.
struct FakeDiagnosticFiles : DiagnosticFiles {
  std::string logDirectory() const override { return "/fake/logs"; }
  bool createDirectory(const std::string& path, unsigned, Error* error) override {
    if (auto failure = createDirectoryError()) {
      if (error) *error = *failure;
      return false;
    }
    directories.with([&](auto& d) { d.insert(path); });
    return true;
  }
  bool writeAtomically(const std::string& path, std::string_view text, Error*) override {
    files.with([&](auto& f) { f[path] = std::string(text); });
    return true;
  }
  Locked<std::map<std::string, std::string>> files;
  Locked<std::set<std::string>> directories;
  Locked<std::optional<Error>> createDirectoryError;
};

// One driver ("Speaker", no subgroup) with one channel "X" whose value the test sets;
// deltas are later minus earlier. Every other driver has no channels.
struct FakeDriverStats : DriverStatsLibrary {
  struct Channels : DriverChannelSet {
    explicit Channels(bool s) : speaker(s) {}
    bool speaker;
  };
  struct Subscribed : DriverSubscribedChannels {
    std::unique_ptr<DriverSubscribedChannels> copy() const override { return std::make_unique<Subscribed>(); }
  };
  struct Samples : DriverSampleSet, DriverChannel {
    explicit Samples(std::int64_t v) : value(v) {}
    std::unique_ptr<DriverSampleSet> copy() const override { return std::make_unique<Samples>(value); }
    std::int64_t value;
  };

  void setValue(std::int64_t v) { value_ = v; }
  std::unique_ptr<DriverChannelSet> copyChannelsInGroup(const std::optional<std::string>& group,
                                                        const std::optional<std::string>&, std::uint64_t,
                                                        std::optional<DriverStatsError>*) override {
    return std::make_unique<Channels>(group == "Speaker");
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
    return std::make_unique<Samples>(value_);
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
  std::atomic<std::int64_t> value_{0};
};

struct FakeProcessControl : ProcessControl {
  [[noreturn]] void exitProcess(int status) override { throw status; }  // a test may catch the status
};

// Keeps the registered handlers; a test calls them as the service's thread would.
// calls records "register device ID", "unregister ui ID", ... in order.
struct FakeOrientationService : OrientationService {
  using Handlers = std::map<std::string, OrientationHandler>;
  void registerDeviceOrientationHandler(const std::string& id, OrientationHandler h) override {
    calls.add("register device " + id);
    device.with([&](Handlers& m) { m[id] = std::move(h); });
  }
  void registerInterfaceOrientationHandler(const std::string& id, OrientationHandler h) override {
    calls.add("register ui " + id);
    ui.with([&](Handlers& m) { m[id] = std::move(h); });
  }
  void unregisterDeviceOrientationHandler(const std::string& id) override {
    calls.add("unregister device " + id);
    drop(device, id);
  }
  void unregisterInterfaceOrientationHandler(const std::string& id) override {
    calls.add("unregister ui " + id);
    drop(ui, id);
  }
  // Calls every handler of the kind with the orientation.
  static void fire(const Locked<Handlers>& handlers, Orientation o) {
    for (auto& [id, h] : handlers()) h(o);
  }
  static void drop(Locked<Handlers>& handlers, const std::string& id) {
    OrientationHandler old;  // may own a session: let it go outside the lock
    handlers.with([&](Handlers& m) {
      if (auto it = m.find(id); it != m.end()) old = std::move(it->second), m.erase(it);
    });
  }
  Recorder<std::string> calls;
  Locked<Handlers> device, ui;
};

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
  FakeOrientationService orientation;
  ManualDispatcher dispatcher;

  Platform platform = over(dispatcher);
  std::shared_ptr<ReportingEnvironment> env = std::make_shared<ReportingEnvironment>(platform);

  ~FakePlatform() {
    analytics.onCall = energyLog.onCall = nullptr;
    telemetry.dropHeld();
    notifications.clear();
    dispatcher.clear();
    orientation.device.set({});
    orientation.ui.set({});
  }

  void setInternalBuild(bool internal) { device.internalBuild.set(internal); }
  // These fakes over another dispatcher (the thread tests use the real pool).
  Platform over(Dispatcher& d) {
    return {logger,        tracer, clock,     random, d,           telemetry, analytics, energyLog, defaults,
            notifications, device, processes, files,  driverStats, process,   orientation};
  }
};

}  // namespace vireo::testing
