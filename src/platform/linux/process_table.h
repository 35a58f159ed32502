// Process names from procfs.
#pragma once

#include <string>
#include <string_view>

#include "platform/device.h"

namespace vireo::linux_platform {

class ProcfsProcessTable : public ProcessTable {
 public:
  // procRoot is the procfs mount; tests point it at a directory of their own.
  explicit ProcfsProcessTable(std::string procRoot = "/proc");

  std::int32_t selfPid() const override;
  std::optional<std::string> selfName() const override;
  std::optional<std::string> shortName(std::int32_t pid) const override;

 private:
  std::optional<std::string> readComm(const std::string& entry) const;

  const std::string procRoot_;
};

// text with NUL and every byte that is not part of a well-formed UTF-8 sequence
// replaced by U+FFFD, so the name can travel as a bus string.
std::string validUtf8(std::string_view text);

}  // namespace vireo::linux_platform
