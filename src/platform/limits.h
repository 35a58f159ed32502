// What a client can make the daemon hold, bounded. Defaults suit a real device: a
// report is a few hundred bytes, a client runs a handful of sessions. The daemon
// reads them from limits.conf; every key is optional.
#pragma once

#include <cstddef>

namespace vireo {

struct ServiceLimits {
  std::size_t maxPayloadBytes = 256 * 1024;       // MaxPayloadBytes: one payload or configuration
  std::size_t maxPayloadEntries = 4096;           // MaxPayloadEntries: values in one payload
  std::size_t maxReporterIDsPerCall = 64;         // MaxReporterIDsPerCall: IDs in one SendMessage
  std::size_t maxSessionsPerClient = 64;          // MaxSessionsPerClient
  std::size_t maxClients = 512;                   // MaxClients: bus connections known at once
  std::size_t maxHeldStartsPerClient = 64;        // MaxHeldStartsPerClient: unanswered starts
  std::size_t maxKeptBytesPerSession = 1u << 20;  // MaxKeptBytesPerSession: payloads kept for the summary
  std::size_t maxQueuedRows = 100000;             // MaxQueuedRows: rows waiting for the store
};

}  // namespace vireo
