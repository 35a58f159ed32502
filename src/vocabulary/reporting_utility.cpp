#include "vocabulary/reporting_utility.h"

#include <algorithm>
#include <chrono>
#include <string>

#include "vocabulary/reporting_environment.h"

namespace vireo {

namespace {

const char* areaLabel(std::uint32_t area) {
  switch (area) {
    case 0x08000000u: return "Session";
    case 0x10000000u: return "DSP";
    case 0x20000000u: return "HAL";
    case 0x40000000u: return "Routing";
    case 0x80000000u: return "Toolbox";
    default: return nullptr;
  }
}

const char* kindLabel(std::uint32_t kind) {
  static constexpr const char* kKinds[] = {"Undefined", "Generic",     "Record", "Playback",
                                           "PlaybackAndRecord", "Setup", "ClientRequest", "RouteChange",
                                           "Error",     "HWReporting", "Performance", "Volume"};
  return kind < std::size(kKinds) ? kKinds[kind] : "Undefined";
}

}  // namespace

std::string VRReportingCategoryName(std::uint32_t category) {
  std::string label;
  if (category >= 0x10000u && category != 0xFFFFFFFFu) {
    // An unrecognised area still contributes its separator: "_Setup".
    if (const char* area = areaLabel(category & 0xFFFF0000u)) label += area;
    label += '_';
  }
  label += kindLabel(category & 0xFFFFu);
  return label;
}

std::string VRReportingTypeName(std::uint32_t type) {
  static constexpr const char* kTypes[] = {"Generic", "Start", "Stop", "Setup", "Error", "IssueDetector"};
  if (type < std::size(kTypes)) return kTypes[type];
  if (type == 0xFFFFu) return "Unknown";
  return "Undefined";
}

std::optional<std::string> VRReportingServiceTypeName(std::uint32_t serviceType) {
  static constexpr const char* kServices[] = {"generic",       "vesper",         "telephony",        "haptics",
                                              "alarms",        "standalone",     "soundautoconfig", "longformaudio",
                                              "nonlongformaudio", "audiodeviceusage", "alerts",         "test"};
  if (serviceType < std::size(kServices)) return std::string(kServices[serviceType]);
  if (serviceType == 0xFFFFu) return std::string("unknown");
  return std::nullopt;
}

std::string serviceNameOrUnknown(std::uint32_t serviceType) {
  return VRReportingServiceTypeName(serviceType).value_or("unknown");
}

Value VRReportingHostApplicationDisplayID(const Dictionary* userInfo) {
  if (userInfo) {
    if (const Value* v = userInfo->find(kHostApplicationDisplayIDKey); v && !v->isAbsent()) return *v;
  }
  return Value("Unknown");
}

bool VRReportingIsInternalBuild(ReportingEnvironment& env) { return env.isInternalBuild(); }

// One wait in progress. While its queue is parked the park's timeout closure holds
// it; a wake-up closure holds it once resumed; the condition only points at it.
class ReportingWaiter : public std::enable_shared_from_this<ReportingWaiter> {
 public:
  ReportingWaiter(std::shared_ptr<SerialQueue> queue, std::shared_ptr<ReportingCondition> condition,
                  std::string_view waitMessage, std::string_view giveUpMessage, Logger& logger, LogScope where,
                  double interval, std::function<void(bool)> onDone)
      : queue_(std::move(queue)),
        condition_(std::move(condition)),
        logger_(logger),
        where_(where),
        waitText_(waitMessage),
        giveUpText_(giveUpMessage),
        // Beyond a billion seconds nobody is waiting any more; it also keeps the cast defined.
        span_(std::chrono::duration_cast<std::chrono::nanoseconds>(
            std::chrono::duration<double>(interval > 0 ? std::min(interval, 1e9) : 0))),
        onDone_(std::move(onDone)) {}

  void begin() {
    {
      MutexLock lock(condition_->lock_);
      if (!condition_->done_) return parkLocked();
    }
    finish(true);
  }

  // On the queue, after a signal. Under the condition's lock from the check to the
  // next park, so no signal falls in between.
  void woken() {
    {
      MutexLock lock(condition_->lock_);
      VR_LOG(logger_, where_, LogLevel::Default, kLabel, "continuing");
      if (!condition_->done_) return parkLocked();
      condition_->waiter_.reset();
    }
    finish(true);
  }

  // On the queue, after an interval of silence: a signal that comes now is too late.
  void timedOut() {
    std::shared_ptr<Parking> spent;
    {
      MutexLock lock(condition_->lock_);
      condition_->waiter_.reset();
      spent = std::move(condition_->parking_);
      VR_LOG(logger_, where_, LogLevel::Error, kLabel, "%s", giveUpText_.c_str());
    }
    finish(false);
  }

 private:
  static constexpr const char* kLabel = "VRReportingUtilityWait";

  // With condition_->lock_ held: one round of waiting.
  void parkLocked() VIREO_REQUIRES(condition_->lock_) {
    VR_LOG(logger_, where_, LogLevel::Default, kLabel, "%s", waitText_.c_str());
    condition_->waiter_ = weak_from_this();
    condition_->parking_ = queue_->park(span_, [self = shared_from_this()] { self->timedOut(); });
  }

  void finish(bool done) {
    auto onDone = std::move(onDone_);
    onDone_ = nullptr;
    if (onDone) onDone(done);
  }

  const std::shared_ptr<SerialQueue> queue_;
  const std::shared_ptr<ReportingCondition> condition_;
  Logger& logger_;
  const LogScope where_;
  const std::string waitText_;
  const std::string giveUpText_;
  const std::chrono::nanoseconds span_;
  std::function<void(bool)> onDone_;  // touched only on queue_
};

bool ReportingCondition::done() const {
  MutexLock lock(lock_);
  return done_;
}

void ReportingCondition::wake(bool setDone) {
  std::shared_ptr<ReportingWaiter> waiter;
  std::shared_ptr<Parking> parking;
  {
    MutexLock lock(lock_);
    if (setDone) done_ = true;
    waiter = waiter_.lock();
    parking = std::move(parking_);  // one wake-up per round
  }
  // Loses to a deadline that has already passed: the waiter then gives up.
  if (waiter && parking) parking->resume([waiter] { waiter->woken(); });
}

void VRReportingUtilityWaitAsync(std::shared_ptr<SerialQueue> queue, std::shared_ptr<ReportingCondition> condition,
                                 std::string_view waitMessage, std::string_view giveUpMessage, Logger& logger,
                                 std::optional<LogScope> scope, double interval, std::function<void(bool)> onDone) {
  auto waiter = std::make_shared<ReportingWaiter>(std::move(queue), std::move(condition), waitMessage, giveUpMessage,
                                                  logger, scope.value_or(LogScope::DefaultLog), interval,
                                                  std::move(onDone));
  waiter->begin();
}

}  // namespace vireo
