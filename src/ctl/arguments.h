// Parsing of vireoctl's words: protocol operations, typed KEY=VALUE entries,
// numbers (decimal or 0x hex) and times (Unix seconds or ISO 8601).
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/value.h"

namespace vireo::ctl {

enum class OpKind {
  Create, SetServiceType, ServiceType, Configure, Start, Send, Stop, Destroy, Valid, List, Kill,
  Sleep, WaitStart, Ping,
};

enum class StartMode { Pending, Wait, NoWait };
enum class Addressing { Broadcast, To, ToNone };

struct Operation {
  OpKind kind = OpKind::List;
  std::string name;  // the word as typed, for messages
  std::int64_t id = 0;
  std::uint16_t serviceType = 0;
  std::uint32_t category = 0;
  std::uint16_t type = 0;
  Dictionary entries;  // configure / send
  StartMode startMode = StartMode::Pending;
  Addressing addressing = Addressing::Broadcast;
  std::vector<std::int64_t> to;
  double seconds = 0;  // sleep; wait-start timeout (0: none)
};

// One operation from its words; nothing and a message in error on a usage error.
std::optional<Operation> parseOperation(const std::vector<std::string>& words, std::string* error);
// Splits a command line into operations at "--" words.
std::vector<std::vector<std::string>> splitSequence(const std::vector<std::string>& args);
// Splits a script line into words: blanks separate, '...' and "..." quote, '#' starts
// a comment outside quotes.
std::optional<std::vector<std::string>> splitLine(std::string_view line, std::string* error);

std::optional<std::int64_t> parseInt64(std::string_view text);
std::optional<std::uint64_t> parseUInt(std::string_view text, std::uint64_t max);
std::optional<double> parseDouble(std::string_view text);
// 12 -> int, 0x10 -> int, 1.5 -> double, true/false -> bool, s:text or anything else -> string.
Value parseTypedValue(std::string_view text);
// KEY=VALUE; nothing when there is no '=' or the key is empty.
bool parseEntry(std::string_view text, Dictionary& into);
// Unix seconds, or ISO 8601 (2026-03-16, 2026-03-16T14:15:03, with Z or +hh:mm;
// without a zone the time is UTC).
std::optional<double> parseTime(std::string_view text);

}  // namespace vireo::ctl
