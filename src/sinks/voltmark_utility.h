// VRReportingVoltmarkUtility: haptic-engine on-time reports to the energy-log service.
#pragma once

#include <cstdint>
#include <memory>

#include "base/value.h"

namespace vireo {

class ReportingEnvironment;
class VRReportingSession;

class VRReportingVoltmarkUtility {
 public:
  VRReportingVoltmarkUtility() = delete;
  // The registered energy-log client the events are logged under.
  static constexpr int kVoltmarkClient = 28;
  // handleEvent:withCategory:type:session: (category and type are not looked at)
  static void handleEvent(const std::shared_ptr<ReportingEnvironment>& env, const Dictionary* message,
                          std::uint32_t category, std::uint32_t type, const VRReportingSession& session);
};

}  // namespace vireo
