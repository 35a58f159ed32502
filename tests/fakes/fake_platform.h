// Recording fakes of every platform interface, and FakePlatform, which owns one of
// each and hands them out as a Platform bundle and a ReportingEnvironment.
//
// Everything is deterministic: queued closures run only when a test asks
// (ManualDispatcher), time moves only when a test moves it, random numbers are
// scripted, and nothing touches the file system.
#pragma once

#include <algorithm>
#include <atomic>
#include <cctype>
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

// ---------------------------------------------------------------- logging

struct LogEntry {
  LogScope scope;
  LogLevel level;
  std::string file;
  int line = 0;
  std::string function;
  std::string message;
};

class RecordingLogger : public Logger {
 public:
  bool verbose(LogScope scope) const override {
    std::lock_guard<std::mutex> guard(lock_);
    return verbose_.count(scope) != 0;
  }
  void write(LogScope scope, LogLevel level, const char* file, int line, const char* function,
             std::string_view message) override {
    std::lock_guard<std::mutex> guard(lock_);
    entries_.push_back({scope, level, file ? file : "", line, function ? function : "", std::string(message)});
  }

  void setVerbose(LogScope scope, bool on) {
    std::lock_guard<std::mutex> guard(lock_);
    if (on)
      verbose_.insert(scope);
    else
      verbose_.erase(scope);
  }
  std::vector<LogEntry> entries() const {
    std::lock_guard<std::mutex> guard(lock_);
    return entries_;
  }
  // Entries whose message contains text.
  std::vector<LogEntry> matching(std::string_view text) const {
    std::lock_guard<std::mutex> guard(lock_);
    std::vector<LogEntry> out;
    for (const auto& e : entries_)
      if (e.message.find(text) != std::string::npos) out.push_back(e);
    return out;
  }
  bool contains(std::string_view text) const { return count(text) > 0; }
  std::size_t count(std::string_view text) const { return matching(text).size(); }
  std::size_t size() const {
    std::lock_guard<std::mutex> guard(lock_);
    return entries_.size();
  }
  void clear() {
    std::lock_guard<std::mutex> guard(lock_);
    entries_.clear();
  }

 private:
  mutable std::mutex lock_;  // guards entries_ and verbose_
  std::vector<LogEntry> entries_;
  std::set<LogScope> verbose_;
};

class RecordingTracer : public Tracer {
 public:
  void emit(std::uint32_t code) override {
    std::lock_guard<std::mutex> guard(lock_);
    codes_.push_back(code);
  }
  std::vector<std::uint32_t> codes() const {
    std::lock_guard<std::mutex> guard(lock_);
    return codes_;
  }
  std::size_t count(std::uint32_t code) const {
    std::lock_guard<std::mutex> guard(lock_);
    return static_cast<std::size_t>(std::count(codes_.begin(), codes_.end(), code));
  }

 private:
  mutable std::mutex lock_;  // guards codes_
  std::vector<std::uint32_t> codes_;
};

// ---------------------------------------------------------------- time and chance

class FakeClock : public Clock {
 public:
  WallTime now() const override {
    std::lock_guard<std::mutex> guard(lock_);
    return now_;
  }
  void set(WallTime t) {
    std::lock_guard<std::mutex> guard(lock_);
    now_ = t;
  }
  void setUnixSeconds(double seconds) {
    set(WallTime(std::chrono::duration_cast<WallTime::duration>(std::chrono::duration<double>(seconds))));
  }
  void advance(std::chrono::nanoseconds d) {
    std::lock_guard<std::mutex> guard(lock_);
    now_ += std::chrono::duration_cast<WallTime::duration>(d);
  }

 private:
  mutable std::mutex lock_;  // guards now_
  WallTime now_ = WallTime(std::chrono::seconds(1'700'000'000));
};

// Returns the scripted values in order (each reduced below the bound), then 0.
class FakeRandom : public RandomSource {
 public:
  std::uint32_t uniformBelow(std::uint32_t bound) override {
    std::lock_guard<std::mutex> guard(lock_);
    bounds_.push_back(bound);
    std::uint32_t v = 0;
    if (!script_.empty()) {
      v = script_.front();
      script_.pop_front();
    }
    return bound == 0 ? 0 : v % bound;
  }
  void script(std::initializer_list<std::uint32_t> values) {
    std::lock_guard<std::mutex> guard(lock_);
    script_.insert(script_.end(), values.begin(), values.end());
  }
  std::vector<std::uint32_t> boundsAsked() const {
    std::lock_guard<std::mutex> guard(lock_);
    return bounds_;
  }

 private:
  mutable std::mutex lock_;  // guards script_ and bounds_
  std::deque<std::uint32_t> script_;
  std::vector<std::uint32_t> bounds_;
};

// ---------------------------------------------------------------- dispatch

class ManualQueue : public SerialQueue {
 public:
  ManualQueue(std::string label, QoS qos) : label_(std::move(label)), qos_(qos) {}
  void async(Task task) override {
    std::lock_guard<std::mutex> guard(lock_);
    tasks_.push_back(std::move(task));
  }
  const std::string& label() const override { return label_; }
  QoS qos() const { return qos_; }

  std::size_t pending() const {
    std::lock_guard<std::mutex> guard(lock_);
    return tasks_.size();
  }
  // Runs the oldest held closure; false when there was none.
  bool runOne() {
    Task task;
    {
      std::lock_guard<std::mutex> guard(lock_);
      if (tasks_.empty()) return false;
      task = std::move(tasks_.front());
      tasks_.pop_front();
    }
    if (task) task();
    return true;
  }
  // Runs closures (including those they submit) until the queue is empty.
  std::size_t runAll() {
    std::size_t n = 0;
    while (runOne()) ++n;
    return n;
  }
  void clear() {
    std::deque<Task> dropped;
    {
      std::lock_guard<std::mutex> guard(lock_);
      dropped.swap(tasks_);
    }
  }

 private:
  const std::string label_;
  const QoS qos_;
  mutable std::mutex lock_;  // guards tasks_
  std::deque<Task> tasks_;
};

struct LowPriorityTask {
  std::chrono::nanoseconds delay{0};
  Task task;
};

// Holds every submitted closure until the test runs it. Closures run on the test's
// thread, one at a time; queues are visited in creation order.
class ManualDispatcher : public Dispatcher {
 public:
  ~ManualDispatcher() override { clear(); }

  std::shared_ptr<SerialQueue> makeSerialQueue(std::string label, QoS qos) override {
    auto q = std::make_shared<ManualQueue>(std::move(label), qos);
    std::lock_guard<std::mutex> guard(lock_);
    queues_.push_back(q);
    return q;
  }
  void asyncLowPriority(std::chrono::nanoseconds delay, Task task) override {
    std::lock_guard<std::mutex> guard(lock_);
    lowPriorityDelays_.push_back(delay);
    lowPriority_.push_back({delay, std::move(task)});
  }

  std::vector<std::shared_ptr<ManualQueue>> queues() const {
    std::lock_guard<std::mutex> guard(lock_);
    std::vector<std::shared_ptr<ManualQueue>> out;
    for (const auto& w : queues_)
      if (auto q = w.lock()) out.push_back(q);
    return out;
  }
  std::shared_ptr<ManualQueue> queue(std::string_view label) const {
    for (auto& q : queues())
      if (q->label() == label) return q;
    return nullptr;
  }
  // Serial-queue closures waiting to run.
  std::size_t pending() const {
    std::size_t n = 0;
    for (auto& q : queues()) n += q->pending();
    return n;
  }
  // Runs every serial-queue closure, including ones submitted meanwhile; low-priority
  // closures stay held. Returns how many ran.
  std::size_t runAll() {
    std::size_t total = 0;
    for (;;) {
      std::size_t ran = 0;
      for (auto& q : queues())
        if (q->runOne()) ++ran;
      if (ran == 0) return total;
      total += ran;
    }
  }
  // Runs serial and low-priority closures until nothing is left.
  std::size_t runUntilIdle() {
    std::size_t total = 0;
    for (;;) {
      std::size_t ran = runAll() + runLowPriority();
      if (ran == 0) return total;
      total += ran;
    }
  }
  // Runs the held low-priority closures (not their delays: those are only recorded).
  std::size_t runLowPriority() {
    std::size_t n = 0;
    for (;;) {
      LowPriorityTask t;
      {
        std::lock_guard<std::mutex> guard(lock_);
        if (lowPriority_.empty()) return n;
        t = std::move(lowPriority_.front());
        lowPriority_.pop_front();
      }
      if (t.task) t.task();
      ++n;
    }
  }
  std::size_t pendingLowPriority() const {
    std::lock_guard<std::mutex> guard(lock_);
    return lowPriority_.size();
  }
  // Delay of every low-priority submission so far, run or not.
  std::vector<std::chrono::nanoseconds> lowPriorityDelays() const {
    std::lock_guard<std::mutex> guard(lock_);
    return lowPriorityDelays_;
  }
  // Drops every held closure without running it.
  void clear() {
    std::deque<LowPriorityTask> dropped;
    {
      std::lock_guard<std::mutex> guard(lock_);
      dropped.swap(lowPriority_);
    }
    for (auto& q : queues()) q->clear();
  }

 private:
  mutable std::mutex lock_;  // guards queues_, lowPriority_, lowPriorityDelays_
  // Weak: a queue lives as long as its owner; the dispatcher only needs to find it.
  std::vector<std::weak_ptr<ManualQueue>> queues_;
  std::deque<LowPriorityTask> lowPriority_;
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
  Never,      // the completion is kept and never called unless the test does
};

struct TelemetryBehaviour {
  BackendAnswer answer = BackendAnswer::List;
  std::vector<std::string> backends{"backend-1"};
  // Answer from a separate thread, as the real service does, instead of inside
  // startConfiguration.
  bool answerOnOwnThread = false;
  bool refuseSends = false;
  std::optional<Error> flushError;
};

class FakeTelemetrySession : public TelemetrySession {
 public:
  FakeTelemetrySession(std::string name, TelemetryBehaviour behaviour)
      : name_(std::move(name)), behaviour_(std::move(behaviour)) {}
  ~FakeTelemetrySession() override {
    if (answerThread_.joinable()) answerThread_.join();
  }

  void startConfiguration(std::function<void(std::optional<std::vector<std::string>>)> completion) override {
    std::optional<std::vector<std::string>> answer;
    {
      std::lock_guard<std::mutex> guard(lock_);
      ++configurationStarts_;
      switch (behaviour_.answer) {
        case BackendAnswer::List: answer = behaviour_.backends; break;
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
                   std::optional<Error>* error) override {
    std::lock_guard<std::mutex> guard(lock_);
    if (behaviour_.refuseSends) {
      if (error) *error = Error{kGeneralErrorDomain, 7, "refused by fake"};
      refused_.push_back({category, type, payload});
      return false;
    }
    sent_.push_back({category, type, payload});
    return true;
  }
  void flushMessages(std::function<void(std::optional<Error>)> completion) override {
    std::optional<Error> err;
    {
      std::lock_guard<std::mutex> guard(lock_);
      ++flushes_;
      err = behaviour_.flushError;
    }
    if (completion) completion(err);
  }
  std::string description() const override { return "<FakeTelemetrySession " + name_ + ">"; }

  std::vector<SentMessage> sent() const {
    std::lock_guard<std::mutex> guard(lock_);
    return sent_;
  }
  std::vector<SentMessage> refused() const {
    std::lock_guard<std::mutex> guard(lock_);
    return refused_;
  }
  int flushes() const {
    std::lock_guard<std::mutex> guard(lock_);
    return flushes_;
  }
  int configurationStarts() const {
    std::lock_guard<std::mutex> guard(lock_);
    return configurationStarts_;
  }
  // Answers a held completion (BackendAnswer::Never) now; false when none is held.
  bool answerHeld(std::optional<std::vector<std::string>> backends) {
    std::function<void(std::optional<std::vector<std::string>>)> c;
    {
      std::lock_guard<std::mutex> guard(lock_);
      c = std::move(heldCompletion_);
      heldCompletion_ = nullptr;
    }
    if (!c) return false;
    c(std::move(backends));
    return true;
  }
  void dropHeld() {
    std::function<void(std::optional<std::vector<std::string>>)> c;
    std::lock_guard<std::mutex> guard(lock_);
    c.swap(heldCompletion_);
  }

 private:
  const std::string name_;
  mutable std::mutex lock_;  // guards every field below
  TelemetryBehaviour behaviour_;
  std::vector<SentMessage> sent_;
  std::vector<SentMessage> refused_;
  int flushes_ = 0;
  int configurationStarts_ = 0;
  std::function<void(std::optional<std::vector<std::string>>)> heldCompletion_;
  std::thread answerThread_;
};

struct CreatedSession {
  Dictionary sessionInfo;
  Dictionary userInfo;
  std::vector<std::string> frameworksToCheck;
  std::shared_ptr<FakeTelemetrySession> session;
};

class FakeTelemetryService : public TelemetryService {
 public:
  // Applies to sessions created and one-shot sends made from now on.
  void setBehaviour(TelemetryBehaviour behaviour) {
    std::lock_guard<std::mutex> guard(lock_);
    behaviour_ = std::move(behaviour);
  }
  TelemetryBehaviour behaviour() const {
    std::lock_guard<std::mutex> guard(lock_);
    return behaviour_;
  }
  void setAnswer(BackendAnswer answer) {
    std::lock_guard<std::mutex> guard(lock_);
    behaviour_.answer = answer;
  }
  void setRefuseSends(bool refuse) {
    std::lock_guard<std::mutex> guard(lock_);
    behaviour_.refuseSends = refuse;
  }
  // When set, createSession returns nothing.
  void setFailCreate(bool fail) {
    std::lock_guard<std::mutex> guard(lock_);
    failCreate_ = fail;
  }

  std::shared_ptr<HierarchyToken> makeHierarchyToken() override {
    std::lock_guard<std::mutex> guard(lock_);
    return std::make_shared<HierarchyToken>(HierarchyToken{"token-" + std::to_string(++tokens_)});
  }
  std::shared_ptr<TelemetrySession> createSession(const Dictionary& sessionInfo, const Dictionary& userInfo,
                                                  const std::vector<std::string>& frameworksToCheck) override {
    std::lock_guard<std::mutex> guard(lock_);
    if (failCreate_) return nullptr;
    auto s = std::make_shared<FakeTelemetrySession>(std::to_string(created_.size() + 1), behaviour_);
    created_.push_back({sessionInfo, userInfo, frameworksToCheck, s});
    return s;
  }
  bool sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo, std::uint16_t category,
                      std::uint16_t type, const Dictionary& payload, std::optional<Error>* error) override {
    std::lock_guard<std::mutex> guard(lock_);
    oneShots_.push_back({sessionInfo, userInfo, category, type, payload});
    if (behaviour_.refuseSends) {
      if (error) *error = Error{kGeneralErrorDomain, 7, "refused by fake"};
      return false;
    }
    return true;
  }

  std::vector<CreatedSession> created() const {
    std::lock_guard<std::mutex> guard(lock_);
    return created_;
  }
  std::shared_ptr<FakeTelemetrySession> lastSession() const {
    std::lock_guard<std::mutex> guard(lock_);
    return created_.empty() ? nullptr : created_.back().session;
  }
  std::vector<OneShotMessage> oneShots() const {
    std::lock_guard<std::mutex> guard(lock_);
    return oneShots_;
  }
  // Drops completions the sessions still hold (they may hold engine objects).
  void dropHeld() {
    for (auto& c : created()) c.session->dropHeld();
  }

 private:
  mutable std::mutex lock_;  // guards every field below
  TelemetryBehaviour behaviour_;
  bool failCreate_ = false;
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
    {
      std::lock_guard<std::mutex> guard(lock_);
      if (unwanted_.count(std::string(name))) {
        skipped_.emplace_back(name);
        return;
      }
    }
    Dictionary d = payload ? payload() : Dictionary{};
    std::lock_guard<std::mutex> guard(lock_);
    events_.push_back({std::string(name), std::move(d)});
  }
  // Events of this name are not wanted: their payload is never built.
  void addUnwanted(std::string name) {
    std::lock_guard<std::mutex> guard(lock_);
    unwanted_.insert(std::move(name));
  }
  std::vector<AnalyticsEvent> events() const {
    std::lock_guard<std::mutex> guard(lock_);
    return events_;
  }
  std::vector<std::string> skipped() const {
    std::lock_guard<std::mutex> guard(lock_);
    return skipped_;
  }

 private:
  mutable std::mutex lock_;  // guards every field below
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
    std::lock_guard<std::mutex> guard(lock_);
    events_.push_back({client, std::string(name), event});
  }
  std::vector<EnergyEvent> events() const {
    std::lock_guard<std::mutex> guard(lock_);
    return events_;
  }

 private:
  mutable std::mutex lock_;  // guards events_
  std::vector<EnergyEvent> events_;
};

// ---------------------------------------------------------------- defaults

class FakeDefaultsStore : public DefaultsStore {
 public:
  std::optional<std::string> stringForKey(std::string_view suite, std::string_view key) override {
    std::lock_guard<std::mutex> guard(lock_);
    auto it = values_.find({std::string(suite), std::string(key)});
    if (it == values_.end()) return std::nullopt;
    return it->second;
  }
  // The store's boolean rules: 1 yes true on, case-insensitive.
  bool boolForKey(std::string_view suite, std::string_view key) override {
    auto v = stringForKey(suite, key);
    if (!v) return false;
    std::string s;
    for (char c : *v)
      if (!std::isspace(static_cast<unsigned char>(c))) s += static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return s == "1" || s == "yes" || s == "true" || s == "on";
  }
  void set(std::string suite, std::string key, std::string value) {
    std::lock_guard<std::mutex> guard(lock_);
    values_[{std::move(suite), std::move(key)}] = std::move(value);
  }
  void remove(const std::string& suite, const std::string& key) {
    std::lock_guard<std::mutex> guard(lock_);
    values_.erase({suite, key});
  }

 private:
  mutable std::mutex lock_;  // guards values_
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
    std::lock_guard<std::mutex> guard(lock_);
    if (status_ != 0) return status_;
    int t = ++lastToken_;
    if (token) *token = t;
    registrations_.push_back({std::move(name), std::move(queue), std::move(handler), t});
    return 0;
  }
  // Makes later registrations fail with status.
  void setStatus(int status) {
    std::lock_guard<std::mutex> guard(lock_);
    status_ = status;
  }
  // Queues every handler registered for name on its queue; returns how many.
  std::size_t post(const std::string& name) {
    std::vector<NotificationRegistration> regs;
    {
      std::lock_guard<std::mutex> guard(lock_);
      regs = registrations_;
    }
    std::size_t n = 0;
    for (auto& r : regs) {
      if (r.name != name) continue;
      auto handler = r.handler;
      int t = r.token;
      if (r.queue)
        r.queue->async([handler, t] { handler(t); });
      else
        handler(t);
      ++n;
    }
    return n;
  }
  std::vector<NotificationRegistration> registrations() const {
    std::lock_guard<std::mutex> guard(lock_);
    return registrations_;
  }
  void clear() {
    std::vector<NotificationRegistration> dropped;
    std::lock_guard<std::mutex> guard(lock_);
    dropped.swap(registrations_);
  }

 private:
  mutable std::mutex lock_;  // guards every field below
  int status_ = 0;
  int lastToken_ = 0;
  std::vector<NotificationRegistration> registrations_;
};

// ---------------------------------------------------------------- device

class FakeDeviceProperties : public DeviceProperties {
 public:
  std::optional<bool> boolAnswer(std::string_view key) override {
    std::lock_guard<std::mutex> guard(lock_);
    auto it = bools_.find(std::string(key));
    if (it == bools_.end()) return std::nullopt;
    return it->second;
  }
  std::optional<std::int32_t> intAnswer(std::string_view key) override {
    std::lock_guard<std::mutex> guard(lock_);
    auto it = ints_.find(std::string(key));
    if (it == ints_.end()) return std::nullopt;
    return it->second;
  }
  void setBool(std::string key, bool v) {
    std::lock_guard<std::mutex> guard(lock_);
    bools_[std::move(key)] = v;
  }
  void setInt(std::string key, std::int32_t v) {
    std::lock_guard<std::mutex> guard(lock_);
    ints_[std::move(key)] = v;
  }

 private:
  mutable std::mutex lock_;  // guards bools_ and ints_
  std::map<std::string, bool> bools_;
  std::map<std::string, std::int32_t> ints_;
};

class FakeProcessTable : public ProcessTable {
 public:
  std::int32_t selfPid() const override { return pid_.load(); }
  std::optional<std::string> selfName() const override {
    std::lock_guard<std::mutex> guard(lock_);
    return selfName_;
  }
  std::optional<std::string> shortName(std::int32_t pid) const override {
    std::lock_guard<std::mutex> guard(lock_);
    auto it = names_.find(pid);
    if (it == names_.end()) return std::nullopt;
    return it->second;
  }
  void setSelf(std::int32_t pid, std::optional<std::string> name) {
    pid_ = pid;
    std::lock_guard<std::mutex> guard(lock_);
    selfName_ = std::move(name);
  }
  void setName(std::int32_t pid, std::string name) {
    std::lock_guard<std::mutex> guard(lock_);
    names_[pid] = std::move(name);
  }

 private:
  std::atomic<std::int32_t> pid_{4242};
  mutable std::mutex lock_;  // guards selfName_ and names_
  std::optional<std::string> selfName_{"vireod"};
  std::map<std::int32_t, std::string> names_;
};

// In-memory files under a fixed log directory.
class FakeDiagnosticFiles : public DiagnosticFiles {
 public:
  std::string logDirectory() const override { return "/fake/logs"; }
  bool createDirectory(const std::string& path, unsigned /*mode*/, Error* error) override {
    std::lock_guard<std::mutex> guard(lock_);
    if (createError_) {
      if (error) *error = *createError_;
      return false;
    }
    directories_.insert(path);
    return true;
  }
  bool writeAtomically(const std::string& path, std::string_view text, Error* error) override {
    std::lock_guard<std::mutex> guard(lock_);
    if (writeError_) {
      if (error) *error = *writeError_;
      return false;
    }
    files_[path] = std::string(text);
    return true;
  }

  void failCreateDirectory(std::optional<Error> error) {
    std::lock_guard<std::mutex> guard(lock_);
    createError_ = std::move(error);
  }
  void failWrite(std::optional<Error> error) {
    std::lock_guard<std::mutex> guard(lock_);
    writeError_ = std::move(error);
  }
  std::map<std::string, std::string> files() const {
    std::lock_guard<std::mutex> guard(lock_);
    return files_;
  }
  std::set<std::string> directories() const {
    std::lock_guard<std::mutex> guard(lock_);
    return directories_;
  }

 private:
  mutable std::mutex lock_;  // guards every field below
  std::optional<Error> createError_;
  std::optional<Error> writeError_;
  std::map<std::string, std::string> files_;
  std::set<std::string> directories_;
};

// ---------------------------------------------------------------- driver statistics

// A library without channels: every group is empty.
class FakeDriverStatsLibrary : public DriverStatsLibrary {
 public:
  class EmptyChannelSet : public DriverChannelSet {};

  std::unique_ptr<DriverChannelSet> copyChannelsInGroup(const std::optional<std::string>& group,
                                                        const std::optional<std::string>& subGroup,
                                                        std::uint64_t /*options*/,
                                                        std::optional<DriverStatsError>* /*error*/) override {
    std::lock_guard<std::mutex> guard(lock_);
    groupsAsked_.push_back({group, subGroup});
    return std::make_unique<EmptyChannelSet>();
  }
  std::int32_t channelCount(const DriverChannelSet&) override { return 0; }
  DriverSubscriptionHandle createSubscription(const DriverChannelSet&,
                                              std::unique_ptr<DriverSubscribedChannels>*) override {
    return nullptr;
  }
  std::unique_ptr<DriverSampleSet> createSamples(DriverSubscriptionHandle, const DriverSubscribedChannels&,
                                                 std::optional<DriverStatsError>* error) override {
    if (error) *error = DriverStatsError{1};
    return nullptr;
  }
  std::unique_ptr<DriverSampleSet> createSamplesDelta(const DriverSampleSet*, const DriverSampleSet&,
                                                      std::optional<DriverStatsError>* error) override {
    if (error) *error = DriverStatsError{1};
    return nullptr;
  }
  void iterate(const DriverSampleSet&, const std::function<DriverIterate(const DriverChannel&)>&) override {}
  std::optional<std::string> channelName(const DriverChannel&) override { return std::nullopt; }
  std::int64_t simpleIntegerValue(const DriverChannel&) override { return 0; }

  std::vector<std::pair<std::optional<std::string>, std::optional<std::string>>> groupsAsked() const {
    std::lock_guard<std::mutex> guard(lock_);
    return groupsAsked_;
  }

 private:
  mutable std::mutex lock_;  // guards groupsAsked_
  std::vector<std::pair<std::optional<std::string>, std::optional<std::string>>> groupsAsked_;
};

// ---------------------------------------------------------------- process control

// Thrown by FakeProcessControl::exitProcess in place of ending the test.
struct ProcessExited {
  int status;
};

class FakeProcessControl : public ProcessControl {
 public:
  [[noreturn]] void exitProcess(int status) override {
    {
      std::lock_guard<std::mutex> guard(lock_);
      statuses_.push_back(status);
    }
    throw ProcessExited{status};
  }
  std::vector<int> statuses() const {
    std::lock_guard<std::mutex> guard(lock_);
    return statuses_;
  }

 private:
  mutable std::mutex lock_;  // guards statuses_
  std::vector<int> statuses_;
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
  FakeDriverStatsLibrary driverStats;
  FakeProcessControl process;
  ManualDispatcher dispatcher;

  Platform platform{logger,    tracer,        clock,  random,    dispatcher, telemetry,   analytics, energyLog,
                    defaults,  notifications, device, processes, files,      driverStats, process};
  std::shared_ptr<ReportingEnvironment> env = std::make_shared<ReportingEnvironment>(platform);

  FakePlatform() = default;
  FakePlatform(const FakePlatform&) = delete;
  FakePlatform& operator=(const FakePlatform&) = delete;
  ~FakePlatform() {
    telemetry.dropHeld();
    notifications.clear();
    dispatcher.clear();
  }

  void setInternalBuild(bool internal) { device.setBool("InternalBuild", internal); }
};

}  // namespace vireo::testing
