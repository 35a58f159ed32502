// The diagnostic log directory and atomic file writes.
#pragma once

#include <string>

#include "platform/device.h"

namespace vireo::linux_platform {

class LinuxDiagnosticFiles : public DiagnosticFiles {
 public:
  // logDirectory is the service's log directory (ServiceDirectories::logs).
  explicit LinuxDiagnosticFiles(std::string logDirectory);

  std::string logDirectory() const override;
  bool createDirectory(const std::string& path, unsigned mode, Error* error) override;
  // The file gets mode 0644.
  bool writeAtomically(const std::string& path, std::string_view text, Error* error) override;

 private:
  const std::string logDirectory_;
};

// The domain of errors reported with an errno code.
inline constexpr const char* kPosixErrorDomain = "posix";

}  // namespace vireo::linux_platform
