#include "platform/linux/paths.h"

#include <pwd.h>
#include <unistd.h>

#include <cstdlib>

namespace vireo::linux_platform {

namespace {

std::string env(const char* name) {
  const char* v = std::getenv(name);
  return v ? std::string(v) : std::string();
}

std::string firstPath(const std::string& list) { return list.substr(0, list.find(':')); }

std::string home() {
  std::string h = env("HOME");
  if (!h.empty()) return h;
  if (auto* pw = getpwuid(getuid())) return pw->pw_dir;
  return "/tmp";
}

std::string xdg(const char* variable, const std::string& fallback) {
  std::string v = env(variable);
  return v.empty() || v.front() != '/' ? fallback : v;
}

std::string pick(const char* variable, const std::string& fallback) {
  std::string v = firstPath(env(variable));
  return v.empty() ? fallback : v;
}

}  // namespace

ServiceDirectories ServiceDirectories::fromEnvironment() {
  ServiceDirectories d;
  if (geteuid() == 0) {
    d.configuration = pick("CONFIGURATION_DIRECTORY", "/etc/vireo");
    d.state = pick("STATE_DIRECTORY", "/var/lib/vireo");
    d.logs = pick("LOGS_DIRECTORY", "/var/log/vireo");
    d.runtime = pick("RUNTIME_DIRECTORY", "/run/vireo");
    return d;
  }
  std::string configHome = xdg("XDG_CONFIG_HOME", home() + "/.config");
  std::string stateHome = xdg("XDG_STATE_HOME", home() + "/.local/state");
  std::string runtimeDir = xdg("XDG_RUNTIME_DIR", "/tmp/vireo-runtime-" + std::to_string(getuid()));
  d.configuration = pick("CONFIGURATION_DIRECTORY", configHome + "/vireo");
  d.state = pick("STATE_DIRECTORY", stateHome + "/vireo");
  d.logs = pick("LOGS_DIRECTORY", stateHome + "/vireo/log");
  d.runtime = pick("RUNTIME_DIRECTORY", runtimeDir + "/vireo");
  return d;
}

}  // namespace vireo::linux_platform
