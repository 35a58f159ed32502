#include "base/value_pack.h"

#include <cstdint>
#include <cstring>

namespace vireo {

namespace {

using Kind = Value::Kind;

void putVarint(std::string& out, std::uint64_t n) {
  while (n >= 0x80) {
    out.push_back(static_cast<char>((n & 0x7F) | 0x80));
    n >>= 7;
  }
  out.push_back(static_cast<char>(n));
}

bool getVarint(std::string_view& in, std::uint64_t* n) {
  std::uint64_t result = 0;
  for (int shift = 0; shift < 64 && !in.empty(); shift += 7) {
    const auto byte = static_cast<std::uint8_t>(in.front());
    in.remove_prefix(1);
    result |= static_cast<std::uint64_t>(byte & 0x7F) << shift;
    if (!(byte & 0x80)) {
      *n = result;
      return true;
    }
  }
  return false;
}

void putBytes(std::string& out, const void* data, std::size_t size) {
  putVarint(out, size);
  out.append(static_cast<const char*>(data), size);
}

std::optional<std::string_view> getBytes(std::string_view& in) {
  std::uint64_t size = 0;
  if (!getVarint(in, &size) || size > in.size()) return std::nullopt;
  std::string_view bytes = in.substr(0, size);
  in.remove_prefix(size);
  return bytes;
}

// Nesting is bounded by what the decoder accepted; this bound only keeps a corrupt
// buffer from recursing without end.
constexpr int kMaxDepth = 256;

std::optional<Value> unpack(std::string_view& in, int depth) {
  if (in.empty() || depth > kMaxDepth) return std::nullopt;
  const auto kind = static_cast<Kind>(in.front());
  in.remove_prefix(1);
  std::uint64_t n = 0;
  switch (kind) {
    case Kind::Absent:
      return Value();
    case Kind::Bool:
      if (!getVarint(in, &n)) return std::nullopt;
      return Value(n != 0);
    case Kind::Int:
      if (!getVarint(in, &n)) return std::nullopt;
      // Zig-zag: small negative numbers stay short.
      return Value(static_cast<long long>((n >> 1) ^ (~(n & 1) + 1)));
    case Kind::UInt:
      if (!getVarint(in, &n)) return std::nullopt;
      return Value(static_cast<unsigned long long>(n));
    case Kind::Double: {
      double d;
      if (in.size() < sizeof d) return std::nullopt;
      std::memcpy(&d, in.data(), sizeof d);
      in.remove_prefix(sizeof d);
      return Value(d);
    }
    case Kind::String: {
      auto bytes = getBytes(in);
      if (!bytes) return std::nullopt;
      return Value(std::string(*bytes));
    }
    case Kind::Data: {
      auto bytes = getBytes(in);
      if (!bytes) return std::nullopt;
      return Value(Data(bytes->begin(), bytes->end()));
    }
    case Kind::Array: {
      if (!getVarint(in, &n) || n > in.size()) return std::nullopt;
      Array array;
      array.reserve(n);
      for (std::uint64_t i = 0; i < n; ++i) {
        auto v = unpack(in, depth + 1);
        if (!v) return std::nullopt;
        array.push_back(std::move(*v));
      }
      return Value(std::move(array));
    }
    case Kind::Dictionary: {
      if (!getVarint(in, &n) || n > in.size()) return std::nullopt;
      Dictionary dictionary;
      dictionary.reserve(n);
      for (std::uint64_t i = 0; i < n; ++i) {
        auto key = unpack(in, depth + 1);
        if (!key) return std::nullopt;
        auto v = unpack(in, depth + 1);
        if (!v) return std::nullopt;
        dictionary.set(std::move(*key), std::move(*v));
      }
      return Value(std::move(dictionary));
    }
  }
  return std::nullopt;
}

}  // namespace

void packValue(std::string& out, const Value& value) {
  out.push_back(static_cast<char>(value.kind()));
  switch (value.kind()) {
    case Kind::Absent:
      break;
    case Kind::Bool:
      putVarint(out, *value.asBool() ? 1 : 0);
      break;
    case Kind::Int: {
      const auto i = static_cast<std::uint64_t>(*value.asInt());
      putVarint(out, (i << 1) ^ (*value.asInt() < 0 ? ~std::uint64_t{0} : 0));
      break;
    }
    case Kind::UInt:
      putVarint(out, *value.asUInt());
      break;
    case Kind::Double: {
      const double d = *value.asDouble();
      out.append(reinterpret_cast<const char*>(&d), sizeof d);
      break;
    }
    case Kind::String:
      putBytes(out, value.asString()->data(), value.asString()->size());
      break;
    case Kind::Data:
      putBytes(out, value.asData()->data(), value.asData()->size());
      break;
    case Kind::Array:
      putVarint(out, value.asArray()->size());
      for (const Value& v : *value.asArray()) packValue(out, v);
      break;
    case Kind::Dictionary:
      putVarint(out, value.asDictionary()->size());
      for (const auto& [k, v] : *value.asDictionary()) {
        packValue(out, k);
        packValue(out, v);
      }
      break;
  }
}

std::optional<Value> unpackValue(std::string_view& in) { return unpack(in, 0); }

}  // namespace vireo
