#include "sinks/voltmark_utility.h"

#include "platform/logger.h"
#include "session/reporting_session.h"
#include "vocabulary/reporting_environment.h"
#include "vocabulary/reporting_utility.h"

namespace vireo {

void VRReportingVoltmarkUtility::handleEvent(const std::shared_ptr<ReportingEnvironment>& env,
                                             const Dictionary* message, std::uint32_t /*category*/,
                                             std::uint32_t /*type*/, const VRReportingSession& session) {
  static constexpr const char* kLabel = "+[VRReportingVoltmarkUtility handleEvent:withCategory:type:session:]";
  if (!message) return;
  const Value* onTime = message->find("EngineOnTime");
  if (!onTime || onTime->isAbsent()) return;

  Dictionary event;
  event.set(Value("EngineOnDuration"), *onTime);
  const Dictionary info = session.userInfo();
  Value app = VRReportingHostApplicationDisplayID(&info);
  if (!app.isAbsent()) {
    event.set(Value("ApplicationName"), std::move(app));
  } else {
    VR_LOG(env->logger(), LogScope::DefaultLog, LogLevel::Error, kLabel, "failed to get app name for voltmark");
  }
  const Value* timestamp = message->find("vrreporting_timestamp");
  if (timestamp && !timestamp->isAbsent()) {
    event.set(Value("TimestampEnd"), *timestamp);
  } else {
    VR_LOG(env->logger(), LogScope::DefaultLog, LogLevel::Error, kLabel,
           "failed to get VRReporting timestamp for voltmark");
  }
  env->platform.energyLog.logEvent(kVoltmarkClient, "Lumen_Haptics", event);
}

}  // namespace vireo
