#include "daemon/bus_choice.h"

#include <cstring>
#include <optional>

namespace vireo::daemon {

namespace {

std::optional<BusKind> parse(const char* text) {
  if (!text) return std::nullopt;
  if (std::strcmp(text, "system") == 0) return BusKind::System;
  if (std::strcmp(text, "session") == 0 || std::strcmp(text, "user") == 0) return BusKind::Session;
  return std::nullopt;
}

}  // namespace

BusKind chooseBus(const char* vireoBus, const char* starterBusType, bool root) {
  if (auto kind = parse(vireoBus)) return *kind;
  if (auto kind = parse(starterBusType)) return *kind;
  return root ? BusKind::System : BusKind::Session;
}

const char* busKindName(BusKind kind) { return kind == BusKind::System ? "system" : "session"; }

}  // namespace vireo::daemon
