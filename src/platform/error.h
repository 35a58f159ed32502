#pragma once

#include <cstdint>
#include <string>

namespace vireo {

// An error as the platform's services report it: a domain, a code and a text
// meant for people (the "localized description").
struct Error {
  std::string domain;
  std::int64_t code = 0;
  std::string description;
};

inline constexpr const char* kGeneralErrorDomain = "com.orvane.vireo.error";
inline constexpr const char* kReportingErrorDomain = "com.orvane.audio.reporting";
inline constexpr std::int64_t kReportingDisabledCode = 1;

}  // namespace vireo
