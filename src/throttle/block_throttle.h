// VRReportingBlockThrottle: holds each message back for a short time and lets a
// later identical message replace it, so a burst of duplicates is delivered once,
// as its last member, after the burst has been quiet for the hold time. Deliveries
// run one at a time on the throttle's own worker thread.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <thread>
#include <unordered_map>
#include <vector>

#include "base/mutex.h"
#include "base/value.h"
#include "platform/logger.h"
#include "throttle/throttle_clock.h"

namespace vireo {

// A one-shot timer on the worker's timer set. The fire date may be moved from any
// thread; the worker re-reads it when the timer comes due.
class ThrottleTimer {
 public:
  using TimePoint = ThrottleClock::TimePoint;

  ThrottleTimer(std::shared_ptr<ThrottleClock> clock, TimePoint fireDate, std::function<void()> action)
      : clock_(std::move(clock)), fireDate_(fireDate.time_since_epoch().count()), action_(std::move(action)) {}

  TimePoint fireDate() const { return TimePoint(ThrottleClock::Duration(fireDate_.load())); }
  void setFireDate(TimePoint date) { fireDate_.store(date.time_since_epoch().count()); }
  ThrottleClock& clock() const { return *clock_; }
  bool isValid() const { return valid_.load(); }
  void invalidate() { valid_.store(false); }
  // Runs the action unless the timer has been invalidated. Exceptions pass through.
  void fire() const {
    if (isValid() && action_) action_();
  }

 private:
  const std::shared_ptr<ThrottleClock> clock_;
  std::atomic<ThrottleClock::Duration::rep> fireDate_;
  std::atomic<bool> valid_{true};
  const std::function<void()> action_;
};

// One pending entry: the delivery to run and the timer that runs it.
class VRReportingBlockThrottleTimerWrapper {
 public:
  using Block = std::function<void()>;

  std::shared_ptr<const Block> block() const;
  void setBlock(Block block);
  void setBlock(std::shared_ptr<const Block> block);
  // Set once, before the wrapper is shared with another thread.
  ThrottleTimer& timer() const { return *timer_; }
  void setTimer(std::unique_ptr<ThrottleTimer> timer) { timer_ = std::move(timer); }
  // Moves the timer's next fire date to now plus seconds.
  void sleepFor(double seconds);

 private:
  mutable Mutex blockLock_;  // guards block_: duplicates replace it while the worker reads it
  std::shared_ptr<const Block> block_ VIREO_GUARDED_BY(blockLock_);
  std::unique_ptr<ThrottleTimer> timer_;
};

class VRReportingBlockThrottle {
  struct Passkey {};

 public:
  using Block = VRReportingBlockThrottleTimerWrapper::Block;
  using Wrapper = VRReportingBlockThrottleTimerWrapper;

  // init: starts the worker. The worker holds the throttle, so it lives until
  // stop() (or setShouldKeepRunning(false)) ends the worker. Without a clock it
  // runs on steady_clock. The logger must outlive the throttle.
  static std::shared_ptr<VRReportingBlockThrottle> make(Logger& logger, std::shared_ptr<ThrottleClock> clock = nullptr);
  VRReportingBlockThrottle(Passkey, Logger& logger, std::shared_ptr<ThrottleClock> clock);
  ~VRReportingBlockThrottle();
  VRReportingBlockThrottle(const VRReportingBlockThrottle&) = delete;
  VRReportingBlockThrottle& operator=(const VRReportingBlockThrottle&) = delete;

  // buildMessageKey:reporterID:category:type: (class operation)
  static std::string buildMessageKey(const Dictionary& message, std::int64_t reporterID, std::uint32_t category,
                                     std::uint32_t type);
  // determineSleepTime: (class operation)
  static double determineSleepTime(const Dictionary& message, Logger& logger);
  // Built before main and never changed.
  static std::span<const std::string_view> defaultExcludedFields();

  // addMessageBlock:reporterID:message:category:type:
  void addMessageBlock(Block block, std::int64_t reporterID, const Dictionary& message, std::uint32_t category,
                       std::uint32_t type);
  // Blocks until nothing is pending or 5 seconds have passed.
  void waitForCompletion();

  // Ends the worker and joins it (unless called from the worker itself). Entries
  // still pending are dropped without running; call waitForCompletion() first to
  // let them go out. Later submissions are never delivered. Idempotent; the
  // destructor calls it too.
  void stop();

  bool shouldKeepRunning() const { return shouldKeepRunning_.load(); }
  // false ends the worker at the end of its current pass.
  void setShouldKeepRunning(bool keepRunning) { shouldKeepRunning_.store(keepRunning); }
  // Snapshots: the containers themselves belong to the throttle and its locks.
  std::unordered_map<std::string, std::shared_ptr<Wrapper>> timersInFlight() const;
  std::vector<std::string> unscheduledTimerKeys() const;
  std::size_t timersInFlightCount() const;
  std::size_t unscheduledTimerKeysCount() const;
  std::thread::id queueThread() const { return queueThreadID_; }

 private:
  // A timer attached to the worker's timer set, ordered by the date it was armed for.
  struct Attached {
    ThrottleTimer::TimePoint due;
    std::string key;
    std::shared_ptr<Wrapper> wrapper;
  };

  void runWorker();
  void runTimers(std::vector<Attached>& attached);
  void fireEntry(const std::string& key, const std::weak_ptr<Wrapper>& weakWrapper);
  void wakeWorker();

  Logger& logger_;
  const std::shared_ptr<ThrottleClock> clock_;

  std::atomic<bool> shouldKeepRunning_{true};
  // Raised by stop(): the worker abandons its timers instead of draining them.
  std::atomic<bool> stopRequested_{false};
  // Raised to cut the worker's timer wait short; the worker lowers it before it
  // re-reads its timers.
  std::atomic<bool> workerWake_{false};
  // Raised when a duplicate brings an attached timer's fire date forward, which the
  // worker's ordering by armed date would otherwise miss.
  std::atomic<bool> fireDateMovedEarlier_{false};

  mutable Mutex timersInFlightLock_;  // guards timersInFlight_ (every read and write)
  std::unordered_map<std::string, std::shared_ptr<Wrapper>> timersInFlight_ VIREO_GUARDED_BY(timersInFlightLock_);
  mutable Mutex unscheduledTimerKeysLock_;  // guards unscheduledTimerKeys_; never held with the one above
  std::vector<std::string> unscheduledTimerKeys_ VIREO_GUARDED_BY(unscheduledTimerKeysLock_);

  std::thread queueThread_;  // written by make() before the throttle is shared, joined by stop()
  std::thread::id queueThreadID_;
  std::once_flag stopOnce_;
};

}  // namespace vireo
