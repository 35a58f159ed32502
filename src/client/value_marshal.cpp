#include "client/value_marshal.h"

#include <cerrno>
#include <cstring>

namespace vireo::client::marshal {

namespace {

int appendKey(sd_bus_message* m, const Value& key) {
  if (const auto* s = key.asString()) return sd_bus_message_append_basic(m, 's', s->c_str());
  std::string text = key.text();
  return sd_bus_message_append_basic(m, 's', text.c_str());
}

int readBasic(sd_bus_message* m, char type, Value& out, std::string* why) {
  switch (type) {
    case 'y': {
      std::uint8_t v = 0;
      int r = sd_bus_message_read_basic(m, type, &v);
      out = Value(unsigned{v});
      return r;
    }
    case 'n': {
      std::int16_t v = 0;
      int r = sd_bus_message_read_basic(m, type, &v);
      out = Value(int{v});
      return r;
    }
    case 'q': {
      std::uint16_t v = 0;
      int r = sd_bus_message_read_basic(m, type, &v);
      out = Value(unsigned{v});
      return r;
    }
    case 'i': {
      std::int32_t v = 0;
      int r = sd_bus_message_read_basic(m, type, &v);
      out = Value(int{v});
      return r;
    }
    case 'u': {
      std::uint32_t v = 0;
      int r = sd_bus_message_read_basic(m, type, &v);
      out = Value(unsigned{v});
      return r;
    }
    case 'x': {
      std::int64_t v = 0;
      int r = sd_bus_message_read_basic(m, type, &v);
      out = Value(static_cast<long long>(v));
      return r;
    }
    case 't': {
      std::uint64_t v = 0;
      int r = sd_bus_message_read_basic(m, type, &v);
      out = Value(static_cast<unsigned long long>(v));
      return r;
    }
    case 'd': {
      double v = 0;
      int r = sd_bus_message_read_basic(m, type, &v);
      out = Value(v);
      return r;
    }
    case 'b': {
      int v = 0;
      int r = sd_bus_message_read_basic(m, type, &v);
      out = Value(v != 0);
      return r;
    }
    case 's':
    case 'o':
    case 'g': {
      const char* v = nullptr;
      int r = sd_bus_message_read_basic(m, type, &v);
      out = Value(v ? v : "");
      return r;
    }
    case 'h':
      if (why) *why = "file descriptors are not accepted";
      return -EINVAL;
    default:
      if (why) *why = std::string("unsupported type '") + type + "'";
      return -EINVAL;
  }
}

int tooDeep(std::string* why) {
  if (why) *why = "value nested deeper than " + std::to_string(kMaxDepth) + " containers";
  return -EINVAL;
}

int readEntries(sd_bus_message* m, const char* contents, Dictionary& out, std::string* why, int depth) {
  // contents is "{kv}": the entry signature without the braces.
  std::string entry(contents + 1, std::strlen(contents) - 2);
  int r = sd_bus_message_enter_container(m, 'a', contents);
  if (r < 0) return r;
  for (;;) {
    r = sd_bus_message_enter_container(m, 'e', entry.c_str());
    if (r < 0) return r;
    if (r == 0) break;
    Value key, value;
    if ((r = readValue(m, key, why, depth)) < 0) return r;
    if ((r = readValue(m, value, why, depth)) < 0) return r;
    if ((r = sd_bus_message_exit_container(m)) < 0) return r;
    out.set(std::move(key), std::move(value));
  }
  return sd_bus_message_exit_container(m);
}

}  // namespace

int appendVariant(sd_bus_message* m, const Value& v) {
  int r = 0;
  switch (v.kind()) {
    case Value::Kind::Absent:
      if ((r = sd_bus_message_open_container(m, 'v', "av")) < 0) return r;
      if ((r = sd_bus_message_open_container(m, 'a', "v")) < 0) return r;
      if ((r = sd_bus_message_close_container(m)) < 0) return r;
      return sd_bus_message_close_container(m);
    case Value::Kind::Bool: return sd_bus_message_append(m, "v", "b", *v.asBool() ? 1 : 0);
    case Value::Kind::Int: return sd_bus_message_append(m, "v", "x", static_cast<std::int64_t>(*v.asInt()));
    case Value::Kind::UInt: return sd_bus_message_append(m, "v", "t", static_cast<std::uint64_t>(*v.asUInt()));
    case Value::Kind::Double: return sd_bus_message_append(m, "v", "d", *v.asDouble());
    case Value::Kind::String: return sd_bus_message_append(m, "v", "s", v.asString()->c_str());
    case Value::Kind::Data: {
      const Data& d = *v.asData();
      if ((r = sd_bus_message_open_container(m, 'v', "ay")) < 0) return r;
      if ((r = sd_bus_message_append_array(m, 'y', d.data(), d.size())) < 0) return r;
      return sd_bus_message_close_container(m);
    }
    case Value::Kind::Array:
      if ((r = sd_bus_message_open_container(m, 'v', "av")) < 0) return r;
      if ((r = sd_bus_message_open_container(m, 'a', "v")) < 0) return r;
      for (const auto& e : *v.asArray())
        if ((r = appendVariant(m, e)) < 0) return r;
      if ((r = sd_bus_message_close_container(m)) < 0) return r;
      return sd_bus_message_close_container(m);
    case Value::Kind::Dictionary:
      if ((r = sd_bus_message_open_container(m, 'v', "a{sv}")) < 0) return r;
      if ((r = appendDictionary(m, *v.asDictionary())) < 0) return r;
      return sd_bus_message_close_container(m);
  }
  return -EINVAL;
}

int appendDictionary(sd_bus_message* m, const Dictionary& d) {
  int r = sd_bus_message_open_container(m, 'a', "{sv}");
  if (r < 0) return r;
  for (const auto& [k, v] : d) {
    if ((r = sd_bus_message_open_container(m, 'e', "sv")) < 0) return r;
    if ((r = appendKey(m, k)) < 0) return r;
    if ((r = appendVariant(m, v)) < 0) return r;
    if ((r = sd_bus_message_close_container(m)) < 0) return r;
  }
  return sd_bus_message_close_container(m);
}

int appendInt64Array(sd_bus_message* m, const std::vector<std::int64_t>& ids) {
  return sd_bus_message_append_array(m, 'x', ids.data(), ids.size() * sizeof(std::int64_t));
}

int readValue(sd_bus_message* m, Value& out, std::string* why, int depth) {
  char type = 0;
  const char* contents = nullptr;
  int r = sd_bus_message_peek_type(m, &type, &contents);
  if (r < 0) return r;
  if (r == 0) return -ENXIO;
  switch (type) {
    case 'v': {
      if ((r = sd_bus_message_enter_container(m, 'v', contents)) < 0) return r;
      if ((r = readValue(m, out, why, depth)) < 0) return r;
      return sd_bus_message_exit_container(m);
    }
    case 'a': {
      if (depth + 1 > kMaxDepth) return tooDeep(why);
      if (std::strcmp(contents, "y") == 0) {
        const void* p = nullptr;
        size_t n = 0;
        if ((r = sd_bus_message_read_array(m, 'y', &p, &n)) < 0) return r;
        const auto* b = static_cast<const std::uint8_t*>(p);
        out = Value(Data(b, b + n));
        return 1;
      }
      if (contents[0] == '{') {
        Dictionary d;
        if ((r = readEntries(m, contents, d, why, depth + 1)) < 0) return r;
        out = Value(std::move(d));
        return 1;
      }
      Array a;
      if ((r = sd_bus_message_enter_container(m, 'a', contents)) < 0) return r;
      while ((r = sd_bus_message_at_end(m, 0)) == 0) {
        Value e;
        if ((r = readValue(m, e, why, depth + 1)) < 0) return r;
        a.push_back(std::move(e));
      }
      if (r < 0) return r;
      if ((r = sd_bus_message_exit_container(m)) < 0) return r;
      out = Value(std::move(a));
      return 1;
    }
    case 'r': {
      if (depth + 1 > kMaxDepth) return tooDeep(why);
      Array a;
      if ((r = sd_bus_message_enter_container(m, 'r', contents)) < 0) return r;
      while ((r = sd_bus_message_at_end(m, 0)) == 0) {
        Value e;
        if ((r = readValue(m, e, why, depth + 1)) < 0) return r;
        a.push_back(std::move(e));
      }
      if (r < 0) return r;
      if ((r = sd_bus_message_exit_container(m)) < 0) return r;
      out = Value(std::move(a));
      return 1;
    }
    default:
      return readBasic(m, type, out, why);
  }
}

int readDictionary(sd_bus_message* m, Dictionary& out, std::string* why) {
  char type = 0;
  const char* contents = nullptr;
  int r = sd_bus_message_peek_type(m, &type, &contents);
  if (r < 0) return r;
  if (r == 0 || type != 'a' || contents[0] != '{') {
    if (why) *why = "expected a dictionary";
    return -EINVAL;
  }
  return readEntries(m, contents, out, why, 1);
}

}  // namespace vireo::client::marshal
