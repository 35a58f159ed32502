// VRReportingTallyhubBridge: every routed message, unfiltered, to the analytics
// event service under "com.orvane.vireo.<category>.<type>".
#pragma once

#include <cstdint>
#include <memory>

#include "base/value.h"

namespace vireo {

class ReportingEnvironment;
class VRReportingSession;

class VRReportingTallyhubBridge {
 public:
  VRReportingTallyhubBridge() = delete;
  // handleEvent:withCategory:type:session:
  static void handleEvent(const std::shared_ptr<ReportingEnvironment>& env, const Dictionary* message,
                          std::uint32_t category, std::uint32_t type, const VRReportingSession& session);
};

}  // namespace vireo
