// createSummaryEventForSession: the flat summary sent at stop and, on internal
// builds, the session's payloads as a pretty JSON file in the diagnostic logs.
#include <ctime>
#include <limits>
#include <string>
#include <utility>
#include <vector>

#include "platform/logger.h"
#include "session/reporting_session.h"
#include "vocabulary/reporting_environment.h"
#include "vocabulary/reporting_utility.h"

namespace vireo {

namespace {

constexpr const char* kLabel = "-[VRReportingSession createSummaryEventForSession]";
constexpr const char* kSummaryKey = "VR_Session_Summary_Event";

// "yyyyMMdd-HHmmssZ" in local time, e.g. 20260316-141503+0100.
std::string fileTimestamp(WallTime now) {
  std::time_t t = std::chrono::system_clock::to_time_t(now);
  std::tm local{};
  localtime_r(&t, &local);
  char buf[64];
  std::size_t n = std::strftime(buf, sizeof buf, "%Y%m%d-%H%M%S%z", &local);
  return std::string(buf, n);
}

// A client-chosen name must stay one path component.
std::string fileNamePart(std::string text) {
  for (char& c : text)
    if (c == '/' || c == '\0') c = '_';
  return text;
}

}  // namespace

std::optional<Dictionary> VRReportingSession::createSummaryEventForSession() {
  std::shared_ptr<AggregatedPayloads> payloads = aggregatedPayloadData();
  if (!payloads) return std::nullopt;

  // Key -> every value seen under it, in payload order; the index keeps keys in
  // first-seen order while lookups stay cheap.
  std::vector<std::pair<Value, std::vector<Value>>> gathered;
  Dictionary indexOf;
  gathered.push_back({Value(kSummaryKey), {Value(static_cast<unsigned>(serviceType_.load()))}});
  indexOf.set(Value(kSummaryKey), Value(0));
  {
    MutexLock guard(payloads->lock);
    if (payloads->entries.empty()) return std::nullopt;
    payloads->forEachLocked([&](const Value& element) {
      const Dictionary* payload = element.asDictionary();
      if (!payload) return;
      for (const auto& [key, value] : *payload) {
        std::size_t slot;
        if (const Value* found = indexOf.find(key)) {
          slot = static_cast<std::size_t>(*found->toInt64());
        } else {
          slot = gathered.size();
          gathered.push_back({key, {}});
          indexOf.set(key, Value(static_cast<unsigned long long>(slot)));
        }
        gathered[slot].second.push_back(value);
      }
    });
  }

  Dictionary result;
  result.reserve(gathered.size());
  for (const auto& [key, values] : gathered) {
    std::string joined;
    for (std::size_t i = 0; i < values.size(); ++i) {
      if (i) joined += ',';
      joined += values[i].text();
    }
    result.set(key, Value(std::move(joined)));
  }

  const Dictionary info = userInfo();
  {
    MutexLock guard(payloads->lock);
    payloads->appendLocked(Value(info), std::numeric_limits<std::size_t>::max(), true);
  }

  if (!VRReportingIsInternalBuild(*env_)) return result;

  Logger& logger = env_->logger();
  DiagnosticFiles& files = env_->platform.files;
  // One error slot for serialisation, directory and write, never cleared between
  // them: an earlier failure is reported again by the final check.
  std::optional<Error> error;

  std::optional<std::string> text;
  {
    MutexLock guard(payloads->lock);
    JsonError jsonError;
    text = toJson(Value(payloads->arrayLocked()), JsonMode::Strict, true, &jsonError);
    if (!text) error = Error{kGeneralErrorDomain, 0, jsonError.message};
  }
  if (!text) VR_LOG(logger, LogScope::Session, LogLevel::Error, kLabel, "dataWithJSONObject: %s", error->description.c_str());

  const std::string directory = files.logDirectory() + "/Audio/Reporting";
  Error directoryError;
  if (!files.createDirectory(directory, 0777, &directoryError)) {
    error = directoryError;
    VR_LOG(logger, LogScope::Session, LogLevel::Error, kLabel, "can't create logging directory at %s: %s",
           directory.c_str(), directoryError.description.c_str());
  }

  const Value* app = info.find(kHostApplicationDisplayIDKey);
  const std::string appName = app && !app->isAbsent() ? app->text() : std::string("unknown");
  const std::string path = directory + "/" + fileTimestamp(env_->platform.clock.now()) + "-vireo-" +
                           fileNamePart(appName) + "-" + fileNamePart(serviceNameOrUnknown(serviceType_.load())) +
                           ".json";
  if (text) {
    Error writeError;
    if (!files.writeAtomically(path, *text, &writeError)) error = writeError;
  }
  if (error)
    VR_LOG(logger, LogScope::Session, LogLevel::Error, kLabel, "jsonOutput writeToURL: %s", error->description.c_str());
  return result;
}

}  // namespace vireo
