// limits.conf in the configuration directory: the ServiceLimits keys, each optional.
#pragma once

#include <string>
#include <vector>

#include "platform/limits.h"

namespace vireo::linux_platform {

// Reads the file; keys that are missing keep their default. Each problem (an
// unknown key, a value that is not a positive whole number) is added to problems.
ServiceLimits readLimitsFile(const std::string& path, std::vector<std::string>* problems);

}  // namespace vireo::linux_platform
