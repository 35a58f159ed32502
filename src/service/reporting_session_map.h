// A client's sessions by reporter ID, in the order the IDs were first stored.
// Storing under an existing ID replaces the session but keeps the ID's place, so
// getAllReporters lists IDs in the order the client created them. Not locked: the
// owning server instance guards it.
#pragma once

#include <cstdint>
#include <list>
#include <memory>
#include <unordered_map>
#include <utility>
#include <vector>

namespace vireo {

class VRReportingSession;

class ReportingSessionMap {
 public:
  using Entry = std::pair<std::int64_t, std::shared_ptr<VRReportingSession>>;

  std::shared_ptr<VRReportingSession> find(std::int64_t reporterID) const {
    auto it = index_.find(reporterID);
    return it == index_.end() ? nullptr : it->second->second;
  }

  // Replaces the session stored under reporterID in place, otherwise appends.
  void set(std::int64_t reporterID, std::shared_ptr<VRReportingSession> session) {
    auto it = index_.find(reporterID);
    if (it != index_.end()) {
      it->second->second = std::move(session);
      return;
    }
    order_.emplace_back(reporterID, std::move(session));
    index_.emplace(reporterID, std::prev(order_.end()));
  }

  // Removes the entry and hands its session back (null when there was none), so the
  // caller decides where the session is released.
  std::shared_ptr<VRReportingSession> erase(std::int64_t reporterID) {
    auto it = index_.find(reporterID);
    if (it == index_.end()) return nullptr;
    auto session = std::move(it->second->second);
    order_.erase(it->second);
    index_.erase(it);
    return session;
  }

  std::vector<Entry> entries() const { return {order_.begin(), order_.end()}; }
  std::size_t size() const { return order_.size(); }

 private:
  std::list<Entry> order_;
  std::unordered_map<std::int64_t, std::list<Entry>::iterator> index_;
};

}  // namespace vireo
