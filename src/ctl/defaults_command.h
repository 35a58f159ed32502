// `vireoctl defaults read|write|delete`: edits the defaults suite file atomically.
#pragma once

#include <cstdio>
#include <string>
#include <vector>

namespace vireo::ctl {

// args are the words after "defaults". Exit status: 0 ok, 1 failure or key not
// found (read), 2 usage.
int runDefaults(const std::string& suitePath, const std::vector<std::string>& args, bool json, std::FILE* out,
                std::FILE* err);

}  // namespace vireo::ctl
