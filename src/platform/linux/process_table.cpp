#include "platform/linux/process_table.h"

#include <unistd.h>

#include <fstream>

namespace vireo::linux_platform {

namespace {
// The kernel's command name is at most 15 bytes; allow one more for safety.
constexpr std::size_t kMaxShortName = 16;
constexpr std::string_view kReplacement = "\xEF\xBF\xBD";

// The length of the well-formed sequence at text[i], or 0.
std::size_t sequenceLength(std::string_view text, std::size_t i) {
  auto byte = [&](std::size_t k) { return static_cast<unsigned char>(text[k]); };
  unsigned char lead = byte(i);
  if (lead == 0) return 0;  // a bus string cannot hold NUL
  if (lead < 0x80) return 1;
  std::size_t length;
  unsigned char low = 0x80, high = 0xBF;  // the allowed range of the second byte
  if (lead >= 0xC2 && lead <= 0xDF) {
    length = 2;
  } else if (lead >= 0xE0 && lead <= 0xEF) {
    length = 3;
    if (lead == 0xE0) low = 0xA0;   // no overlong forms
    if (lead == 0xED) high = 0x9F;  // no surrogates
  } else if (lead >= 0xF0 && lead <= 0xF4) {
    length = 4;
    if (lead == 0xF0) low = 0x90;
    if (lead == 0xF4) high = 0x8F;  // nothing above U+10FFFF
  } else {
    return 0;
  }
  if (i + length > text.size()) return 0;
  if (byte(i + 1) < low || byte(i + 1) > high) return 0;
  for (std::size_t k = 2; k < length; ++k) {
    if (byte(i + k) < 0x80 || byte(i + k) > 0xBF) return 0;
  }
  return length;
}
}  // namespace

std::string validUtf8(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (std::size_t i = 0; i < text.size();) {
    std::size_t n = sequenceLength(text, i);
    if (n == 0) {
      out += kReplacement;
      ++i;
    } else {
      out.append(text.substr(i, n));
      i += n;
    }
  }
  return out;
}

ProcfsProcessTable::ProcfsProcessTable(std::string procRoot) : procRoot_(std::move(procRoot)) {}

std::int32_t ProcfsProcessTable::selfPid() const { return static_cast<std::int32_t>(::getpid()); }

std::optional<std::string> ProcfsProcessTable::selfName() const { return readComm("self"); }

std::optional<std::string> ProcfsProcessTable::shortName(std::int32_t pid) const {
  if (pid < 1) return std::nullopt;
  return readComm(std::to_string(pid));
}

std::optional<std::string> ProcfsProcessTable::readComm(const std::string& entry) const {
  std::ifstream in(procRoot_ + "/" + entry + "/comm", std::ios::binary);
  if (!in) return std::nullopt;
  std::string name;
  char c;
  while (name.size() <= kMaxShortName && in.get(c)) name += c;
  if (in.bad()) return std::nullopt;
  if (auto nl = name.find('\n'); nl != std::string::npos) name.resize(nl);
  if (name.size() > kMaxShortName) name.resize(kMaxShortName);
  return validUtf8(name);
}

}  // namespace vireo::linux_platform
