// Orientation tracking of a running session: on internal builds, telephony and
// long-form audio sessions record every device and interface orientation change,
// with the time since start, among their gathered payloads.
#include <cmath>
#include <string>

#include "platform/logger.h"
#include "session/reporting_session.h"
#include "vocabulary/reporting_environment.h"
#include "vocabulary/reporting_utility.h"

namespace vireo {

namespace {
constexpr std::uint16_t kTelephonyServiceType = 2;
constexpr std::uint16_t kLongFormAudioServiceType = 7;
// This device class is left out on purpose.
constexpr std::int32_t kExcludedDeviceClass = 6;
}  // namespace

bool VRReportingSession::shouldReportOrientation() {
  if (!VRReportingIsInternalBuild(*env_)) return false;
  const std::uint16_t type = serviceType_.load();
  if (type != kLongFormAudioServiceType && type != kTelephonyServiceType) return false;
  // Asked afresh each time: only the internal-build flag is cached.
  return env_->platform.device.intAnswer("DeviceClassNumber") != kExcludedDeviceClass;
}

void VRReportingSession::registerOrientationHandlers() {
  std::string identifier = "VRReportingService " + std::to_string(reporterID_);
  {
    MutexLock guard(fieldsLock_);
    orientationCallbackID_ = identifier;
    startDate_ = env_->platform.clock.now();
  }
  OrientationService& orientation = env_->platform.orientation;
  // Each handler holds the session until stop unregisters it.
  orientation.registerDeviceOrientationHandler(
      identifier, [self = shared_from_this()](Orientation o) { self->orientationChanged("device", o); });
  orientation.registerInterfaceOrientationHandler(
      identifier, [self = shared_from_this()](Orientation o) { self->orientationChanged("ui", o); });
}

void VRReportingSession::unregisterOrientationHandlers() {
  std::optional<std::string> identifier = orientationCallbackID();
  if (!identifier || !shouldReportOrientation()) return;
  OrientationService& orientation = env_->platform.orientation;
  orientation.unregisterDeviceOrientationHandler(*identifier);
  orientation.unregisterInterfaceOrientationHandler(*identifier);
  MutexLock guard(fieldsLock_);
  orientationCallbackID_.reset();
}

void VRReportingSession::orientationChanged(const char* mode, Orientation orientation) {
  std::shared_ptr<AggregatedPayloads> payloads;
  std::optional<WallTime> startDate;
  std::optional<std::string> identifier;
  Value application;
  {
    MutexLock guard(fieldsLock_);
    payloads = aggregatedPayloadData_;
    startDate = startDate_;
    identifier = orientationCallbackID_;
    if (const Value* v = userInfo_.find(kHostApplicationDisplayIDKey)) application = *v;
  }
  // A change that arrives after stop has dropped the payloads is not recorded.
  if (!payloads || !startDate) return;

  const std::string text = env_->platform.orientation.orientationText(orientation);
  // Rounded to milliseconds, half away from zero, from the (negative) interval back to start.
  const double interval = std::chrono::duration<double>(*startDate - env_->platform.clock.now()).count();
  const double elapsed = std::round(interval * 1000.0) / -1000.0;

  VR_DEBUG(env_->logger(), LogScope::Session, "-[VRReportingSession start]_block_invoke",
           "Orientation handler callback mode=%s orientation=\"%s\" app=\"%s\", time=%s, id=\"%s\"", mode,
           text.c_str(), application.text().c_str(), Value(elapsed).text().c_str(),
           identifier ? identifier->c_str() : "(null)");

  const std::string prefix(mode);
  Dictionary entry{{Value(prefix + "_orientation"), Value(text)},
                   {Value(prefix + "_orientation_time"), Value(elapsed)}};
  keep(*payloads, Value(std::move(entry)));
}

}  // namespace vireo
