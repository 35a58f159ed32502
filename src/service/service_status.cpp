#include "service/service_status.h"

#include "service/server_instance.h"
#include "service/service_delegate.h"
#include "session/reporting_session.h"
#include "vocabulary/reporting_environment.h"

namespace vireo {

Dictionary serviceStatus(const VRReportingServiceDelegate& delegate, const ReportingEnvironment& env) {
  Array clients;
  unsigned long long sessionCount = 0, started = 0;
  for (const auto& client : delegate.getAllClients()) {
    Array sessions;
    for (const auto& [reporterID, session] : client->clientReportingSessionMap()) {
      ++sessionCount;
      started += session->started() ? 1 : 0;
      sessions.emplace_back(Dictionary{{"reporterID", Value(static_cast<long long>(reporterID))},
                                       {"serviceType", Value(unsigned{session->serviceType()})},
                                       {"serviceName", Value(session->serviceName())},
                                       {"started", Value(session->started())}});
    }
    clients.emplace_back(Dictionary{{"pid", Value(client->processIdentifier())},
                                    {"process", Value(client->clientProcessName().value_or("unknown"))},
                                    {"sessions", Value(std::move(sessions))}});
  }
  return Dictionary{{"clients", Value(std::move(clients))},
                    {"sessions", Value(sessionCount)},
                    {"started_sessions", Value(started)},
                    {"kept_payloads_dropped", Value(static_cast<unsigned long long>(env.keptPayloadsDropped.load()))}};
}

}  // namespace vireo
