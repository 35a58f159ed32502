#include "ctl/arguments.h"

#include <charconv>
#include <cmath>
#include <cstdio>
#include <ctime>

namespace vireo::ctl {

namespace {

bool startsWith(std::string_view s, std::string_view p) { return s.substr(0, p.size()) == p; }

template <class T>
std::optional<T> parseIntegral(std::string_view text) {
  bool negative = false;
  std::string_view digits = text;
  if (!digits.empty() && (digits[0] == '-' || digits[0] == '+')) {
    negative = digits[0] == '-';
    digits.remove_prefix(1);
  }
  int base = 10;
  if (startsWith(digits, "0x") || startsWith(digits, "0X")) {
    base = 16;
    digits.remove_prefix(2);
  }
  if (digits.empty()) return std::nullopt;
  std::uint64_t magnitude = 0;
  auto [p, ec] = std::from_chars(digits.data(), digits.data() + digits.size(), magnitude, base);
  if (ec != std::errc() || p != digits.data() + digits.size()) return std::nullopt;
  if constexpr (std::is_signed_v<T>) {
    if (negative) {
      if (magnitude > std::uint64_t{1} << 63) return std::nullopt;
      return static_cast<T>(0 - magnitude);
    }
    if (magnitude > static_cast<std::uint64_t>(INT64_MAX)) return std::nullopt;
    return static_cast<T>(magnitude);
  } else {
    if (negative) return std::nullopt;
    return static_cast<T>(magnitude);
  }
}

struct OperationForm {
  const char* word;
  OpKind kind;
};

constexpr OperationForm kOps[] = {
    {"create", OpKind::Create},         {"set-service-type", OpKind::SetServiceType},
    {"service-type", OpKind::ServiceType}, {"configure", OpKind::Configure},
    {"start", OpKind::Start},           {"send", OpKind::Send},
    {"stop", OpKind::Stop},             {"destroy", OpKind::Destroy},
    {"valid", OpKind::Valid},           {"list", OpKind::List},
    {"kill", OpKind::Kill},             {"sleep", OpKind::Sleep},
    {"wait-start", OpKind::WaitStart},  {"ping", OpKind::Ping},
};

bool fail(std::string* error, std::string text) {
  if (error) *error = std::move(text);
  return false;
}

bool takeID(const std::vector<std::string>& w, size_t i, Operation& op, std::string* error) {
  if (i >= w.size()) return fail(error, op.name + ": missing reporter ID");
  auto id = parseInt64(w[i]);
  if (!id) return fail(error, op.name + ": bad reporter ID '" + w[i] + "'");
  op.id = *id;
  return true;
}

bool parseIDList(std::string_view text, std::vector<std::int64_t>& out) {
  while (!text.empty()) {
    auto comma = text.find(',');
    auto item = text.substr(0, comma);
    text = comma == std::string_view::npos ? std::string_view{} : text.substr(comma + 1);
    if (item.empty()) continue;
    auto id = parseInt64(item);
    if (!id) return false;
    out.push_back(*id);
  }
  return true;
}

bool parseSend(const std::vector<std::string>& w, Operation& op, std::string* error) {
  size_t i = 1;
  for (; i < w.size() && startsWith(w[i], "--"); ++i) {
    const std::string& flag = w[i];
    if (flag == "--broadcast") {
      op.addressing = Addressing::Broadcast;
    } else if (flag == "--to-none") {
      op.addressing = Addressing::ToNone;
      op.to.clear();
    } else if (flag == "--to" || startsWith(flag, "--to=")) {
      std::string list;
      if (flag == "--to") {
        if (++i >= w.size()) return fail(error, "send: --to needs a list of reporter IDs");
        list = w[i];
      } else {
        list = flag.substr(5);
      }
      op.addressing = Addressing::To;
      if (!parseIDList(list, op.to)) return fail(error, "send: bad reporter ID list '" + list + "'");
    } else {
      return fail(error, "send: unknown option " + flag);
    }
  }
  if (i + 2 > w.size()) return fail(error, "send: needs CATEGORY TYPE [KEY=VALUE...]");
  auto category = parseUInt(w[i], UINT32_MAX);
  if (!category) return fail(error, "send: bad category '" + w[i] + "'");
  auto type = parseUInt(w[i + 1], UINT16_MAX);
  if (!type) return fail(error, "send: bad type '" + w[i + 1] + "'");
  op.category = static_cast<std::uint32_t>(*category);
  op.type = static_cast<std::uint16_t>(*type);
  for (i += 2; i < w.size(); ++i)
    if (!parseEntry(w[i], op.entries)) return fail(error, "send: expected KEY=VALUE, got '" + w[i] + "'");
  return true;
}

}  // namespace

std::optional<std::int64_t> parseInt64(std::string_view text) { return parseIntegral<std::int64_t>(text); }

std::optional<std::uint64_t> parseUInt(std::string_view text, std::uint64_t max) {
  auto v = parseIntegral<std::uint64_t>(text);
  if (!v || *v > max) return std::nullopt;
  return v;
}

std::optional<double> parseDouble(std::string_view text) {
  if (text.empty()) return std::nullopt;
  double d = 0;
  auto [p, ec] = std::from_chars(text.data(), text.data() + text.size(), d);
  if (ec != std::errc() || p != text.data() + text.size()) return std::nullopt;
  return d;
}

Value parseTypedValue(std::string_view text) {
  if (startsWith(text, "s:")) return Value(text.substr(2));
  if (text == "true") return Value(true);
  if (text == "false") return Value(false);
  if (auto i = parseInt64(text)) return Value(static_cast<long long>(*i));
  if (auto u = parseUInt(text, UINT64_MAX)) return Value(static_cast<unsigned long long>(*u));
  if (text.find_first_of(".eE") != std::string_view::npos)
    if (auto d = parseDouble(text)) return Value(*d);
  return Value(text);
}

bool parseEntry(std::string_view text, Dictionary& into) {
  auto eq = text.find('=');
  if (eq == std::string_view::npos || eq == 0) return false;
  into.set(Value(text.substr(0, eq)), parseTypedValue(text.substr(eq + 1)));
  return true;
}

std::optional<double> parseTime(std::string_view text) {
  if (auto d = parseDouble(text)) return d;
  std::string s(text);
  int Y = 0, M = 0, D = 0, h = 0, m = 0, n = 0;
  double sec = 0;
  int used = 0;
  if (std::sscanf(s.c_str(), "%4d-%2d-%2d%n", &Y, &M, &D, &used) != 3) return std::nullopt;
  std::string_view rest = std::string_view(s).substr(static_cast<size_t>(used));
  if (!rest.empty() && (rest[0] == 'T' || rest[0] == ' ')) {
    std::string r(rest.substr(1));
    used = 0;
    if (std::sscanf(r.c_str(), "%2d:%2d%n", &h, &m, &used) != 2) return std::nullopt;
    rest = rest.substr(1 + static_cast<size_t>(used));
    if (!rest.empty() && rest[0] == ':') {
      std::string t(rest.substr(1));
      used = 0;
      if (std::sscanf(t.c_str(), "%lf%n", &sec, &used) != 1) return std::nullopt;
      rest = rest.substr(1 + static_cast<size_t>(used));
    }
  }
  long offset = 0;
  if (rest == "Z" || rest.empty()) {
  } else if (rest[0] == '+' || rest[0] == '-') {
    int oh = 0, om = 0;
    std::string z(rest.substr(1));
    if (std::sscanf(z.c_str(), "%2d:%2d", &oh, &om) < 1 && std::sscanf(z.c_str(), "%2d%2d", &oh, &om) < 1)
      return std::nullopt;
    offset = (rest[0] == '+' ? 1 : -1) * (oh * 3600L + om * 60L);
  } else {
    return std::nullopt;
  }
  (void)n;
  std::tm tm{};
  tm.tm_year = Y - 1900;
  tm.tm_mon = M - 1;
  tm.tm_mday = D;
  tm.tm_hour = h;
  tm.tm_min = m;
  time_t t = timegm(&tm);
  return static_cast<double>(t - offset) + sec;
}

std::vector<std::vector<std::string>> splitSequence(const std::vector<std::string>& args) {
  std::vector<std::vector<std::string>> out(1);
  for (const auto& a : args) {
    if (a == "--") {
      if (!out.back().empty()) out.emplace_back();
      continue;
    }
    out.back().push_back(a);
  }
  if (out.back().empty()) out.pop_back();
  return out;
}

std::optional<std::vector<std::string>> splitLine(std::string_view line, std::string* error) {
  std::vector<std::string> words;
  std::string cur;
  bool inWord = false;
  char quote = 0;
  for (char c : line) {
    if (quote) {
      if (c == quote) quote = 0;
      else cur += c;
      continue;
    }
    if (c == '#' && !inWord) break;
    if (c == '\'' || c == '"') {
      quote = c;
      inWord = true;
    } else if (c == ' ' || c == '\t' || c == '\r' || c == '\n') {
      if (inWord) words.push_back(std::move(cur));
      cur.clear();
      inWord = false;
    } else {
      cur += c;
      inWord = true;
    }
  }
  if (quote) {
    if (error) *error = "unterminated quote";
    return std::nullopt;
  }
  if (inWord) words.push_back(std::move(cur));
  return words;
}

std::optional<Operation> parseOperation(const std::vector<std::string>& w, std::string* error) {
  if (w.empty()) {
    fail(error, "no operation");
    return std::nullopt;
  }
  Operation op;
  op.name = w[0];
  const OperationForm* entry = nullptr;
  for (const auto& s : kOps)
    if (w[0] == s.word) entry = &s;
  if (!entry) {
    fail(error, "unknown operation '" + w[0] + "'");
    return std::nullopt;
  }
  op.kind = entry->kind;
  auto exact = [&](size_t n) {
    if (w.size() == n) return true;
    return fail(error, op.name + ": expected " + std::to_string(n - 1) + " argument(s)");
  };
  bool ok = true;
  switch (op.kind) {
    case OpKind::Create:
    case OpKind::ServiceType:
    case OpKind::Stop:
    case OpKind::Destroy:
    case OpKind::Valid:
      ok = exact(2) && takeID(w, 1, op, error);
      break;
    case OpKind::List:
    case OpKind::Kill:
    case OpKind::Ping:
      ok = exact(1);
      break;
    case OpKind::SetServiceType: {
      ok = exact(3) && takeID(w, 1, op, error);
      if (!ok) break;
      auto t = parseUInt(w[2], UINT16_MAX);
      if (!t) ok = fail(error, "set-service-type: bad service type '" + w[2] + "'");
      else op.serviceType = static_cast<std::uint16_t>(*t);
      break;
    }
    case OpKind::Configure:
      ok = takeID(w, 1, op, error);
      for (size_t i = 2; ok && i < w.size(); ++i)
        if (!parseEntry(w[i], op.entries)) ok = fail(error, "configure: expected KEY=VALUE, got '" + w[i] + "'");
      break;
    case OpKind::Start:
      ok = takeID(w, 1, op, error);
      for (size_t i = 2; ok && i < w.size(); ++i) {
        if (w[i] == "--wait") op.startMode = StartMode::Wait;
        else if (w[i] == "--no-wait") op.startMode = StartMode::NoWait;
        else ok = fail(error, "start: unknown option " + w[i]);
      }
      break;
    case OpKind::Send:
      ok = parseSend(w, op, error);
      break;
    case OpKind::Sleep: {
      ok = exact(2);
      auto s = ok ? parseDouble(w[1]) : std::nullopt;
      if (ok && (!s || *s < 0)) ok = fail(error, "sleep: bad number of seconds '" + w[1] + "'");
      if (ok) op.seconds = *s;
      break;
    }
    case OpKind::WaitStart: {
      ok = (w.size() == 2 || w.size() == 3) ? takeID(w, 1, op, error)
                                            : fail(error, "wait-start: expected ID [TIMEOUT-SECONDS]");
      if (ok && w.size() == 3) {
        auto s = parseDouble(w[2]);
        if (!s || *s < 0) ok = fail(error, "wait-start: bad timeout '" + w[2] + "'");
        else op.seconds = *s;
      }
      break;
    }
  }
  if (!ok) return std::nullopt;
  return op;
}

}  // namespace vireo::ctl
