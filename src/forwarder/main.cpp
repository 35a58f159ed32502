// vireo-forwarder: sends the local store's committed rows to a ClickHouse server.
#include <curl/curl.h>
#include <signal.h>
#include <sys/stat.h>
#include <systemd/sd-id128.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <random>
#include <string>

#include "forwarder/config.h"
#include "forwarder/forwarder.h"
#include "platform/linux/defaults_store.h"
#include "platform/linux/key_file.h"
#include "platform/linux/linux_logger.h"
#include "platform/linux/paths.h"
#include "platform/linux/store/store.h"

namespace {

using namespace vireo;
using vireo::forwarder::Forwarder;

// The device column: the machine id hashed with this application id, so that the
// fleet database never learns the machine id itself.
constexpr sd_id128_t kDeviceAppId = SD_ID128_MAKE(87, 91, 0c, 10, 2b, b0, 48, ec, 9b, 81, df, 57, 9f, d3, 27, b6);
constexpr double kMaxBackoffSeconds = 300;

void usage(FILE* out) {
  std::fprintf(out,
               "Usage: vireo-forwarder [--once] [--help] [--version]\n"
               "\n"
               "Sends the rows of the Vireo store (STATE_DIRECTORY/vireo.db) to the ClickHouse server\n"
               "named in forwarder.conf, each row once, and deletes forwarded rows once they are older\n"
               "than KeepForwarded=. Does nothing while com.orvane.vireo.conf says disable_reporting.\n"
               "Writes its state to STATE_DIRECTORY/forwarder.json.\n"
               "\n"
               "  --once      one pass over everything waiting, then exit (1 when it failed)\n"
               "\n"
               "Environment:\n"
               "  CONFIGURATION_DIRECTORY, STATE_DIRECTORY   the service directories (set by systemd)\n"
               "  VIREO_FORWARDER_DEVICE                     the device column, instead of the id\n"
               "                                             derived from the machine id\n"
               "\n"
               "Signals: SIGTERM and SIGINT stop it; SIGHUP starts a pass at once.\n");
}

bool deviceId(std::string* out, std::string* error) {
  if (const char* given = std::getenv("VIREO_FORWARDER_DEVICE"); given && *given) {
    *out = given;
    return true;
  }
  sd_id128_t id{};
  if (int r = sd_id128_get_machine_app_specific(kDeviceAppId, &id); r < 0) {
    *error = std::string("cannot derive the device id from the machine id: ") + std::strerror(-r);
    return false;
  }
  char text[SD_ID128_STRING_MAX];
  *out = sd_id128_to_string(id, text);
  return true;
}

bool stopRequested(bool* stop) {
  if (*stop) return true;
  sigset_t pending;
  sigemptyset(&pending);
  sigpending(&pending);
  return sigismember(&pending, SIGTERM) == 1 || sigismember(&pending, SIGINT) == 1;
}

// Sleeps up to seconds; false when SIGTERM or SIGINT came (SIGHUP only wakes it).
bool waitFor(double seconds, const sigset_t& signals) {
  timespec left{static_cast<time_t>(seconds), static_cast<long>(std::fmod(seconds, 1.0) * 1e9)};
  const int sig = sigtimedwait(&signals, nullptr, &left);
  return sig != SIGTERM && sig != SIGINT;
}

}  // namespace

int main(int argc, char** argv) {
  bool once = false;
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--help") == 0 || std::strcmp(argv[i], "-h") == 0) {
      usage(stdout);
      return 0;
    }
    if (std::strcmp(argv[i], "--version") == 0) {
      std::printf("vireo-forwarder %s\n", VIREO_VERSION);
      return 0;
    }
    if (std::strcmp(argv[i], "--once") == 0) {
      once = true;
      continue;
    }
    std::fprintf(stderr, "vireo-forwarder: unknown argument '%s'\n", argv[i]);
    usage(stderr);
    return 64;  // EX_USAGE
  }

  // Handled by waiting for them, and polled during a pass.
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGTERM);
  sigaddset(&signals, SIGINT);
  sigaddset(&signals, SIGHUP);
  sigprocmask(SIG_BLOCK, &signals, nullptr);

  auto logger = linux_platform::LinuxLogger::fromEnvironment();
  const auto directories = linux_platform::ServiceDirectories::fromEnvironment();
  const std::string configPath = directories.configuration + "/" + forwarder::ForwarderConfig::kFileName;
  const auto keys = linux_platform::readKeyFile(configPath);
  if (!keys) {
    VR_LOG(*logger, LogScope::DefaultLog, LogLevel::Default, "main", "%s not found in %s: nothing to forward",
           forwarder::ForwarderConfig::kFileName, directories.configuration.c_str());
    return 0;
  }
  std::string error;
  auto config = forwarder::parseForwarderConfig(*keys, directories.configuration, &error);
  if (!config) {
    VR_LOG(*logger, LogScope::DefaultLog, LogLevel::Error, "main", "%s: %s", configPath.c_str(), error.c_str());
    return 78;  // EX_CONFIG
  }
  std::string device;
  if (!deviceId(&device, &error)) {
    VR_LOG(*logger, LogScope::DefaultLog, LogLevel::Error, "main", "%s", error.c_str());
    return 1;
  }
  if (curl_global_init(CURL_GLOBAL_DEFAULT) != CURLE_OK) {
    VR_LOG(*logger, LogScope::DefaultLog, LogLevel::Error, "main", "cannot set up libcurl");
    return 1;
  }
  ::mkdir(directories.state.c_str(), 0755);  // for the status file; systemd makes it for the unit

  bool stop = false;
  linux_platform::SuiteFileDefaultsStore defaults(directories.configuration);
  const std::string storePath = directories.state + "/" + linux_platform::LocalStore::kFileName;
  const std::string statusPath = directories.state + "/forwarder.json";
  Forwarder::Hooks hooks{
      .cancelled = [&stop] { return stopRequested(&stop); },
      .consent = [&defaults] { return !defaults.boolForKey("com.orvane.vireo", "disable_reporting"); },
      .exitAfterFirstSend = std::getenv("VIREO_FORWARDER_EXIT_AFTER_SEND") != nullptr,
  };
  Forwarder forwarder(*config, device, storePath, *logger, hooks);
  VR_LOG(*logger, LogScope::DefaultLog, LogLevel::Info, "main",
         "vireo-forwarder %s: %s to %s, database %s, device %s", VIREO_VERSION, storePath.c_str(),
         config->url.c_str(), config->database.c_str(), device.c_str());

  std::mt19937 random(std::random_device{}());
  bool consent = true;
  int status = 0;
  for (bool first = true; !stop; first = false) {
    const bool consentNow = hooks.consent();
    if (consentNow != consent || (first && !consentNow)) {
      VR_LOG(*logger, LogScope::DefaultLog, LogLevel::Default, "main",
             consentNow ? "reporting enabled: forwarding" : "reporting disabled: not forwarding");
    }
    consent = consentNow;
    auto result = consent ? forwarder.pass() : Forwarder::Result::Done;
    if (result == Forwarder::Result::Done && consent) forwarder.prune();
    if (result == Forwarder::Result::Stopped) {
      stop = true;
      break;
    }
    double delay = static_cast<double>(config->interval.count());
    if (result == Forwarder::Result::Failed) {
      // Exponential from one second, capped, with jitter so that a fleet does not
      // come back all at once after an outage.
      const auto failures = std::min<std::uint64_t>(forwarder.failedAttempts(), 16);
      const double full = std::min(kMaxBackoffSeconds, std::ldexp(1.0, static_cast<int>(failures) - 1));
      delay = std::uniform_real_distribution<double>(full / 2, full)(random);
    }
    if (once) {
      forwarder.writeStatus(statusPath, consent, 0);
      status = result == Forwarder::Result::Failed ? 1 : 0;
      break;
    }
    forwarder.writeStatus(statusPath, consent,
                          std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count() +
                              delay);
    stop = !waitFor(delay, signals);
  }
  if (stop) {
    forwarder.writeStatus(statusPath, consent, 0);
    VR_LOG(*logger, LogScope::DefaultLog, LogLevel::Info, "main", "stopping");
  }
  curl_global_cleanup();
  return status;
}
