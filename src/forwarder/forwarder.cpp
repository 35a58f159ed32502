#include "forwarder/forwarder.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <limits>
#include <nlohmann/json.hpp>

#include "platform/linux/store/change_log.h"

namespace vireo::forwarder {

namespace {

double unixNow() {
  return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

// Exit status of the test hook's deliberate end, after a batch's 200.
constexpr int kExitAfterSend = 70;

}  // namespace

Forwarder::Forwarder(ForwarderConfig config, std::string device, std::string storePath, Logger& logger, Hooks hooks)
    : config_(std::move(config)),
      device_(std::move(device)),
      storePath_(std::move(storePath)),
      logger_(logger),
      hooks_(std::move(hooks)),
      client_(config_, hooks_.cancelled) {}

Forwarder::Result Forwarder::fail(const std::string& error) {
  if (hooks_.cancelled()) return Result::Stopped;
  // The table may have been dropped, or the server replaced: check again next time.
  schemaReady_ = false;
  if (failures_ == 0 || error != lastError_) {
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, "Forwarder::pass",
           "forwarding failed, rows wait in the store: %s", error.c_str());
  }
  ++failures_;
  lastError_ = error;
  lastErrorAt_ = unixNow();
  return Result::Failed;
}

bool Forwarder::openStore(std::string* error) {
  if (!store_) store_ = ForwardStore::open(storePath_, error);
  return store_ != nullptr;
}

bool Forwarder::sendBatch(const char* table, const Batch& batch, std::string* error) {
  if (!client_.post("INSERT INTO " + config_.database + "." + table + " FORMAT JSONEachRow", batch.body, error))
    return false;
  if (hooks_.exitAfterFirstSend) _exit(kExitAfterSend);
  sent_[table] += static_cast<std::uint64_t>(batch.rows);
  return true;
}

bool Forwarder::sendDropped(std::string* error) {
  std::map<std::string, DroppedCount> counts;
  std::int64_t sent = 0;
  if (!store_->dropped(&counts, error) || !store_->cursor(kDroppedName, &sent, error)) return false;
  // The counts only grow, so their total tells whether any changed.
  std::int64_t total = 0;
  for (const auto& [table, count] : counts) total += count.forwarded + count.unforwarded;
  if (total == sent) return true;
  using Json = nlohmann::json;
  const double now = unixNow();
  std::string body;
  for (const auto& [table, count] : counts) {
    const auto forwarded = static_cast<std::uint64_t>(std::max<std::int64_t>(count.forwarded, 0));
    const auto unforwarded = static_cast<std::uint64_t>(std::max<std::int64_t>(count.unforwarded, 0));
    if (forwarded + unforwarded == 0) continue;
    const Json row = {{"device", device_},         {"tbl", table}, {"forwarded", forwarded},
                      {"unforwarded", unforwarded}, {"at", now},    {"version", forwarded + unforwarded}};
    body += row.dump(-1, ' ', false, Json::error_handler_t::replace) + "\n";
  }
  if (!body.empty() &&
      !client_.post("INSERT INTO " + config_.database + "." + kDroppedName + " FORMAT JSONEachRow", body, error))
    return false;
  return store_->commit(kDroppedName, total, error);
}

Forwarder::Result Forwarder::pass() {
  std::string error;
  if (!openStore(&error)) {
    if (!error.empty()) return fail(error);
    if (!reportedNoStore_)
      VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Default, "Forwarder::pass", "no store at %s yet: nothing to forward",
             storePath_.c_str());
    reportedNoStore_ = true;
    return Result::Done;
  }
  if (!schemaReady_) {
    if (!client_.ensureSchema(&error)) return fail(error);
    schemaReady_ = true;
  }
  std::map<std::string, std::int64_t> sentNow;
  // Oldest rows first, one batch per table in turn so that no table waits for
  // another's backlog, back to back until every table is caught up.
  for (bool more = true; more && hooks_.consent();) {
    more = false;
    for (const auto& table : forwardedTables()) {
      if (hooks_.cancelled()) return Result::Stopped;
      std::int64_t cursor = 0;
      std::int64_t upTo = std::numeric_limits<std::int64_t>::max();
      if (!store_->cursor(table.name, &cursor, &error)) return fail(error);
      if (&table == &forwardedTables().front() && !store_->raiseWatchMark(&upTo, &error)) return fail(error);
      Batch batch;
      if (!store_->readRows(table, cursor, upTo, config_.batchRows, device_, &batch, &error)) return fail(error);
      if (batch.entries == 0) continue;
      if (!sendBatch(table.name, batch, &error) || !store_->commit(table.name, batch.last, &error))
        return fail(error);
      sentNow[table.name] += batch.rows;
      more = more || batch.entries == config_.batchRows;
    }
    if (hooks_.cancelled()) return Result::Stopped;
    std::int64_t cursor = 0;
    Batch changes;
    if (!store_->cursor(kChangesName, &cursor, &error) ||
        !store_->readChanges(cursor, config_.batchRows, device_, &changes, &error))
      return fail(error);
    if (changes.entries == 0) continue;
    if (changes.rows > 0 && !sendBatch(forwardedTables().front().name, changes, &error)) return fail(error);
    if (!store_->commit(kChangesName, changes.last, &error)) return fail(error);
    sentNow[kChangesName] += changes.rows;
    more = more || changes.entries == config_.batchRows;
  }
  if (hooks_.cancelled()) return Result::Stopped;
  if (hooks_.consent() && !sendDropped(&error)) return fail(error);
  if (failures_ > 0) {
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Default, "Forwarder::pass",
           "forwarding again after %llu failed attempts", static_cast<unsigned long long>(failures_));
  }
  // Progress shows in forwarder.json; the log has it on request (VIREO_VERBOSE=all).
  if (!sentNow.empty() && logger_.verbose(LogScope::DefaultLog)) {
    std::string counts;
    for (const auto& [name, rows] : sentNow) counts += (counts.empty() ? "" : ", ") + name + " " + std::to_string(rows);
    VR_DEBUG(logger_, LogScope::DefaultLog, "Forwarder::pass", "sent %s", counts.c_str());
  }
  failures_ = 0;
  lastSuccess_ = unixNow();
  return Result::Done;
}

void Forwarder::prune() {
  if (!store_ || config_.keepForwarded.count() == 0) return;
  std::string error;
  const double cutoff = unixNow() - static_cast<double>(config_.keepForwarded.count());
  const auto deleted = store_->prune(cutoff, hooks_.cancelled, &error);
  pruned_ += deleted;
  if (!error.empty()) {
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, "Forwarder::prune", "%s", error.c_str());
  } else if (deleted > 0) {
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Info, "Forwarder::prune", "deleted %llu forwarded rows",
           static_cast<unsigned long long>(deleted));
  }
}

void Forwarder::writeStatus(const std::string& path, bool consent, double nextAttempt) {
  using Json = nlohmann::json;
  auto time = [](double t) { return t > 0 ? Json(t) : Json(nullptr); };
  Json tables = Json::object();
  std::string error;
  openStore(&error);  // the backlog shows while nothing is sent, too
  auto table = [&](const char* name) {
    std::int64_t cursor = 0;
    Json entry = Json::object();
    if (store_ && store_->cursor(name, &cursor, &error)) {
      entry["cursor"] = cursor;
      entry["backlog"] = store_->backlog(name, cursor);
    } else {
      entry["cursor"] = nullptr;
      entry["backlog"] = nullptr;
    }
    auto it = sent_.find(name);
    entry["sent"] = it == sent_.end() ? 0 : it->second;
    tables[name] = std::move(entry);
  };
  for (const auto& t : forwardedTables()) table(t.name);
  table(kChangesName);
  Json dropped = Json::object();
  std::map<std::string, DroppedCount> counts;
  if (store_ && store_->dropped(&counts, &error)) {
    for (const auto& [name, count] : counts)
      dropped[name] = {{"forwarded", count.forwarded}, {"unforwarded", count.unforwarded}};
  }
  Json status = {{"device", device_},
                 {"consent", consent},
                 {"updated_at", unixNow()},
                 {"last_success_at", time(lastSuccess_)},
                 {"last_error", lastError_.empty() ? Json(nullptr) : Json(lastError_)},
                 {"last_error_at", time(lastErrorAt_)},
                 {"failed_attempts", failures_},
                 {"next_attempt_at", time(nextAttempt)},
                 {"pruned_rows", pruned_},
                 {"tables", std::move(tables)},
                 {"dropped", std::move(dropped)}};
  const std::string text = status.dump(2, ' ', false, Json::error_handler_t::replace) + "\n";
  std::string tmp = path + ".XXXXXX";
  const int fd = mkstemp(tmp.data());
  bool ok = fd >= 0 && fchmod(fd, 0644) == 0 && ::write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
  if (fd >= 0) ok = ::close(fd) == 0 && ok;
  if (ok) ok = ::rename(tmp.c_str(), path.c_str()) == 0;
  if (!ok) {
    VR_LOG(logger_, LogScope::DefaultLog, LogLevel::Error, "Forwarder::writeStatus", "cannot write %s: %s",
           path.c_str(), std::strerror(errno));
    if (fd >= 0) ::unlink(tmp.c_str());
  }
}

}  // namespace vireo::forwarder
