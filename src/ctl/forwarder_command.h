// `vireoctl forwarder`: what vireo-forwarder has sent and what waits, read from the
// store (read-only) and from the status file the forwarder writes after each pass.
#pragma once

#include <cstdio>
#include <string>
#include <vector>

namespace vireo::ctl {

struct ForwarderPaths {
  std::string db;      // vireo.db, unless --db gives another
  std::string status;  // forwarder.json
  std::string config;  // forwarder.conf
};

// args are the words after "forwarder". Exit status: 0 ok, 1 when the store or the
// status file cannot be read, 2 usage.
int runForwarder(ForwarderPaths paths, const std::vector<std::string>& args, bool json, std::FILE* out,
                 std::FILE* err);

}  // namespace vireo::ctl
