#include "vocabulary/reporting_utility.h"

#include <chrono>
#include <string>

#include "dispatch/dispatch.h"
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

bool VRReportingUtilityWait(ReportingCondition& condition, bool* done, std::string_view waitMessage,
                            std::string_view giveUpMessage, Logger& logger, std::optional<LogScope> scope,
                            double interval) {
  const LogScope where = scope.value_or(LogScope::DefaultLog);
  const std::string waitText(waitMessage);
  const std::string giveUpText(giveUpMessage);
  const auto span = std::chrono::duration_cast<std::chrono::steady_clock::duration>(
      std::chrono::duration<double>(interval > 0 ? interval : 0));

  std::unique_lock<std::mutex> lock(condition.lock);
  if (*done) return true;
  BlockingRegion blocking;
  for (;;) {
    VR_LOG(logger, where, LogLevel::Default, "VRReportingUtilityWait", "%s", waitText.c_str());
    if (condition.condition.wait_until(lock, std::chrono::steady_clock::now() + span) == std::cv_status::timeout) {
      VR_LOG(logger, where, LogLevel::Error, "VRReportingUtilityWait", "%s", giveUpText.c_str());
      return false;
    }
    VR_LOG(logger, where, LogLevel::Default, "VRReportingUtilityWait", "continuing");
    if (*done) return true;
  }
}

}  // namespace vireo
