// Device properties, the process table and the diagnostic files.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/error.h"

namespace vireo {

class DeviceProperties {
 public:
  virtual ~DeviceProperties() = default;
  virtual std::optional<bool> boolAnswer(std::string_view key) = 0;      // "InternalBuild"
  virtual std::optional<std::int32_t> intAnswer(std::string_view key) = 0; // "DeviceClassNumber"
};

class ProcessTable {
 public:
  virtual ~ProcessTable() = default;
  virtual std::int32_t selfPid() const = 0;
  virtual std::optional<std::string> selfName() const = 0;
  // The kernel's short command name (at most 16 characters) of pid; nothing on failure.
  virtual std::optional<std::string> shortName(std::int32_t pid) const = 0;
};

// The diagnostic log directory and atomic text files in it.
class DiagnosticFiles {
 public:
  virtual ~DiagnosticFiles() = default;
  // The per-user diagnostic log directory (LOGS_DIRECTORY).
  virtual std::string logDirectory() const = 0;
  // Creates path with intermediate directories; true when it exists afterwards.
  virtual bool createDirectory(const std::string& path, unsigned mode, Error* error) = 0;
  // Writes text to path through a temporary file that then replaces it.
  virtual bool writeAtomically(const std::string& path, std::string_view text, Error* error) = 0;
};

}  // namespace vireo
