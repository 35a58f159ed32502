#include "base/value.h"

#include <algorithm>
#include <bit>
#include <charconv>
#include <cmath>
#include <cstring>
#include <functional>
#include <limits>
#include <random>
#include <stdexcept>

namespace vireo {

// ---- Value ----

Value::Value(Data d) : v_(std::make_shared<Data>(std::move(d))) {}
Value::Value(Array a) : v_(std::make_shared<Array>(std::move(a))) {}
Value::Value(Dictionary d) : v_(std::make_shared<Dictionary>(std::move(d))) {}

const Data* Value::asData() const noexcept {
  auto p = std::get_if<DataPtr>(&v_);
  return p ? p->get() : nullptr;
}
const Array* Value::asArray() const noexcept {
  auto p = std::get_if<ArrayPtr>(&v_);
  return p ? p->get() : nullptr;
}
const Dictionary* Value::asDictionary() const noexcept {
  auto p = std::get_if<DictPtr>(&v_);
  return p ? p->get() : nullptr;
}

Array* Value::mutableArray() {
  auto p = std::get_if<ArrayPtr>(&v_);
  if (!p) return nullptr;
  if (p->use_count() > 1) *p = std::make_shared<Array>(**p);
  return p->get();
}

Dictionary* Value::mutableDictionary() {
  auto p = std::get_if<DictPtr>(&v_);
  if (!p) return nullptr;
  if (p->use_count() > 1) *p = std::make_shared<Dictionary>(**p);
  return p->get();
}

std::optional<std::int64_t> Value::toInt64() const noexcept {
  switch (kind()) {
    case Kind::Bool: return *asBool() ? 1 : 0;
    case Kind::Int: return *asInt();
    case Kind::UInt: return static_cast<std::int64_t>(*asUInt());
    case Kind::Double: {
      double d = *asDouble();
      if (std::isnan(d)) return 0;
      if (d >= 9.2233720368547758e18) return INT64_MAX;
      if (d <= -9.2233720368547758e18) return INT64_MIN;
      return static_cast<std::int64_t>(d);
    }
    default: return std::nullopt;
  }
}

std::optional<double> Value::toDouble() const noexcept {
  switch (kind()) {
    case Kind::Bool: return *asBool() ? 1.0 : 0.0;
    case Kind::Int: return static_cast<double>(*asInt());
    case Kind::UInt: return static_cast<double>(*asUInt());
    case Kind::Double: return *asDouble();
    default: return std::nullopt;
  }
}

void appendDouble(std::string& out, double d) {
  if (std::isnan(d)) {
    out += "nan";
    return;
  }
  if (std::isinf(d)) {
    out += d < 0 ? "-inf" : "inf";
    return;
  }
  char buf[32];
  auto r = std::to_chars(buf, buf + sizeof buf, d);
  out.append(buf, r.ptr);
}

namespace {

template <typename Int>
void appendInt(std::string& out, Int i) {
  char buf[24];
  auto r = std::to_chars(buf, buf + sizeof buf, i);
  out.append(buf, r.ptr);
}

void appendQuoted(std::string& out, std::string_view s) {
  out += '"';
  for (char c : s) {
    if (c == '"' || c == '\\') out += '\\';
    out += c;
  }
  out += '"';
}

constexpr char kHex[] = "0123456789abcdef";

}  // namespace

void Value::appendText(std::string& out, bool nested) const {
  switch (kind()) {
    case Kind::Absent: out += "(null)"; break;
    case Kind::Bool: out += *asBool() ? "true" : "false"; break;
    case Kind::Int: appendInt(out, *asInt()); break;
    case Kind::UInt: appendInt(out, *asUInt()); break;
    case Kind::Double: appendDouble(out, *asDouble()); break;
    case Kind::String:
      if (nested)
        appendQuoted(out, *asString());
      else
        out += *asString();
      break;
    case Kind::Data:
      out += '<';
      for (auto b : *asData()) {
        out += kHex[b >> 4];
        out += kHex[b & 15];
      }
      out += '>';
      break;
    case Kind::Array: {
      out += '[';
      bool first = true;
      for (const auto& e : *asArray()) {
        if (!first) out += ", ";
        first = false;
        e.appendText(out, true);
      }
      out += ']';
      break;
    }
    case Kind::Dictionary: {
      out += '{';
      bool first = true;
      for (const auto& [k, v] : *asDictionary()) {
        if (!first) out += ", ";
        first = false;
        k.appendText(out, true);
        out += ": ";
        v.appendText(out, true);
      }
      out += '}';
      break;
    }
  }
}

std::string Value::text() const {
  std::string out;
  appendText(out, false);
  return out;
}

bool operator==(const Value& a, const Value& b) noexcept {
  if (a.kind() != b.kind()) return false;
  switch (a.kind()) {
    case Value::Kind::Absent: return true;
    case Value::Kind::Bool: return *a.asBool() == *b.asBool();
    case Value::Kind::Int: return *a.asInt() == *b.asInt();
    case Value::Kind::UInt: return *a.asUInt() == *b.asUInt();
    case Value::Kind::Double: return *a.asDouble() == *b.asDouble();
    case Value::Kind::String: return *a.asString() == *b.asString();
    case Value::Kind::Data: return *a.asData() == *b.asData();
    case Value::Kind::Array: return *a.asArray() == *b.asArray();
    case Value::Kind::Dictionary: return *a.asDictionary() == *b.asDictionary();
  }
  return false;
}

std::size_t Value::hash() const noexcept {
  std::size_t k = static_cast<std::size_t>(kind()) * 0x9e3779b97f4a7c15ULL;
  switch (kind()) {
    case Kind::Bool: return k ^ std::hash<bool>{}(*asBool());
    case Kind::Int: return k ^ std::hash<std::int64_t>{}(*asInt());
    case Kind::UInt: return k ^ std::hash<std::uint64_t>{}(*asUInt());
    case Kind::Double: return k ^ std::hash<double>{}(*asDouble());
    case Kind::String: return k ^ std::hash<std::string>{}(*asString());
    case Kind::Data:
      return k ^ std::hash<std::string_view>{}(
                     std::string_view(reinterpret_cast<const char*>(asData()->data()), asData()->size()));
    default: return k;  // containers are never keys in practice; equality still decides
  }
}

// ---- Dictionary ----

namespace {
// Payloads are typically a few dozen entries: a linear scan beats building a hash
// table for each one. Larger dictionaries (a hostile client) get the index.
constexpr std::size_t kIndexThreshold = 64;

// Keys come from clients, so the index hashes them with a key drawn at start-up
// (SipHash-1-3): a client cannot choose keys that all land in one slot, as it could
// with the unkeyed std::hash (identity for integers).
struct HashKey {
  std::uint64_t k0, k1;
};

const HashKey& processHashKey() noexcept {
  static const HashKey key = []() noexcept {
    HashKey k{0x0706050403020100ULL, 0x0f0e0d0c0b0a0908ULL};
    try {
      std::random_device device;
      k.k0 ^= (std::uint64_t{device()} << 32) | device();
      k.k1 ^= (std::uint64_t{device()} << 32) | device();
    } catch (...) {
      // No entropy source: the address of this code still varies with ASLR.
      k.k0 ^= reinterpret_cast<std::uintptr_t>(&k);
    }
    return k;
  }();
  return key;
}

std::uint64_t sipHash(std::uint64_t salt, const void* bytes, std::size_t n) noexcept {
  const HashKey& key = processHashKey();
  std::uint64_t v0 = 0x736f6d6570736575ULL ^ key.k0 ^ salt, v1 = 0x646f72616e646f6dULL ^ key.k1;
  std::uint64_t v2 = 0x6c7967656e657261ULL ^ key.k0 ^ salt, v3 = 0x7465646279746573ULL ^ key.k1;
  auto round = [&] {
    v0 += v1, v1 = std::rotl(v1, 13), v1 ^= v0, v0 = std::rotl(v0, 32);
    v2 += v3, v3 = std::rotl(v3, 16), v3 ^= v2;
    v0 += v3, v3 = std::rotl(v3, 21), v3 ^= v0;
    v2 += v1, v1 = std::rotl(v1, 17), v1 ^= v2, v2 = std::rotl(v2, 32);
  };
  const auto* p = static_cast<const unsigned char*>(bytes);
  const std::size_t whole = n - n % 8;
  for (std::size_t i = 0; i < whole; i += 8) {
    std::uint64_t m;
    std::memcpy(&m, p + i, 8);
    v3 ^= m, round(), v0 ^= m;
  }
  std::uint64_t last = std::uint64_t{n} << 56;
  for (std::size_t i = whole; i < n; ++i) last |= std::uint64_t{p[i]} << (8 * (i - whole));
  v3 ^= last, round(), v0 ^= last;
  v2 ^= 0xff, round(), round(), round();
  return v0 ^ v1 ^ v2 ^ v3;
}

// Key identity: == except that all NaNs are one key, inside container keys too.
bool sameKey(const Value& a, const Value& b) noexcept {
  if (a.kind() != b.kind()) return false;
  switch (a.kind()) {
    case Value::Kind::Double: {
      const double x = *a.asDouble(), y = *b.asDouble();
      return x == y || (std::isnan(x) && std::isnan(y));
    }
    case Value::Kind::Array: {
      const Array &x = *a.asArray(), &y = *b.asArray();
      return x.size() == y.size() && std::equal(x.begin(), x.end(), y.begin(), sameKey);
    }
    case Value::Kind::Dictionary: {
      const Dictionary &x = *a.asDictionary(), &y = *b.asDictionary();
      return x.size() == y.size() && std::equal(x.begin(), x.end(), y.begin(), [](const auto& e, const auto& f) {
               return sameKey(e.first, f.first) && sameKey(e.second, f.second);
             });
    }
    default: return a == b;
  }
}

// Consistent with sameKey: equal keys hash alike.
std::uint64_t keyHash(const Value& v) noexcept {
  const std::uint64_t salt = static_cast<std::uint64_t>(v.kind()) + 1;
  auto ofScalar = [salt](auto x) { return sipHash(salt, &x, sizeof x); };
  auto combine = [salt](std::uint64_t h, std::uint64_t next) {
    const std::uint64_t pair[2] = {h, next};
    return sipHash(salt, pair, sizeof pair);
  };
  switch (v.kind()) {
    case Value::Kind::Absent: return sipHash(salt, nullptr, 0);
    case Value::Kind::Bool: return ofScalar(*v.asBool());
    case Value::Kind::Int: return ofScalar(*v.asInt());
    case Value::Kind::UInt: return ofScalar(*v.asUInt());
    case Value::Kind::Double: {
      double d = *v.asDouble();
      if (std::isnan(d)) d = std::numeric_limits<double>::quiet_NaN();
      if (d == 0) d = 0.0;  // -0.0 too
      return ofScalar(d);
    }
    case Value::Kind::String: return sipHash(salt, v.asString()->data(), v.asString()->size());
    case Value::Kind::Data: return sipHash(salt, v.asData()->data(), v.asData()->size());
    case Value::Kind::Array: {
      std::uint64_t h = salt;
      for (const Value& item : *v.asArray()) h = combine(h, keyHash(item));
      return h;
    }
    case Value::Kind::Dictionary: {
      std::uint64_t h = salt;
      for (const auto& [key, item] : *v.asDictionary()) h = combine(combine(h, keyHash(key)), keyHash(item));
      return h;
    }
  }
  return salt;
}

std::uint32_t slotHash(const Value& key) noexcept {
  const std::uint64_t h = keyHash(key);
  return static_cast<std::uint32_t>(h ^ (h >> 32));
}
}  // namespace

Dictionary::Dictionary(std::initializer_list<Entry> entries) {
  reserve(entries.size());
  for (const auto& e : entries) set(e.first, e.second);
}

void Dictionary::reserve(std::size_t n) {
  entries_.reserve(n);
  if (n >= kIndexThreshold && slots_.size() < 2 * n) growIndex(std::bit_ceil(2 * n));
}

// Rebuilds the table at capacity (a power of two); strong guarantee.
void Dictionary::growIndex(std::size_t capacity) {
  std::vector<Slot> grown(capacity, Slot{0, 0});
  const std::size_t mask = capacity - 1;
  auto place = [&](Slot slot) {
    std::size_t i = slot.hash & mask;
    while (grown[i].position != 0) i = (i + 1) & mask;
    grown[i] = slot;
  };
  if (slots_.empty()) {
    for (std::size_t i = 0; i < entries_.size(); ++i)
      place(Slot{slotHash(entries_[i].first), static_cast<std::uint32_t>(i + 1)});
  } else {
    for (const Slot& slot : slots_)
      if (slot.position != 0) place(slot);
  }
  slots_.swap(grown);
}

std::size_t Dictionary::indexOf(const Value& key, std::uint32_t hash) const noexcept {
  if (slots_.empty()) {
    for (std::size_t i = 0; i < entries_.size(); ++i)
      if (sameKey(entries_[i].first, key)) return i;
    return entries_.size();
  }
  const std::size_t mask = slots_.size() - 1;
  for (std::size_t i = hash & mask; slots_[i].position != 0; i = (i + 1) & mask) {
    const Slot& slot = slots_[i];
    if (slot.hash == hash && sameKey(entries_[slot.position - 1].first, key)) return slot.position - 1;
  }
  return entries_.size();
}

const Value* Dictionary::find(const Value& key) const noexcept {
  const auto i = indexOf(key, slots_.empty() ? 0 : slotHash(key));
  return i < entries_.size() ? &entries_[i].second : nullptr;
}

void Dictionary::set(Value key, Value value) {
  const bool indexed = !slots_.empty() || entries_.size() + 1 >= kIndexThreshold;
  const std::uint32_t hash = indexed ? slotHash(key) : 0;
  if (const auto i = indexOf(key, hash); i < entries_.size()) {
    entries_[i].second = std::move(value);
    return;
  }
  if (entries_.size() >= std::numeric_limits<std::uint32_t>::max() - 1) throw std::length_error("Dictionary");
  // Make room first, so that a failed allocation leaves the index whole.
  if (indexed && slots_.size() < 2 * (entries_.size() + 1))
    growIndex(std::max<std::size_t>(slots_.size() * 2, 4 * kIndexThreshold));
  entries_.emplace_back(std::move(key), std::move(value));
  if (!indexed) return;
  const std::size_t mask = slots_.size() - 1;
  std::size_t i = hash & mask;
  while (slots_[i].position != 0) i = (i + 1) & mask;
  slots_[i] = Slot{hash, static_cast<std::uint32_t>(entries_.size())};
}

void Dictionary::merge(const Dictionary& other) {
  for (const auto& [k, v] : other) set(k, v);
}

bool operator==(const Dictionary& a, const Dictionary& b) noexcept { return a.entries_ == b.entries_; }

// ---- JSON ----

std::string base64Encode(const Data& data) {
  static constexpr char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string out;
  out.reserve((data.size() + 2) / 3 * 4);
  std::size_t i = 0;
  for (; i + 2 < data.size(); i += 3) {
    std::uint32_t n = (data[i] << 16) | (data[i + 1] << 8) | data[i + 2];
    out += kAlphabet[n >> 18];
    out += kAlphabet[(n >> 12) & 63];
    out += kAlphabet[(n >> 6) & 63];
    out += kAlphabet[n & 63];
  }
  if (i + 1 == data.size()) {
    std::uint32_t n = data[i] << 16;
    out += kAlphabet[n >> 18];
    out += kAlphabet[(n >> 12) & 63];
    out += "==";
  } else if (i + 2 == data.size()) {
    std::uint32_t n = (data[i] << 16) | (data[i + 1] << 8);
    out += kAlphabet[n >> 18];
    out += kAlphabet[(n >> 12) & 63];
    out += kAlphabet[(n >> 6) & 63];
    out += '=';
  }
  return out;
}

namespace {

// Strings reach us already checked as UTF-8 by the bus; control characters are escaped.
void appendJsonString(std::string& out, std::string_view s) {
  out += '"';
  std::size_t run = 0;  // start of the pending run of characters that need no escape
  for (std::size_t i = 0; i < s.size(); ++i) {
    const auto c = static_cast<unsigned char>(s[i]);
    if (c >= 0x20 && c != '"' && c != '\\') continue;
    out.append(s.data() + run, i - run);
    run = i + 1;
    switch (c) {
      case '"': out += "\\\""; break;
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\r': out += "\\r"; break;
      case '\t': out += "\\t"; break;
      case '\b': out += "\\b"; break;
      case '\f': out += "\\f"; break;
      default:
        out += "\\u00";
        out += kHex[c >> 4];
        out += kHex[c & 15];
    }
  }
  out.append(s.data() + run, s.size() - run);
  out += '"';
}

void newline(std::string& out, bool pretty, int indent) {
  if (!pretty) return;
  out += '\n';
  out.append(static_cast<std::size_t>(indent) * 2, ' ');
}

bool refuse(JsonError* error, std::string message) {
  if (error) error->message = std::move(message);
  return false;
}

}  // namespace

bool appendJson(std::string& out, const Value& v, JsonMode mode, bool pretty, JsonError* error, int indent) {
  const bool strict = mode == JsonMode::Strict;
  switch (v.kind()) {
    case Value::Kind::Absent: out += "null"; return true;
    case Value::Kind::Bool: out += *v.asBool() ? "true" : "false"; return true;
    case Value::Kind::Int: appendInt(out, *v.asInt()); return true;
    case Value::Kind::UInt: appendInt(out, *v.asUInt()); return true;
    case Value::Kind::Double: {
      double d = *v.asDouble();
      if (!std::isfinite(d)) {
        if (strict) return refuse(error, "Invalid number value (NaN or infinity) in JSON write");
        out += "null";
        return true;
      }
      auto before = out.size();
      appendDouble(out, d);
      // Keep doubles recognisable as such for readers that distinguish 2 from 2.0.
      if (out.find_first_of(".eE", before) == std::string::npos) out += ".0";
      return true;
    }
    case Value::Kind::String: appendJsonString(out, *v.asString()); return true;
    case Value::Kind::Data:
      if (strict) return refuse(error, "Invalid type in JSON write (data)");
      appendJsonString(out, base64Encode(*v.asData()));
      return true;
    case Value::Kind::Array: {
      const auto& a = *v.asArray();
      out += '[';
      for (std::size_t i = 0; i < a.size(); ++i) {
        if (i) out += ',';
        newline(out, pretty, indent + 1);
        if (!appendJson(out, a[i], mode, pretty, error, indent + 1)) return false;
      }
      if (!a.empty()) newline(out, pretty, indent);
      out += ']';
      return true;
    }
    case Value::Kind::Dictionary:
      return appendJson(out, *v.asDictionary(), mode, pretty, error, indent);
  }
  return true;
}

bool appendJson(std::string& out, const Dictionary& d, JsonMode mode, bool pretty, JsonError* error, int indent) {
  out += '{';
  bool first = true;
  for (const auto& [k, val] : d) {
    if (!first) out += ',';
    first = false;
    newline(out, pretty, indent + 1);
    if (const auto* s = k.asString()) {
      appendJsonString(out, *s);
    } else {
      if (mode == JsonMode::Strict) return refuse(error, "Invalid (non-string) key in JSON dictionary");
      appendJsonString(out, k.text());
    }
    out += pretty ? " : " : ":";
    if (!appendJson(out, val, mode, pretty, error, indent + 1)) return false;
  }
  if (!d.empty()) newline(out, pretty, indent);
  out += '}';
  return true;
}

std::optional<std::string> toJson(const Value& v, JsonMode mode, bool pretty, JsonError* error) {
  std::string out;
  if (!appendJson(out, v, mode, pretty, error)) return std::nullopt;
  return out;
}

}  // namespace vireo
