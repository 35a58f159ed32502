#include "platform/linux/store/telemetry_service.h"

#include <sys/random.h>

#include <chrono>
#include <random>
#include <utility>

#include "platform/linux/key_file.h"
#include "platform/linux/store/completion_thread.h"

namespace vireo::linux_platform {

// What the service and its sessions share; sessions may outlive the service.
struct LocalTelemetryCore {
  std::shared_ptr<LocalStore> store;
  std::string configurationDirectory;
  CompletionThread thread;  // runs every completion, in order
};

namespace {

constexpr std::chrono::seconds kFlushTimeout{10};

void fail(std::optional<Error>* error, const LocalStore& store, const char* what) {
  if (!error) return;
  *error = Error{kGeneralErrorDomain, store.usable() ? 2 : 1,
                 std::string(store.usable() ? "the local store is overloaded: " : "the local store is unavailable: ") +
                     what};
}

std::string randomHex(std::size_t bytes) {
  std::vector<unsigned char> raw(bytes);
  std::size_t got = 0;
  while (got < bytes) {
    ssize_t n = ::getrandom(raw.data() + got, bytes - got, 0);
    if (n <= 0) break;
    got += static_cast<std::size_t>(n);
  }
  if (got < bytes) {
    std::random_device device;
    for (auto& b : raw) b = static_cast<unsigned char>(device());
  }
  static constexpr char kHex[] = "0123456789abcdef";
  std::string text;
  text.reserve(bytes * 2);
  for (unsigned char b : raw) {
    text.push_back(kHex[b >> 4]);
    text.push_back(kHex[b & 15]);
  }
  return text;
}

}  // namespace

LocalTelemetryService::LocalTelemetryService(std::shared_ptr<LocalStore> store, std::string configurationDirectory)
    : core_(std::make_shared<LocalTelemetryCore>()) {
  core_->store = std::move(store);
  core_->configurationDirectory = std::move(configurationDirectory);
}

LocalTelemetryService::~LocalTelemetryService() = default;

std::shared_ptr<HierarchyToken> LocalTelemetryService::makeHierarchyToken() {
  return std::make_shared<HierarchyToken>(HierarchyToken{randomHex(16)});
}

std::shared_ptr<TelemetrySession> LocalTelemetryService::createSession(const Dictionary& sessionInfo,
                                                                       const Dictionary& userInfo,
                                                                       const std::vector<std::string>&) {
  LocalStore& store = *core_->store;
  const std::uint64_t mark = store.handedOver();
  auto rowId = store.insertTelemetrySession(sessionInfo, userInfo, store.now());
  if (!rowId) {
    VR_LOG(store.logger(), LogScope::DefaultLog, LogLevel::Error, "LocalTelemetryService::createSession",
           "telemetry session not recorded in %s", store.path().c_str());
  }
  std::string token;
  if (const Value* v = sessionInfo.find(telemetry_keys::kHierarchyToken)) token = v->text();
  return std::make_shared<LocalTelemetrySession>(core_, rowId, std::move(token), mark);
}

bool LocalTelemetryService::sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo,
                                           std::uint16_t category, std::uint16_t type, const Dictionary& payload,
                                           std::optional<Error>* error) {
  LocalStore& store = *core_->store;
  if (store.insertTelemetryMessage(std::nullopt, &sessionInfo, &userInfo, category, type, payload, store.now()))
    return true;
  fail(error, store, "message not recorded");
  return false;
}

std::optional<std::vector<std::string>> LocalTelemetryService::readBackends(const std::string& configurationDirectory) {
  auto file = readKeyFile(configurationDirectory + "/telemetry.conf");
  if (!file) return std::vector<std::string>{"local"};
  auto it = file->find("Backends");
  if (it == file->end()) return std::vector<std::string>{"local"};
  if (it->second == "none") return std::nullopt;
  return splitList(it->second);
}

LocalTelemetrySession::LocalTelemetrySession(std::shared_ptr<LocalTelemetryCore> core,
                                             std::optional<std::int64_t> rowId, std::string token,
                                             std::uint64_t mark)
    : core_(std::move(core)), rowId_(rowId), token_(std::move(token)), flushMark_(mark) {}

void LocalTelemetrySession::startConfiguration(
    std::function<void(std::optional<std::vector<std::string>> backends)> completion) {
  core_->thread.post([store = core_->store, directory = core_->configurationDirectory, rowId = rowId_,
                      completion = std::move(completion)] {
    auto backends = LocalTelemetryService::readBackends(directory);
    if (rowId) store->setBackends(*rowId, backends);
    if (completion) completion(std::move(backends));
  });
}

bool LocalTelemetrySession::sendMessage(std::uint16_t category, std::uint16_t type, const Dictionary& payload,
                                        std::optional<Error>* error) {
  LocalStore& store = *core_->store;
  if (!rowId_) {
    fail(error, store, "the telemetry session was not recorded");
    return false;
  }
  if (store.insertTelemetryMessage(*rowId_, nullptr, nullptr, category, type, payload, store.now())) return true;
  fail(error, store, "message not recorded");
  return false;
}

void LocalTelemetrySession::flushMessages(std::function<void(std::optional<Error>)> completion) {
  LocalStore& store = *core_->store;
  const std::uint64_t since = flushMark_.exchange(store.handedOver());
  if (rowId_) store.setFlushed(*rowId_, store.now());
  // The writer commits as soon as it is idle; waiting here only holds up later
  // completions by one commit.
  core_->thread.post([store = core_->store, since, completion = std::move(completion)] {
    const bool ok = store->flush(kFlushTimeout, since);
    if (!completion) return;
    if (ok) {
      completion(std::nullopt);
    } else {
      completion(Error{kGeneralErrorDomain, store->usable() ? 3 : 1, "the local store could not write the messages"});
    }
  });
}

std::string LocalTelemetrySession::description() const {
  return "<LocalTelemetrySession id=" + (rowId_ ? std::to_string(*rowId_) : std::string("none")) +
         " token=" + token_ + ">";
}

}  // namespace vireo::linux_platform
