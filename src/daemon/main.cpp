// vireo-reportingd: the reporting daemon of the audio stack.
#include <malloc.h>
#include <sys/resource.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "daemon/bus_choice.h"
#include "daemon/bus_service.h"
#include "daemon/notification_center.h"
#include "daemon/orientation_service.h"
#include "dispatch/thread_pool.h"
#include "platform/linux/defaults_store.h"
#include "platform/linux/device_properties.h"
#include "platform/linux/diagnostic_files.h"
#include "platform/linux/limits_file.h"
#include "platform/linux/store/store_quota.h"
#include "platform/linux/linux_logger.h"
#include "platform/linux/paths.h"
#include "platform/linux/process_table.h"
#include "platform/linux/stats_tree.h"
#include "platform/linux/store/local_services.h"
#include "platform/linux/system_clock.h"
#include "platform/linux/usdt_tracer.h"
#include "platform/platform.h"
#include "service/service_delegate.h"
#include "service/service_status.h"
#include "vocabulary/reporting_environment.h"

namespace {

using namespace vireo;
using namespace std::chrono_literals;

// How long queued work may still run after SIGTERM before the store is closed.
constexpr auto kDrainBudget = 3s;
// How long killService: waits for the store to commit before the process ends.
constexpr auto kKillFlushBudget = 500ms;

// killService: ends the process at once, after committing what the store holds.
class ExitProcessControl final : public ProcessControl {
 public:
  explicit ExitProcessControl(std::function<void()> beforeExit) : beforeExit_(std::move(beforeExit)) {}
  [[noreturn]] void exitProcess(int status) override {
    if (beforeExit_) beforeExit_();
    _exit(status);
  }

 private:
  const std::function<void()> beforeExit_;
};

// A held call keeps no descriptor (they are refused on the bus), but the store,
// the buses and the statistics tree need some: take what the hard limit allows,
// as systemd services get.
void raiseOpenFileLimit(Logger& logger) {
  rlimit limit{};
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur >= limit.rlim_max) return;
  limit.rlim_cur = limit.rlim_max;
  if (setrlimit(RLIMIT_NOFILE, &limit) != 0)
    VR_LOG(logger, LogScope::DefaultLog, LogLevel::Error, "main", "could not raise the open-file limit: %s",
           std::strerror(errno));
}

Dictionary storeStatus(const linux_platform::LocalStore& store) {
  auto s = store.status();
  return Dictionary{{"usable", Value(s.usable)},
                    {"pending_rows", Value(static_cast<unsigned long long>(s.pendingRows))},
                    {"pending_bytes", Value(static_cast<unsigned long long>(s.pendingBytes))},
                    {"refused_rows", Value(static_cast<unsigned long long>(s.refusedRows))},
                    {"dropped_bad_rows", Value(static_cast<unsigned long long>(s.droppedBadRows))},
                    {"write_errors", Value(static_cast<unsigned long long>(s.writeErrors))},
                    {"quota_dropped_rows", Value(static_cast<unsigned long long>(s.quotaDroppedRows))},
                    {"last_error", Value(s.lastError)}};
}

void usage(FILE* out) {
  std::fprintf(out,
               "Usage: vireo-reportingd [--help] [--version]\n"
               "\n"
               "The Vireo audio reporting daemon. Serves com.orvane.vireo.Reporting1 on the bus it\n"
               "was activated on, else the system bus as root and the session bus otherwise.\n"
               "\n"
               "Environment:\n"
               "  VIREO_BUS=system|session   the bus to serve on\n"
               "  VIREO_VERBOSE=SCOPES       debug logging: reporting_server_verbose,\n"
               "                             reporting_session_verbose, reporting_driver_verbose, or all\n"
               "  CONFIGURATION_DIRECTORY, STATE_DIRECTORY, LOGS_DIRECTORY, RUNTIME_DIRECTORY\n"
               "                             the service directories (set by systemd)\n"
               "\n"
               "Signals: SIGHUP re-reads the defaults; SIGTERM and SIGINT stop the daemon.\n");
}

}  // namespace

int main(int argc, char** argv) {
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--help") == 0 || std::strcmp(argv[i], "-h") == 0) {
      usage(stdout);
      return 0;
    }
    if (std::strcmp(argv[i], "--version") == 0) {
      std::printf("vireo-reportingd %s\n", VIREO_VERSION);
      return 0;
    }
    std::fprintf(stderr, "vireo-reportingd: unknown argument '%s'\n", argv[i]);
    usage(stderr);
    return 64;  // EX_USAGE
  }

  // Before any thread exists, so that only the bus loop receives them.
  daemon::blockServiceSignals();
  // One heap for every thread: per-thread arenas keep megabytes of fragments after a
  // burst that malloc_trim cannot hand back, and each thread's cache covers most of
  // the contention a shared heap would add.
  mallopt(M_ARENA_MAX, 1);

  auto logger = linux_platform::LinuxLogger::fromEnvironment();
  const auto directories = linux_platform::ServiceDirectories::fromEnvironment();
  VR_LOG(*logger, LogScope::DefaultLog, LogLevel::Info, "main",
         "vireo-reportingd %s: configuration %s, state %s, logs %s, runtime %s", VIREO_VERSION,
         directories.configuration.c_str(), directories.state.c_str(), directories.logs.c_str(),
         directories.runtime.c_str());

  raiseOpenFileLimit(*logger);
  std::vector<std::string> limitProblems;
  const ServiceLimits limits =
      linux_platform::readLimitsFile(directories.configuration + "/limits.conf", &limitProblems);
  for (const auto& problem : limitProblems)
    VR_LOG(*logger, LogScope::DefaultLog, LogLevel::Error, "main", "limits.conf: %s", problem.c_str());

  linux_platform::UsdtTracer tracer;
  linux_platform::SystemClock clock;
  linux_platform::SystemRandom random;
  ThreadPoolDispatcher dispatcher;
  linux_platform::LocalStore::Options storeOptions;
  storeOptions.maxPendingRows = limits.maxQueuedRows;
  std::string quotaProblem;
  storeOptions.maxStoreBytes =
      linux_platform::readMaxStoreBytes(directories.configuration + "/telemetry.conf", &quotaProblem);
  if (!quotaProblem.empty())
    VR_LOG(*logger, LogScope::DefaultLog, LogLevel::Error, "main", "telemetry.conf: %s", quotaProblem.c_str());
  linux_platform::LocalStoreServices store(directories, *logger, clock, storeOptions);
  linux_platform::SuiteFileDefaultsStore defaults(directories.configuration);
  daemon::NotificationCenter notifications;
  linux_platform::DevicePropertiesFile device(directories.configuration);
  linux_platform::ProcfsProcessTable processes;
  linux_platform::LinuxDiagnosticFiles files(directories.logs);
  linux_platform::StatsTreeLibrary driverStats(directories.runtime + "/stats");
  ExitProcessControl process([&store] { store.store->flush(kKillFlushBudget); });
  // Its handlers hold sessions: stop() in finish lets them go while the rest is alive.
  daemon::SensorOrientationService orientation(*logger);
  orientation.start();

  Platform platform{*logger,  tracer,        clock,  random,    dispatcher,  store.telemetry, store.analytics,
                    store.energyLog, defaults, notifications, device, processes, files, driverStats, process,
                    orientation};
  // The pool's closures use everything above: it stops before any of it goes away.
  auto finish = [&](int status) {
    orientation.stop();
    if (!dispatcher.drain(kDrainBudget))
      VR_LOG(*logger, LogScope::DefaultLog, LogLevel::Default, "main", "queued work still running after %lld ms",
             static_cast<long long>(std::chrono::milliseconds(kDrainBudget).count()));
    dispatcher.shutdown();
    store.close();
    return status;
  };

  auto environment = std::make_shared<ReportingEnvironment>(platform);
  environment->maxKeptBytesPerSession = limits.maxKeptBytesPerSession;
  auto delegate = VRReportingServiceDelegate::init(environment);
  if (!delegate) {
    VR_LOG(*logger, LogScope::DefaultLog, LogLevel::Error, "main", "the service could not be initialised");
    return finish(1);
  }

  daemon::BusService service(*logger, *delegate, notifications);
  daemon::BusService::Options options;
  options.interfaceOrientation = [&orientation](Orientation o) { orientation.pushInterfaceOrientation(o); };
  options.limits = limits;
  options.status = [&] {
    Dictionary status = serviceStatus(*delegate, *environment);
    status.set("store", Value(storeStatus(*store.store)));
    return status;
  };
  options.bus = daemon::chooseBus(std::getenv("VIREO_BUS"), std::getenv("DBUS_STARTER_BUS_TYPE"), geteuid() == 0);
  if (service.open(options) < 0) return finish(1);

  int loop = service.run();
  // Stop taking calls, let queued work finish for a while, then commit the store.
  service.close();
  return finish(loop == 0 ? 0 : 1);
}
