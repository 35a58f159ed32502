#include "base/value.h"

#include <charconv>
#include <cmath>
#include <cstring>
#include <functional>
#include <unordered_map>

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

struct ValueHash {
  std::size_t operator()(const Value* v) const noexcept { return v->hash(); }
};
struct ValueEq {
  bool operator()(const Value* a, const Value* b) const noexcept { return *a == *b; }
};
}  // namespace

struct Dictionary::Index {
  // Points into entries_; rebuilt whenever entries_ may have reallocated.
  std::unordered_map<const Value*, std::size_t, ValueHash, ValueEq> positions;
  const Entry* base = nullptr;
};

void Dictionary::IndexDeleter::operator()(Index* index) const noexcept { delete index; }

Dictionary::Dictionary(std::initializer_list<Entry> entries) {
  for (const auto& e : entries) set(e.first, e.second);
}
Dictionary::Dictionary(const Dictionary& other) : entries_(other.entries_) {}
Dictionary::Dictionary(Dictionary&& other) noexcept : entries_(std::move(other.entries_)) {
  other.index_.reset();
}
Dictionary& Dictionary::operator=(const Dictionary& other) {
  if (this != &other) {
    entries_ = other.entries_;
    index_.reset();
  }
  return *this;
}
Dictionary& Dictionary::operator=(Dictionary&& other) noexcept {
  if (this != &other) {
    entries_ = std::move(other.entries_);
    index_.reset();
    other.index_.reset();
  }
  return *this;
}
Dictionary::~Dictionary() = default;

void Dictionary::rebuildIndex() const {
  if (!index_) index_.reset(new Index);
  index_->positions.clear();
  index_->positions.reserve(entries_.size() * 2);
  for (std::size_t i = 0; i < entries_.size(); ++i) index_->positions.emplace(&entries_[i].first, i);
  index_->base = entries_.data();
}

std::size_t Dictionary::indexOf(const Value& key) const noexcept {
  if (entries_.size() < kIndexThreshold) {
    for (std::size_t i = 0; i < entries_.size(); ++i)
      if (entries_[i].first == key) return i;
    return entries_.size();
  }
  try {
    if (!index_ || index_->base != entries_.data() || index_->positions.size() != entries_.size()) rebuildIndex();
    auto it = index_->positions.find(&key);
    return it == index_->positions.end() ? entries_.size() : it->second;
  } catch (...) {
    index_.reset();
    for (std::size_t i = 0; i < entries_.size(); ++i)
      if (entries_[i].first == key) return i;
    return entries_.size();
  }
}

const Value* Dictionary::find(const Value& key) const noexcept {
  auto i = indexOf(key);
  return i < entries_.size() ? &entries_[i].second : nullptr;
}

void Dictionary::set(Value key, Value value) {
  auto i = indexOf(key);
  if (i < entries_.size()) {
    entries_[i].second = std::move(value);
    return;
  }
  entries_.emplace_back(std::move(key), std::move(value));
  if (index_) {
    if (index_->base == entries_.data())
      index_->positions.emplace(&entries_.back().first, entries_.size() - 1);
    else
      index_.reset();
  }
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
    case Value::Kind::Dictionary: {
      const auto& d = *v.asDictionary();
      out += '{';
      bool first = true;
      for (const auto& [k, val] : d) {
        if (!first) out += ',';
        first = false;
        newline(out, pretty, indent + 1);
        if (const auto* s = k.asString()) {
          appendJsonString(out, *s);
        } else {
          if (strict) return refuse(error, "Invalid (non-string) key in JSON dictionary");
          appendJsonString(out, k.text());
        }
        out += pretty ? " : " : ":";
        if (!appendJson(out, val, mode, pretty, error, indent + 1)) return false;
      }
      if (!d.empty()) newline(out, pretty, indent);
      out += '}';
      return true;
    }
  }
  return true;
}

std::optional<std::string> toJson(const Value& v, JsonMode mode, bool pretty, JsonError* error) {
  std::string out;
  if (!appendJson(out, v, mode, pretty, error)) return std::nullopt;
  return out;
}

}  // namespace vireo
