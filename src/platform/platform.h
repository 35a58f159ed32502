// Everything the engine needs of the platform, handed to it as one bundle. The
// daemon fills it with the Linux adapters, tests with recording fakes.
#pragma once

#include "dispatch/dispatch.h"
#include "platform/clock.h"
#include "platform/connection.h"
#include "platform/defaults.h"
#include "platform/device.h"
#include "platform/driver_stats.h"
#include "platform/event_sinks.h"
#include "platform/logger.h"
#include "platform/orientation.h"
#include "platform/telemetry_service.h"
#include "platform/tracer.h"

namespace vireo {

struct Platform {
  Logger& logger;
  Tracer& tracer;
  Clock& clock;
  RandomSource& random;
  Dispatcher& dispatcher;
  TelemetryService& telemetry;
  AnalyticsService& analytics;
  EnergyLogService& energyLog;
  DefaultsStore& defaults;
  NotificationService& notifications;
  DeviceProperties& device;
  ProcessTable& processes;
  DiagnosticFiles& files;
  DriverStatsLibrary& driverStats;
  ProcessControl& process;
  OrientationService& orientation;
};

}  // namespace vireo
