#include "platform/dbus/value_codec.h"

#include <cerrno>
#include <cstring>
#include <string>

#include "platform/dbus/bus.h"

namespace vireo::dbus {

namespace {

// Variants nest without adding a container; they are bounded separately so that
// a chain of variants cannot recurse without end either.
constexpr int kMaxVariantDepth = 64;
// Writing is bounded too; the service never builds values this deep.
constexpr int kMaxWriteDepth = 32;

int refuse(sd_bus_error* error, const char* message) {
  return sd_bus_error_set(error, kInvalidArgs, message);
}

int failed(sd_bus_error* error, int r) {
  return sd_bus_error_setf(error, kInvalidArgs, "could not read value: %s", std::strerror(-r));
}

int limitPassed(sd_bus_error* error, const char* format, std::size_t limit) {
  sd_bus_error_setf(error, kLimitsExceeded, format, limit);
  return -ENOBUFS;
}

struct Reader {
  sd_bus_message* m;
  sd_bus_error* error;
  const DecodeLimits& limits;
  int depth = 0;
  int variants = 0;
  std::size_t bytes = 0;
  std::size_t entries = 0;

  // Counts n bytes against the limit before they are copied; bytes never exceeds maxBytes.
  int charge(std::size_t n) {
    if (n > limits.maxBytes - bytes)
      return limitPassed(error, "payload larger than MaxPayloadBytes=%zu", limits.maxBytes);
    bytes += n;
    return 1;
  }

  int basic(char type, Value* out) {
    int r = 0;
    switch (type) {
      case 's':
      case 'o':
      case 'g': {
        const char* s = nullptr;
        r = sd_bus_message_read_basic(m, type, &s);
        if (r <= 0) break;
        const std::size_t length = std::strlen(s);
        if ((r = charge(length)) < 0) return r;
        *out = Value(std::string(s, length));
        return 1;
      }
      case 'b': {
        int b = 0;
        r = sd_bus_message_read_basic(m, type, &b);
        if (r > 0) *out = Value(b != 0);
        break;
      }
      case 'y': {
        std::uint8_t v = 0;
        r = sd_bus_message_read_basic(m, type, &v);
        if (r > 0) *out = Value(std::uint64_t{v});
        break;
      }
      case 'n': {
        std::int16_t v = 0;
        r = sd_bus_message_read_basic(m, type, &v);
        if (r > 0) *out = Value(std::int64_t{v});
        break;
      }
      case 'q': {
        std::uint16_t v = 0;
        r = sd_bus_message_read_basic(m, type, &v);
        if (r > 0) *out = Value(std::uint64_t{v});
        break;
      }
      case 'i': {
        std::int32_t v = 0;
        r = sd_bus_message_read_basic(m, type, &v);
        if (r > 0) *out = Value(std::int64_t{v});
        break;
      }
      case 'u': {
        std::uint32_t v = 0;
        r = sd_bus_message_read_basic(m, type, &v);
        if (r > 0) *out = Value(std::uint64_t{v});
        break;
      }
      case 'x': {
        std::int64_t v = 0;
        r = sd_bus_message_read_basic(m, type, &v);
        if (r > 0) *out = Value(v);
        break;
      }
      case 't': {
        std::uint64_t v = 0;
        r = sd_bus_message_read_basic(m, type, &v);
        if (r > 0) *out = Value(v);
        break;
      }
      case 'd': {
        double v = 0;
        r = sd_bus_message_read_basic(m, type, &v);
        if (r > 0) *out = Value(v);
        break;
      }
      case 'h':
        return refuse(error, "unix file descriptors are not accepted in values");
      default:
        return sd_bus_error_setf(error, kInvalidArgs, "unexpected type '%c' in value", type);
    }
    if (r < 0) return failed(error, r);
    if (r == 0) return sd_bus_error_set(error, kInvalidArgs, "value missing");
    return charge(8);
  }

  int enterContainer() {
    if (++depth > kMaxContainerDepth)
      return sd_bus_error_setf(error, kInvalidArgs, "value nested deeper than %d containers is not accepted",
                               kMaxContainerDepth);
    return 1;
  }

  int value(Value* out) {
    char type = 0;
    const char* contents = nullptr;
    int r = sd_bus_message_peek_type(m, &type, &contents);
    if (r < 0) return failed(error, r);
    if (r == 0) return 0;
    if (type != 'v' && ++entries > limits.maxEntries)
      return limitPassed(error, "payload has more than MaxPayloadEntries=%zu values", limits.maxEntries);
    switch (type) {
      case 'v':
        return variant(contents, out);
      case 'a':
        if ((r = enterContainer()) < 0) return r;
        r = contents[0] == '{' ? dictionary(contents, out) : array(contents, out);
        --depth;
        return r;
      case 'r':
        if ((r = enterContainer()) < 0) return r;
        r = structure(contents, out);
        --depth;
        return r;
      default:
        return basic(type, out);
    }
  }

  int variant(const char* contents, Value* out) {
    if (++variants > kMaxVariantDepth)
      return sd_bus_error_setf(error, kInvalidArgs, "value nested deeper than %d variants is not accepted",
                               kMaxVariantDepth);
    int r = sd_bus_message_enter_container(m, 'v', contents);
    if (r < 0) return failed(error, r);
    r = value(out);
    if (r == 0) return sd_bus_error_set(error, kInvalidArgs, "empty variant");
    if (r < 0) return r;
    if ((r = sd_bus_message_exit_container(m)) < 0) return failed(error, r);
    --variants;
    return 1;
  }

  int array(const char* contents, Value* out) {
    int r = 0;
    if (std::strcmp(contents, "y") == 0) {
      const void* raw = nullptr;
      std::size_t size = 0;
      if ((r = sd_bus_message_read_array(m, 'y', &raw, &size)) < 0) return failed(error, r);
      if ((r = charge(size)) < 0) return r;
      auto* p = static_cast<const std::uint8_t*>(raw);
      *out = Value(Data(p, p + size));
      return 1;
    }
    if ((r = sd_bus_message_enter_container(m, 'a', contents)) < 0) return failed(error, r);
    Array items;
    for (;;) {
      Value item;
      if ((r = value(&item)) < 0) return r;
      if (r == 0) break;
      items.push_back(std::move(item));
    }
    if ((r = sd_bus_message_exit_container(m)) < 0) return failed(error, r);
    *out = Value(std::move(items));
    return 1;
  }

  int structure(const char* contents, Value* out) {
    int r = sd_bus_message_enter_container(m, 'r', contents);
    if (r < 0) return failed(error, r);
    Array fields;
    for (;;) {
      Value field;
      if ((r = value(&field)) < 0) return r;
      if (r == 0) break;
      fields.push_back(std::move(field));
    }
    if ((r = sd_bus_message_exit_container(m)) < 0) return failed(error, r);
    *out = Value(std::move(fields));
    return 1;
  }

  // contents is "{KV}"; entries are entered with "KV".
  int dictionary(const char* contents, Value* out) {
    std::string entry(contents + 1, std::strlen(contents) - 2);
    int r = sd_bus_message_enter_container(m, 'a', contents);
    if (r < 0) return failed(error, r);
    Dictionary dict;
    for (;;) {
      if ((r = sd_bus_message_enter_container(m, 'e', entry.c_str())) < 0) return failed(error, r);
      if (r == 0) break;
      Value key, item;
      if ((r = basic(entry[0], &key)) < 0) return r;
      if ((r = value(&item)) < 0) return r;
      if (r == 0) return sd_bus_error_set(error, kInvalidArgs, "dictionary entry without value");
      if ((r = sd_bus_message_exit_container(m)) < 0) return failed(error, r);
      dict.set(std::move(key), std::move(item));
    }
    if ((r = sd_bus_message_exit_container(m)) < 0) return failed(error, r);
    *out = Value(std::move(dict));
    return 1;
  }
};

// The D-Bus type of a dictionary's keys: one basic type when all keys share a
// kind, 0 when they are mixed.
char keyType(const Dictionary& dict) {
  if (dict.empty()) return 's';
  auto kindOf = [](const Value& v) -> char {
    switch (v.kind()) {
      case Value::Kind::String: return 's';
      case Value::Kind::Int: return 'x';
      case Value::Kind::UInt: return 't';
      case Value::Kind::Bool: return 'b';
      case Value::Kind::Double: return 'd';
      default: return 0;
    }
  };
  char first = kindOf(dict[0].first);
  for (const auto& [key, value] : dict)
    if (kindOf(key) != first) return 0;
  return first;
}

int appendBasic(sd_bus_message* m, char type, const Value& v) {
  switch (type) {
    case 's': return sd_bus_message_append_basic(m, 's', v.asString()->c_str());
    case 'x': return sd_bus_message_append_basic(m, 'x', v.asInt());
    case 't': return sd_bus_message_append_basic(m, 't', v.asUInt());
    case 'b': {
      int b = *v.asBool() ? 1 : 0;
      return sd_bus_message_append_basic(m, 'b', &b);
    }
    case 'd': return sd_bus_message_append_basic(m, 'd', v.asDouble());
    default: return -EINVAL;
  }
}

int append(sd_bus_message* m, const Value& value, int depth);

int appendDictionaryBody(sd_bus_message* m, const Dictionary& dict, char key, int depth) {
  const char entry[3] = {key, 'v', 0};
  const char array[5] = {'{', key, 'v', '}', 0};
  int r = sd_bus_message_open_container(m, 'a', array);
  if (r < 0) return r;
  for (const auto& [k, v] : dict) {
    if ((r = sd_bus_message_open_container(m, 'e', entry)) < 0) return r;
    if ((r = appendBasic(m, key, k)) < 0) return r;
    if ((r = append(m, v, depth + 1)) < 0) return r;
    if ((r = sd_bus_message_close_container(m)) < 0) return r;
  }
  return sd_bus_message_close_container(m);
}

int append(sd_bus_message* m, const Value& value, int depth) {
  if (depth > kMaxWriteDepth) return -ELOOP;
  int r = 0;
  switch (value.kind()) {
    case Value::Kind::Absent:
      return -EINVAL;
    case Value::Kind::Bool:
      return sd_bus_message_append(m, "v", "b", *value.asBool() ? 1 : 0);
    case Value::Kind::Int:
      return sd_bus_message_append(m, "v", "x", *value.asInt());
    case Value::Kind::UInt:
      return sd_bus_message_append(m, "v", "t", *value.asUInt());
    case Value::Kind::Double:
      return sd_bus_message_append(m, "v", "d", *value.asDouble());
    case Value::Kind::String:
      return sd_bus_message_append(m, "v", "s", value.asString()->c_str());
    case Value::Kind::Data: {
      const Data& d = *value.asData();
      if ((r = sd_bus_message_open_container(m, 'v', "ay")) < 0) return r;
      if ((r = sd_bus_message_append_array(m, 'y', d.data(), d.size())) < 0) return r;
      return sd_bus_message_close_container(m);
    }
    case Value::Kind::Array: {
      if ((r = sd_bus_message_open_container(m, 'v', "av")) < 0) return r;
      if ((r = sd_bus_message_open_container(m, 'a', "v")) < 0) return r;
      for (const Value& item : *value.asArray())
        if ((r = append(m, item, depth + 1)) < 0) return r;
      if ((r = sd_bus_message_close_container(m)) < 0) return r;
      return sd_bus_message_close_container(m);
    }
    case Value::Kind::Dictionary: {
      const Dictionary& dict = *value.asDictionary();
      char key = keyType(dict);
      if (key != 0) {
        const char signature[6] = {'a', '{', key, 'v', '}', 0};
        if ((r = sd_bus_message_open_container(m, 'v', signature)) < 0) return r;
        if ((r = appendDictionaryBody(m, dict, key, depth)) < 0) return r;
        return sd_bus_message_close_container(m);
      }
      // Mixed key kinds have no D-Bus dictionary type: a list of (key, value) pairs.
      if ((r = sd_bus_message_open_container(m, 'v', "av")) < 0) return r;
      if ((r = sd_bus_message_open_container(m, 'a', "v")) < 0) return r;
      for (const auto& [k, v] : dict) {
        if ((r = sd_bus_message_open_container(m, 'v', "(vv)")) < 0) return r;
        if ((r = sd_bus_message_open_container(m, 'r', "vv")) < 0) return r;
        if ((r = append(m, k, depth + 1)) < 0) return r;
        if ((r = append(m, v, depth + 1)) < 0) return r;
        if ((r = sd_bus_message_close_container(m)) < 0) return r;
        if ((r = sd_bus_message_close_container(m)) < 0) return r;
      }
      if ((r = sd_bus_message_close_container(m)) < 0) return r;
      return sd_bus_message_close_container(m);
    }
  }
  return -EINVAL;
}

}  // namespace

int readValue(sd_bus_message* m, Value* out, sd_bus_error* error, const DecodeLimits& limits) {
  Reader reader{m, error, limits};
  return reader.value(out);
}

int readDictionary(sd_bus_message* m, Dictionary* out, sd_bus_error* error, const DecodeLimits& limits) {
  Value v;
  int r = readValue(m, &v, error, limits);
  if (r < 0) return r;
  // The freshly read value is the container's only owner: moving it out copies nothing.
  Dictionary* dict = r > 0 ? v.mutableDictionary() : nullptr;
  if (!dict) return sd_bus_error_set(error, kInvalidArgs, "expected a dictionary");
  *out = std::move(*dict);
  return 1;
}

int appendVariant(sd_bus_message* m, const Value& value) { return append(m, value, 0); }

int appendStringDictionary(sd_bus_message* m, const Dictionary& dictionary) {
  for (const auto& [key, value] : dictionary)
    if (!key.asString()) return -EINVAL;
  return appendDictionaryBody(m, dictionary, 's', 0);
}

}  // namespace vireo::dbus
