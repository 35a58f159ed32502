#include "sinks/tallyhub_bridge.h"

#include <string>
#include <utility>

#include "session/reporting_session.h"
#include "vocabulary/reporting_environment.h"
#include "vocabulary/reporting_utility.h"

namespace vireo {

void VRReportingTallyhubBridge::handleEvent(const std::shared_ptr<ReportingEnvironment>& env,
                                            const Dictionary* message, std::uint32_t category, std::uint32_t type,
                                            const VRReportingSession& session) {
  // The copy is made now so later changes to the caller's message do not leak into
  // an event the service builds later; only the hand-over is lazy.
  Dictionary payload = message ? *message : Dictionary{};
  const Dictionary info = session.userInfo();
  payload.set(Value(kHostApplicationDisplayIDKey), VRReportingHostApplicationDisplayID(&info));
  const std::string name = "com.orvane.vireo." + VRReportingCategoryName(category) + "." + VRReportingTypeName(type);
  // Built once, handed over once.
  env->platform.analytics.sendEventLazy(name, [payload = std::move(payload)]() mutable { return std::move(payload); });
}

}  // namespace vireo
