// The engine's part of the daemon's live status: clients, their sessions and what
// was let go to stay within the limits.
#pragma once

#include "base/value.h"

namespace vireo {

class VRReportingServiceDelegate;
class ReportingEnvironment;

// {"clients": [{"pid", "process", "sessions": [{"reporterID", "serviceType",
// "serviceName", "started"}]}], "sessions": n, "started_sessions": n,
// "kept_payloads_dropped": n}. Takes the registry and session-map locks briefly.
Dictionary serviceStatus(const VRReportingServiceDelegate& delegate, const ReportingEnvironment& env);

}  // namespace vireo
