// The names on the bus that the daemon and every client share.
#pragma once

namespace vireo::bus {

inline constexpr const char* kServiceName = "com.orvane.vireo.Reporting1";
inline constexpr const char* kObjectPath = "/com/orvane/vireo/Reporting1";
inline constexpr const char* kInterface = "com.orvane.vireo.Reporting1";
// GetStatus() -> a{sv}, on the same object: the daemon's live state.
inline constexpr const char* kDebugInterface = "com.orvane.vireo.Debug1";
// SetInterfaceOrientation(s), on the same object: the shell reports how its interface is turned.
inline constexpr const char* kOrientationInterface = "com.orvane.vireo.Orientation1";
// The defaults change notification: Posted(s name) on this path and interface.
inline constexpr const char* kNotifyPath = "/com/orvane/Notify1";
inline constexpr const char* kNotifyInterface = "com.orvane.Notify1";
inline constexpr const char* kReportingNotification = "com.orvane.vireo.reporting";
inline constexpr const char* kReportingDisabledError = "com.orvane.audio.reporting.ReportingDisabled";
// A held start whose session went away without a stop (replaced by a new create).
inline constexpr const char* kSessionEndedError = "com.orvane.vireo.Error.SessionEnded";
// A call past one of the daemon's limits (limits.conf).
inline constexpr const char* kLimitsExceededError = "org.freedesktop.DBus.Error.LimitsExceeded";

}  // namespace vireo::bus
