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
  T operator()() const { return with([](T& v) { return v; }); }
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

template <typename M>
std::optional<typename M::mapped_type> lookup(const Locked<M>& map, const typename M::key_type& key) {
  return map.with([&](M& m) { return m.count(key) ? std::optional(m.at(key)) : std::nullopt; });
}

struct LogEntry { LogScope scope; LogLevel level; std::string function, message; };

struct RecordingLogger : Logger {
  bool verbose(LogScope scope) const override { return verbose_.with([&](auto& s) { return s.count(scope) != 0; }); }
  void write(LogScope scope, LogLevel level, const char*, int, const char* function,
             std::string_view message) override {
    entries.add({scope, level, function ? function : "", std::string(message)});
  }
  void setVerbose(LogScope scope) { verbose_.with([&](auto& s) { s.insert(scope); }); }
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
  std::size_t count(std::uint32_t code) const { return codes.with([&](auto& c) { return std::ranges::count(c, code); }); }
  Recorder<std::uint32_t> codes;
};

struct FakeClock : Clock {
  WallTime now() const override { return WallTime(std::chrono::seconds(1'700'000'000)) + moved(); }
  void advance(std::chrono::nanoseconds d) {
    moved.with([&](WallTime::duration& m) { m += std::chrono::duration_cast<WallTime::duration>(d); });
  }
  Locked<WallTime::duration> moved;
};

// Answers next once (reduced below the bound), then 0.
struct FakeRandom : RandomSource {
  std::uint32_t uniformBelow(std::uint32_t bound) override { return bound == 0 ? 0 : next.exchange(0) % bound; }
  std::atomic<std::uint32_t> next{0};
};

class ManualQueue;

// A park of a ManualQueue; it holds the queue and the timeout closure until it ends.
// Made without a queue, it is spent from the start.
class ManualParking : public Parking {
 public:
  explicit ManualParking(std::shared_ptr<ManualQueue> queue = nullptr, Task onTimeout = nullptr) {
    held_.set(Held{std::move(queue), std::move(onTimeout)});
  }
  bool resume(Task next) override { return end(std::move(next), false); }
  inline bool end(Task next, bool timedOut);
  // Lets go of the queue and the timeout closure unrun.
  void spend() { held_.set({}); }

 private:
  struct Held { std::shared_ptr<ManualQueue> queue; Task onTimeout; };
  Locked<Held> held_;
};

// A serial queue run by hand. A park stops it until resumed, or until its dispatcher's
// manual time passes the deadline (ManualDispatcher::advance).
class ManualQueue : public SerialQueue, public std::enable_shared_from_this<ManualQueue> {
 public:
  using Nanos = std::chrono::nanoseconds;
  // now: the manual time deadlines are measured on (the dispatcher's); a queue of its own otherwise.
  explicit ManualQueue(std::string label, std::shared_ptr<Locked<Nanos>> now = std::make_shared<Locked<Nanos>>())
      : label_(std::move(label)), now_(std::move(now)) {}
  void async(Task task) override { state_.with([&](State& s) { s.tasks.push_back(std::move(task)); }); }
  const std::string& label() const override { return label_; }
  std::shared_ptr<Parking> park(Nanos timeout, Task onTimeout) override {
    auto parking = std::make_shared<ManualParking>(shared_from_this(), std::move(onTimeout));
    const Nanos due = (*now_)() + timeout;
    if (state_.with([&](State& s) { return !s.park && (s.park = parking, s.due = due, true); })) return parking;
    parking->spend();
    return std::make_shared<ManualParking>();
  }
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
  // The pending park, if any, and its deadline on the manual time.
  std::pair<Nanos, std::shared_ptr<ManualParking>> pending() const {
    return state_.with([](State& s) { return std::pair(s.due, s.park); });
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

 private:
  struct State {
    std::deque<Task> tasks;
    std::shared_ptr<ManualParking> park;
    Nanos due{};
  };
  const std::string label_;
  const std::shared_ptr<Locked<Nanos>> now_;
  Locked<State> state_;
};

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
  std::shared_ptr<SerialQueue> makeSerialQueue(std::string label, QoS) override {
    auto q = std::make_shared<ManualQueue>(std::move(label), now_);
    queues_.add(q);
    return q;
  }
  void asyncLowPriority(std::chrono::nanoseconds delay, Task task) override {
    lowPriorityDelays.add(delay);
    lowPriority_.with([&](auto& l) { l.push_back(std::move(task)); });
  }

  // Runs serial-queue closures, including ones submitted meanwhile, until none is
  // left that may run; low-priority closures stay held, parked queues stay parked.
  void runAll() {
    for (bool ran = true; ran;) {
      ran = false;
      for (auto& q : queues()) ran = q->runOne() || ran;
    }
  }
  // Runs low-priority closures, including ones submitted meanwhile, in order.
  std::size_t runLowPriority() {
    std::size_t n = 0;
    for (std::deque<Task> batch; !(batch = lowPriority_.with([](auto& l) { return std::exchange(l, {}); })).empty();)
      for (Task& t : batch) {
        if (t) t();
        ++n;
      }
    return n;
  }
  void runUntilIdle() { do runAll(); while (runLowPriority() != 0); }
  Recorder<std::chrono::nanoseconds> lowPriorityDelays;

  // Moves the manual time on; parks whose deadline has passed time out (their timeout
  // closures then wait for runAll). Returns how many timed out.
  std::size_t advance(std::chrono::nanoseconds d) {
    const auto now = now_->with([&](auto& t) { return t += d; });
    std::size_t n = 0;
    for (auto& q : queues())
      if (auto [due, park] = q->pending(); park && due <= now) n += park->end(nullptr, true) ? 1 : 0;
    return n;
  }
  std::size_t parkedCount() const {
    return std::ranges::count_if(queues(), [](auto& q) { return q->pending().second != nullptr; });
  }
  // Waits (on the real clock) until another thread has resumed every parked queue.
  bool awaitUnparked() const {
    for (auto until = std::chrono::steady_clock::now() + std::chrono::seconds(10); parkedCount() != 0;) {
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
    for (const auto& w : queues_())
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
    ++flushes;
    if (completion) completion(std::nullopt);
  }
  std::string description() const override { return "<FakeTelemetrySession>"; }

  // Drops a completion held by BackendAnswer::Never (it may hold engine objects).
  void dropHeld() { held_.set(nullptr); }
  Recorder<SentMessage> sent;
  std::atomic<int> flushes{0};

 private:
  const TelemetryBehaviour behaviour_;
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
    auto s = std::make_shared<FakeTelemetrySession>(behaviour_());
    created.add({sessionInfo, userInfo, s});
    return s;
  }
  bool sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo, std::uint16_t category,
                      std::uint16_t type, const Dictionary& payload, std::optional<Error>* error) override {
    oneShots.add({{category, type, payload}, sessionInfo, userInfo});
    if (!behaviour_().refuseSends) return true;
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
    events.add({std::string(name), payload ? payload() : Dictionary{}});  // built outside the lock
  }
  std::function<void()> onCall;  // runs first in every call; set before any thread runs
  Recorder<AnalyticsEvent> events;
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

// Suite and key to value; the tests only set lower-case booleans.
struct FakeDefaultsStore : DefaultsStore {
  std::optional<std::string> stringForKey(std::string_view suite, std::string_view key) override {
    return lookup(values, {std::string(suite), std::string(key)});
  }
  bool boolForKey(std::string_view suite, std::string_view key) override {
    auto v = stringForKey(suite, key);
    return v == "1" || v == "yes" || v == "true" || v == "on";
  }
  // A key of the service's own suite; nullopt removes it.
  void set(const std::string& key, std::optional<std::string> value) {
    values.with([&](auto& v) {
      if (value) v[{"com.orvane.vireo", key}] = *value;
      else v.erase({"com.orvane.vireo", key});
    });
  }
  Locked<std::map<std::pair<std::string, std::string>, std::string>> values;
};

struct FakeNotificationService : NotificationService {
  int registerDispatch(std::string name, std::shared_ptr<SerialQueue> queue, std::function<void(int)> handler,
                       int* token) override {
    int t = registrations.with([&](auto& r) {
      r.push_back({std::move(name), std::move(queue), std::move(handler), static_cast<int>(r.size()) + 1});
      return r.back().token;
    });
    if (token) *token = t;
    return 0;
  }
  void post(const std::string& name) {
    for (auto& r : registrations())
      if (r.name == name) r.queue->async([handler = r.handler, t = r.token] { handler(t); });
  }
  struct Registration {
    std::string name; std::shared_ptr<SerialQueue> queue; std::function<void(int)> handler; int token;
  };
  Recorder<Registration> registrations;
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
  std::optional<std::string> shortName(std::int32_t pid) const override { return lookup(names, pid); }
  void setName(std::int32_t pid, std::string name) { names.with([&](auto& n) { n[pid] = std::move(name); }); }
  Locked<std::map<std::int32_t, std::string>> names;
};

// In-memory files under a fixed log directory.
struct FakeDiagnosticFiles : DiagnosticFiles {
  std::string logDirectory() const override { return "/fake/logs"; }
  bool createDirectory(const std::string&, unsigned, Error* error) override {
    if (auto failure = createDirectoryError()) return *error = *failure, false;
    return true;
  }
  bool writeAtomically(const std::string& path, std::string_view text, Error*) override {
    files.with([&](auto& f) { f[path] = std::string(text); });
    return true;
  }
  Locked<std::map<std::string, std::string>> files;
  Locked<std::optional<Error>> createDirectoryError;
};

// No driver has statistics (the driver utility has its own tests over a scripted library).
struct FakeDriverStats : DriverStatsLibrary {
  using StatsError = std::optional<DriverStatsError>*;
  std::unique_ptr<DriverChannelSet> copyChannelsInGroup(const std::optional<std::string>&,
                                                        const std::optional<std::string>&, std::uint64_t,
                                                        StatsError) override { return nullptr; }
  std::int32_t channelCount(const DriverChannelSet&) override { return 0; }
  DriverSubscriptionHandle createSubscription(const DriverChannelSet&,
                                              std::unique_ptr<DriverSubscribedChannels>*) override { return nullptr; }
  std::unique_ptr<DriverSampleSet> createSamples(DriverSubscriptionHandle, const DriverSubscribedChannels&,
                                                 StatsError) override { return nullptr; }
  std::unique_ptr<DriverSampleSet> createSamplesDelta(const DriverSampleSet*, const DriverSampleSet&,
                                                      StatsError) override { return nullptr; }
  void iterate(const DriverSampleSet&, const std::function<DriverIterate(const DriverChannel&)>&) override {}
  std::optional<std::string> channelName(const DriverChannel&) override { return std::nullopt; }
  std::int64_t simpleIntegerValue(const DriverChannel&) override { return 0; }
};

struct FakeProcessControl : ProcessControl {
  [[noreturn]] void exitProcess(int status) override { throw status; }  // a test may catch the status
};

// Keeps the registered handlers; a test calls them as the service's thread would.
// calls records "register device ID", "unregister ui ID", ... in order.
struct FakeOrientationService : OrientationService {
  using Handlers = std::map<std::string, OrientationHandler>;
  void registerDeviceOrientationHandler(const std::string& id, OrientationHandler h) override {
    change("register device ", device, id, std::move(h));
  }
  void registerInterfaceOrientationHandler(const std::string& id, OrientationHandler h) override {
    change("register ui ", ui, id, std::move(h));
  }
  void unregisterDeviceOrientationHandler(const std::string& id) override { change("unregister device ", device, id, {}); }
  void unregisterInterfaceOrientationHandler(const std::string& id) override { change("unregister ui ", ui, id, {}); }
  // Calls every handler of the kind with the orientation.
  static void fire(const Locked<Handlers>& handlers, Orientation o) {
    for (auto& [id, h] : handlers()) h(o);
  }
  void change(const std::string& what, Locked<Handlers>& handlers, const std::string& id, OrientationHandler h) {
    calls.add(what + id);
    handlers.with([&](Handlers& m) {
      std::swap(m[id], h);
      if (!m[id]) m.erase(id);
    });  // h, now the old handler, may own a session: it goes after the lock is released
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
    notifications.registrations.set({});
    dispatcher.clear();
    orientation.device.set({});
    orientation.ui.set({});
  }

  // These fakes over another dispatcher (the thread tests use the real pool).
  Platform over(Dispatcher& d) {
    return {logger,        tracer, clock,     random, d,           telemetry, analytics, energyLog, defaults,
            notifications, device, processes, files,  driverStats, process,   orientation};
  }
};

}  // namespace vireo::testing
