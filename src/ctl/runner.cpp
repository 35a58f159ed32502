#include "ctl/runner.h"

#include <nlohmann/json.hpp>

#include <chrono>
#include <thread>

#include "ctl/output.h"

namespace vireo::ctl {

namespace {

using json = nlohmann::ordered_json;

json idsJson(const std::vector<std::int64_t>& ids) {
  json a = json::array();
  for (auto id : ids) a.push_back(id);
  return a;
}

std::string idsText(const std::vector<std::int64_t>& ids) {
  if (ids.empty()) return "(none)";
  std::string s;
  for (auto id : ids) {
    if (!s.empty()) s += ' ';
    s += std::to_string(id);
  }
  return s;
}

std::string boolText(bool b) { return b ? "true" : "false"; }

}  // namespace

void Runner::print(const std::string& text, const json& line) {
  if (json_) std::fprintf(out_, "%s\n", line.dump(-1, ' ', false, json::error_handler_t::replace).c_str());
  else std::fprintf(out_, "%s\n", text.c_str());
  std::fflush(out_);
}

bool Runner::fail(const Operation& op, const client::Error& e) {
  printError(err_, json_, {op.name, e.name, e.message, e.domain, e.code});
  return false;
}

void Runner::reportArrivedStarts() {
  client_.pump(std::chrono::milliseconds(0));
  for (auto& [id, handles] : pending_) {
    for (auto& p : handles) {
      if (p.reported || !p.handle.ready()) continue;
      p.reported = true;
      auto r = p.handle.wait();
      if (r)
        print("start " + std::to_string(id) + ": answered " + boolText(*r),
              json{{"op", "start"}, {"reporterID", id}, {"answered", *r}});
      else
        printError(err_, json_,
                   {"start " + std::to_string(id), r.error().name, r.error().message, r.error().domain,
                    r.error().code});
    }
  }
}

bool Runner::waitStart(const Operation& op) {
  auto it = pending_.find(op.id);
  if (it == pending_.end() || it->second.empty())
    return fail(op, {"com.orvane.vireoctl.NoPendingStart", "no start of this reporter ID is waiting", {}, 0});
  client::StartHandle handle = it->second.front().handle;
  const bool reported = it->second.front().reported;
  std::optional<client::Result<bool>> r;
  if (op.seconds > 0)
    r = handle.waitFor(std::chrono::milliseconds(static_cast<long long>(op.seconds * 1000)));
  else
    r = handle.wait();
  if (!r) return fail(op, {"org.freedesktop.DBus.Error.Timeout", "no answer within the timeout", {}, 0});
  it->second.pop_front();
  if (reported) return true;
  if (!*r) return fail(op, r->error());
  print("start " + std::to_string(op.id) + ": answered " + boolText(**r),
        json{{"op", "start"}, {"reporterID", op.id}, {"answered", **r}});
  return true;
}

bool Runner::run(const Operation& op) {
  const std::string idText = std::to_string(op.id);
  auto boolResult = [&](const client::Result<bool>& r, const std::string& label) {
    if (!r) return fail(op, r.error());
    print(label + ": " + boolText(*r), json{{"op", op.name}, {"reporterID", op.id}, {"result", *r}});
    return true;
  };
  bool ok = true;
  switch (op.kind) {
    case OpKind::Create:
      ok = boolResult(client_.createReportingSession(op.id), "create " + idText);
      break;
    case OpKind::SetServiceType:
      ok = boolResult(client_.setServiceType(op.serviceType, op.id),
                      "set-service-type " + idText + " " + std::to_string(op.serviceType));
      break;
    case OpKind::ServiceType: {
      auto r = client_.getServiceNameForReporterID(op.id);
      if (!r) return fail(op, r.error());
      print("service-type " + idText + ": " + std::to_string(*r),
            json{{"op", op.name}, {"reporterID", op.id}, {"serviceType", *r}});
      break;
    }
    case OpKind::Configure:
      ok = boolResult(client_.setConfiguration(op.entries, op.id), "configure " + idText);
      break;
    case OpKind::Start:
      if (op.startMode == StartMode::NoWait) {
        auto r = client_.startReportingSessionForIDNoWait(op.id);
        if (!r) return fail(op, r.error());
        print("start " + idText + ": sent", json{{"op", "start"}, {"reporterID", op.id}, {"sent", true}});
      } else {
        pending_[op.id].push_back({client_.startReportingSessionForID(op.id), false});
        if (op.startMode == StartMode::Wait) {
          Operation wait = op;
          wait.kind = OpKind::WaitStart;
          wait.seconds = 0;
          return waitStart(wait);
        }
        print("start " + idText + ": sent, answer pending",
              json{{"op", "start"}, {"reporterID", op.id}, {"pending", true}});
      }
      break;
    case OpKind::Send: {
      std::optional<std::vector<std::int64_t>> ids;
      if (op.addressing == Addressing::To) ids = op.to;
      if (op.addressing == Addressing::ToNone) ids.emplace();
      auto r = client_.sendMessage(op.entries, op.category, op.type, ids);
      if (!r) return fail(op, r.error());
      json j{{"op", "send"}, {"category", op.category}, {"type", op.type}, {"result", "ok"}};
      j["to"] = ids ? idsJson(*ids) : json(nullptr);
      print("send: ok", j);
      break;
    }
    case OpKind::Stop:
      ok = boolResult(client_.stopReportingSessionForID(op.id), "stop " + idText);
      break;
    case OpKind::Destroy:
      ok = boolResult(client_.destroyReportingSession(op.id), "destroy " + idText);
      break;
    case OpKind::Valid: {
      auto r = client_.reporterIDValid(op.id);
      if (!r) return fail(op, r.error());
      print("valid " + idText + ": reporterID=" + std::to_string(r->reporterID) +
                " serviceType=" + std::to_string(r->serviceType),
            json{{"op", "valid"}, {"reporterID", r->reporterID}, {"serviceType", r->serviceType}});
      break;
    }
    case OpKind::List: {
      auto r = client_.getAllReporters();
      if (!r) return fail(op, r.error());
      print("list: " + idsText(*r), json{{"op", "list"}, {"reporterIDs", idsJson(*r)}});
      break;
    }
    case OpKind::Kill: {
      auto r = client_.killService();
      if (!r) return fail(op, r.error());
      print("kill: sent", json{{"op", "kill"}, {"sent", true}});
      break;
    }
    case OpKind::Ping: {
      auto r = client_.ping();
      if (!r) return fail(op, r.error());
      print("ping: ok", json{{"op", "ping"}, {"result", "ok"}});
      break;
    }
    case OpKind::Sleep: {
      // Keeps answering the connection while sleeping so start answers show up.
      auto until = std::chrono::steady_clock::now() + std::chrono::duration<double>(op.seconds);
      while (std::chrono::steady_clock::now() < until) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(until - std::chrono::steady_clock::now());
        client_.pump(std::min(left, std::chrono::milliseconds(100)));
        reportArrivedStarts();
      }
      break;
    }
    case OpKind::WaitStart:
      return waitStart(op);
  }
  reportArrivedStarts();
  return ok;
}

namespace {
std::string textOf(const Dictionary& d, const char* key) {
  const Value* v = d.find(key);
  return v ? v->text() : "?";
}
}  // namespace

std::string formatStatus(const Dictionary& status) {
  std::string out = "sessions: " + textOf(status, "sessions") + " (" + textOf(status, "started_sessions") +
                    " started), bus clients: " + textOf(status, "bus_clients") + "\n";
  if (const Value* clients = status.find("clients"); clients && clients->asArray()) {
    for (const Value& c : *clients->asArray()) {
      const Dictionary* client = c.asDictionary();
      if (!client) continue;
      out += "  pid " + textOf(*client, "pid") + " " + textOf(*client, "process") + ":";
      if (const Value* sessions = client->find("sessions"); sessions && sessions->asArray()) {
        for (const Value& s : *sessions->asArray()) {
          const Dictionary* session = s.asDictionary();
          if (!session) continue;
          const Value* started = session->find("started");
          out += ' ';
          out += textOf(*session, "reporterID") + " (" + textOf(*session, "serviceName") +
                 (started && started->asBool() && *started->asBool() ? ", started)" : ")");
        }
      }
      out += "\n";
    }
  }
  if (const Value* store = status.find("store"); store && store->asDictionary()) {
    const Dictionary& s = *store->asDictionary();
    out += "store: " + textOf(s, "pending_rows") + " rows waiting, " + textOf(s, "refused_rows") + " refused, " +
           textOf(s, "dropped_bad_rows") + " bad rows dropped, " + textOf(s, "write_errors") + " write errors";
    if (const Value* e = s.find("last_error"); e && e->asString() && !e->asString()->empty())
      out += " (last: " + *e->asString() + ")";
    out += "\n";
  }
  out += "kept payloads dropped: " + textOf(status, "kept_payloads_dropped") + "\n";
  out += "limits hit:";
  const Value* hits = status.find("limits_hit");
  if (!hits || !hits->asDictionary() || hits->asDictionary()->empty()) out += " none";
  else
    for (const auto& [limit, count] : *hits->asDictionary()) {
      out += ' ';
      out += limit.text() + "=" + count.text();
    }
  return out + "\n";
}

}  // namespace vireo::ctl
