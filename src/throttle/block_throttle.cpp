// The throttle's worker thread, its timers and the submission path.
//
// The worker's "event loop" is a small timer set on the injected clock rather than
// a real event loop library: sd-event cannot run on simulated time.
#include "throttle/block_throttle.h"

#include <algorithm>
#include <exception>

namespace vireo {

namespace {

constexpr const char* kWorkerLabel = "-[VRReportingBlockThrottle init]_block_invoke";
constexpr const char* kAddLabel = "-[VRReportingBlockThrottle addMessageBlock:reporterID:message:category:type:]";
constexpr const char* kWaitLabel = "-[VRReportingBlockThrottle waitForCompletion]";

constexpr double kPassSleepSeconds = 0.1;
constexpr std::size_t kUnscheduledCapacity = 6;
constexpr unsigned kWaitSeconds = 5;
constexpr int kWaitPolls = 10;
constexpr double kWaitPollSeconds = 0.5;

}  // namespace

// ---- VRReportingBlockThrottleTimerWrapper ----

std::shared_ptr<const VRReportingBlockThrottleTimerWrapper::Block> VRReportingBlockThrottleTimerWrapper::block()
    const {
  MutexLock guard(blockLock_);
  return block_;
}

void VRReportingBlockThrottleTimerWrapper::setBlock(Block block) {
  setBlock(std::make_shared<const Block>(std::move(block)));
}

void VRReportingBlockThrottleTimerWrapper::setBlock(std::shared_ptr<const Block> block) {
  {
    MutexLock guard(blockLock_);
    block_.swap(block);
  }
  // The replaced closure is released here, outside the lock: its captures may do anything.
}

void VRReportingBlockThrottleTimerWrapper::sleepFor(double seconds) {
  timer_->setFireDate(timer_->clock().now() + ThrottleClock::durationFromSeconds(seconds));
}

// ---- VRReportingBlockThrottle ----

std::shared_ptr<VRReportingBlockThrottle> VRReportingBlockThrottle::make(Logger& logger,
                                                                         std::shared_ptr<ThrottleClock> clock) {
  if (!clock) clock = std::make_shared<SteadyThrottleClock>();
  auto throttle = std::make_shared<VRReportingBlockThrottle>(Passkey{}, logger, std::move(clock));
  // Counted before it starts, so simulated time cannot run ahead of the worker.
  throttle->clock_->threadJoins();
  try {
    throttle->queueThread_ = std::thread([self = throttle] { self->runWorker(); });
  } catch (...) {
    throttle->clock_->threadLeaves();
    throw;
  }
  throttle->queueThreadID_ = throttle->queueThread_.get_id();
  return throttle;
}

VRReportingBlockThrottle::VRReportingBlockThrottle(Passkey, Logger& logger, std::shared_ptr<ThrottleClock> clock)
    : logger_(logger), clock_(std::move(clock)) {
  unscheduledTimerKeys_.reserve(kUnscheduledCapacity);
}

// Runs on the worker itself when the worker held the last reference; stop() then
// detaches instead of joining.
VRReportingBlockThrottle::~VRReportingBlockThrottle() { stop(); }

void VRReportingBlockThrottle::stop() {
  std::call_once(stopOnce_, [this] {
    stopRequested_.store(true);
    setShouldKeepRunning(false);
    wakeWorker();
    if (!queueThread_.joinable()) return;
    if (std::this_thread::get_id() == queueThreadID_) {
      queueThread_.detach();
      return;
    }
    queueThread_.join();
    // The worker is gone: nothing will fire the entries left behind.
    std::unordered_map<std::string, std::shared_ptr<Wrapper>> dropped;
    {
      MutexLock guard(timersInFlightLock_);
      dropped.swap(timersInFlight_);
    }
    {
      MutexLock guard(unscheduledTimerKeysLock_);
      unscheduledTimerKeys_.clear();
    }
    for (auto& [key, wrapper] : dropped) wrapper->timer().invalidate();
  });
}

void VRReportingBlockThrottle::wakeWorker() {
  workerWake_.store(true);
  clock_->wake();
}

void VRReportingBlockThrottle::addMessageBlock(Block block, std::int64_t reporterID, const Dictionary& message,
                                               std::uint32_t category, std::uint32_t type) {
  std::string key = buildMessageKey(message, reporterID, category, type);
  double hold = determineSleepTime(message, logger_);

  std::shared_ptr<Wrapper> existing;
  {
    MutexLock guard(timersInFlightLock_);
    if (auto it = timersInFlight_.find(key); it != timersInFlight_.end()) existing = it->second;
  }
  std::shared_ptr<const Block> replacement;
  if (!existing) {
    auto wrapper = std::make_shared<Wrapper>();
    wrapper->setBlock(std::move(block));
    // The action neither owns the throttle nor the wrapper: it runs only on the
    // worker, which holds both while it runs, and owning them here would make every
    // pending entry a reference cycle.
    wrapper->setTimer(std::make_unique<ThrottleTimer>(
        clock_, clock_->now() + ThrottleClock::durationFromSeconds(hold),
        [this, key, weak = std::weak_ptr<Wrapper>(wrapper)] { fireEntry(key, weak); }));
    {
      MutexLock guard(timersInFlightLock_);
      auto [it, inserted] = timersInFlight_.try_emplace(key, wrapper);
      if (!inserted) existing = it->second;  // another submitter got there first
    }
    if (!existing) {
      MutexLock guard(unscheduledTimerKeysLock_);
      unscheduledTimerKeys_.push_back(std::move(key));
      return;
    }
    replacement = wrapper->block();
  } else {
    replacement = std::make_shared<const Block>(std::move(block));
  }

  VR_DEBUG(logger_, LogScope::Session, kAddLabel, "Dropping duplicate message for %s", key.c_str());
  auto before = existing->timer().fireDate();
  existing->sleepFor(hold);
  existing->setBlock(std::move(replacement));
  // A shorter hold than the pending one brings the date forward, while the worker
  // may be sleeping towards the old one.
  if (existing->timer().fireDate() < before) {
    fireDateMovedEarlier_.store(true);
    wakeWorker();
  }
}

void VRReportingBlockThrottle::fireEntry(const std::string& key, const std::weak_ptr<Wrapper>& weakWrapper) {
  auto wrapper = weakWrapper.lock();
  if (!wrapper) return;
  std::exception_ptr failure;
  try {
    if (auto block = wrapper->block(); block && *block) (*block)();
  } catch (...) {
    failure = std::current_exception();
  }
  std::shared_ptr<Wrapper> retired;  // released after the lock
  {
    MutexLock guard(timersInFlightLock_);
    if (auto it = timersInFlight_.find(key); it != timersInFlight_.end() && it->second == wrapper) {
      it->second->timer().invalidate();
      retired = std::move(it->second);
      timersInFlight_.erase(it);
    }
  }
  if (failure) std::rethrow_exception(failure);
}

void VRReportingBlockThrottle::runWorker() {
  std::vector<Attached> attached;
  while (shouldKeepRunning()) {
    std::vector<std::string> keys;
    keys.reserve(kUnscheduledCapacity);
    {
      MutexLock guard(unscheduledTimerKeysLock_);
      keys.swap(unscheduledTimerKeys_);
    }
    if (!keys.empty()) {
      VR_DEBUG(logger_, LogScope::Session, kWorkerLabel, "calling workingRunLoop run from inside thread block");
      // Looked up after the array's lock is released, so the two locks are never
      // held together. No entry can leave in between: only this thread retires them.
      {
        MutexLock guard(timersInFlightLock_);
        for (auto& key : keys) {
          if (auto it = timersInFlight_.find(key); it != timersInFlight_.end())
            attached.push_back({it->second->timer().fireDate(), std::move(key), it->second});
        }
      }
      runTimers(attached);
      if (stopRequested_.load()) break;
    }
    VR_DEBUG(logger_, LogScope::Session, kWorkerLabel, "sleeping in thread");
    clock_->sleepUntil(clock_->now() + ThrottleClock::durationFromSeconds(kPassSleepSeconds), &stopRequested_);
  }
  clock_->threadLeaves();
}

// Runs until every attached timer has fired, like an event loop with no other
// sources. Entries are ordered by the date they were armed for; a duplicate may
// have moved the date since, so a due entry is re-armed when its date went later.
void VRReportingBlockThrottle::runTimers(std::vector<Attached>& attached) {
  auto later = [](const Attached& a, const Attached& b) { return a.due > b.due; };
  std::make_heap(attached.begin(), attached.end(), later);
  while (!attached.empty()) {
    workerWake_.store(false);
    if (stopRequested_.load()) {
      attached.clear();
      return;
    }
    if (fireDateMovedEarlier_.exchange(false)) {
      for (auto& a : attached) a.due = a.wrapper->timer().fireDate();
      std::make_heap(attached.begin(), attached.end(), later);
    }
    if (attached.front().due > clock_->now()) {
      clock_->sleepUntil(attached.front().due, &workerWake_);
      continue;
    }
    std::pop_heap(attached.begin(), attached.end(), later);
    Attached entry = std::move(attached.back());
    attached.pop_back();
    const ThrottleTimer& timer = entry.wrapper->timer();
    if (auto date = timer.fireDate(); date > entry.due) {
      entry.due = date;
      attached.push_back(std::move(entry));
      std::push_heap(attached.begin(), attached.end(), later);
      continue;
    }
    // A throwing delivery has already been retired; its error ends here, on the
    // worker, which must keep serving every other entry.
    try {
      timer.fire();
    } catch (const std::exception& e) {
      VR_LOG(logger_, LogScope::Session, LogLevel::Error, kWorkerLabel,
             "Throttled delivery threw, message dropped. {key=%s, error=%s}", entry.key.c_str(), e.what());
    } catch (...) {
      VR_LOG(logger_, LogScope::Session, LogLevel::Error, kWorkerLabel,
             "Throttled delivery threw, message dropped. {key=%s, error=unknown}", entry.key.c_str());
    }
  }
}

void VRReportingBlockThrottle::waitForCompletion() {
  VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Info, kWaitLabel,
         "waitForCompletion. timersInFlight=%u unscheduledTimerKeys=%u", static_cast<unsigned>(timersInFlightCount()),
         static_cast<unsigned>(unscheduledTimerKeysCount()));
  if (timersInFlightCount() == 0) return;
  VR_DEBUG(logger_, LogScope::Session, kWaitLabel, "Waiting up to %u seconds for blockThrottle queue to be empty.",
           kWaitSeconds);
  for (int i = 0; i < kWaitPolls && timersInFlightCount() != 0; ++i) clock_->sleepFor(kWaitPollSeconds);
  if (std::size_t pending = timersInFlightCount(); pending != 0) {
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Default, kWaitLabel,
           "Giving up on waiting for completion after %u seconds. timersInFlight=%u", kWaitSeconds,
           static_cast<unsigned>(pending));
  }
}

std::unordered_map<std::string, std::shared_ptr<VRReportingBlockThrottleTimerWrapper>>
VRReportingBlockThrottle::timersInFlight() const {
  MutexLock guard(timersInFlightLock_);
  return timersInFlight_;
}

std::vector<std::string> VRReportingBlockThrottle::unscheduledTimerKeys() const {
  MutexLock guard(unscheduledTimerKeysLock_);
  return unscheduledTimerKeys_;
}

std::size_t VRReportingBlockThrottle::timersInFlightCount() const {
  MutexLock guard(timersInFlightLock_);
  return timersInFlight_.size();
}

std::size_t VRReportingBlockThrottle::unscheduledTimerKeysCount() const {
  MutexLock guard(unscheduledTimerKeysLock_);
  return unscheduledTimerKeys_.size();
}

}  // namespace vireo
