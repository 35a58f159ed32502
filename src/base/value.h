// The property-list value that payloads, configurations and events are made of.
//
// Containers are shared copy-on-write, so handing a payload to the aggregation
// list, the telemetry queue and the analytics sink costs a reference count, not a
// deep copy. Dictionaries keep insertion order (the order a client sent) and take
// keys of any basic kind.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

namespace vireo {

class Value;
class Dictionary;
using Array = std::vector<Value>;
using Data = std::vector<std::uint8_t>;

class Value {
 public:
  enum class Kind : std::uint8_t { Absent, Bool, Int, UInt, Double, String, Data, Array, Dictionary };

  Value() noexcept = default;
  Value(std::nullptr_t) noexcept {}
  Value(bool b) : v_(b) {}
  Value(int i) : v_(std::int64_t{i}) {}
  Value(long i) : v_(std::int64_t{i}) {}
  Value(long long i) : v_(std::int64_t{i}) {}
  Value(unsigned u) : v_(std::uint64_t{u}) {}
  Value(unsigned long u) : v_(std::uint64_t{u}) {}
  Value(unsigned long long u) : v_(std::uint64_t{u}) {}
  Value(double d) : v_(d) {}
  Value(std::string s) : v_(std::move(s)) {}
  Value(std::string_view s) : v_(std::string(s)) {}
  Value(const char* s) : v_(std::string(s)) {}
  Value(Data d);
  Value(Array a);
  Value(Dictionary d);

  Kind kind() const noexcept { return static_cast<Kind>(v_.index()); }
  bool isAbsent() const noexcept { return kind() == Kind::Absent; }
  bool isNumber() const noexcept {
    auto k = kind();
    return k == Kind::Bool || k == Kind::Int || k == Kind::UInt || k == Kind::Double;
  }
  bool isBasic() const noexcept { return kind() != Kind::Array && kind() != Kind::Dictionary && kind() != Kind::Data; }

  const bool* asBool() const noexcept { return std::get_if<bool>(&v_); }
  const std::int64_t* asInt() const noexcept { return std::get_if<std::int64_t>(&v_); }
  const std::uint64_t* asUInt() const noexcept { return std::get_if<std::uint64_t>(&v_); }
  const double* asDouble() const noexcept { return std::get_if<double>(&v_); }
  const std::string* asString() const noexcept { return std::get_if<std::string>(&v_); }
  const Data* asData() const noexcept;
  const Array* asArray() const noexcept;
  const Dictionary* asDictionary() const noexcept;

  // Mutable access to a container; unshares it first when another value holds it too.
  Array* mutableArray();
  Dictionary* mutableDictionary();

  // Any number read as a signed 64-bit integer (doubles truncate, unsigned wraps),
  // absent for non-numbers.
  std::optional<std::int64_t> toInt64() const noexcept;
  std::optional<double> toDouble() const noexcept;

  // The deterministic textual form used in log lines ("%@") and summaries: a string
  // stands as itself at top level and quoted inside containers.
  std::string text() const;
  void appendText(std::string& out, bool nested) const;

  friend bool operator==(const Value& a, const Value& b) noexcept;
  std::size_t hash() const noexcept;

 private:
  using DataPtr = std::shared_ptr<Data>;
  using ArrayPtr = std::shared_ptr<Array>;
  using DictPtr = std::shared_ptr<Dictionary>;
  std::variant<std::monostate, bool, std::int64_t, std::uint64_t, double, std::string, DataPtr, ArrayPtr, DictPtr> v_;
};

// Insertion-ordered map from basic values to values. Lookup is linear for small
// dictionaries and hashed once they grow, so a client cannot make merging quadratic.
//
// Keys are the same key when they are ==, with one exception: every NaN double is
// one key (0.0 and -0.0 already are), so a repeated NaN key replaces the earlier
// value like any repeated key instead of piling up entries that can never be found.
//
// Const access never writes: the index is kept up to date by the mutating calls,
// so a dictionary shared between threads may be read from all of them at once.
class Dictionary {
 public:
  using Entry = std::pair<Value, Value>;

  Dictionary() = default;
  Dictionary(std::initializer_list<Entry> entries);

  std::size_t size() const noexcept { return entries_.size(); }
  bool empty() const noexcept { return entries_.empty(); }
  auto begin() const noexcept { return entries_.begin(); }
  auto end() const noexcept { return entries_.end(); }
  const Entry& operator[](std::size_t i) const { return entries_[i]; }

  const Value* find(const Value& key) const noexcept;
  const Value* find(std::string_view key) const { return find(Value(key)); }
  const Value* find(const char* key) const { return find(Value(key)); }
  const Value* find(const std::string& key) const { return find(Value(key)); }
  bool contains(const Value& key) const noexcept { return find(key) != nullptr; }
  bool contains(std::string_view key) const { return find(key) != nullptr; }
  bool contains(const char* key) const { return find(key) != nullptr; }
  bool contains(const std::string& key) const { return find(key) != nullptr; }

  // Replaces the value of an existing key in place, otherwise appends.
  void set(Value key, Value value);
  // Adds every entry of other; later values replace earlier ones under the same key.
  void merge(const Dictionary& other);
  void reserve(std::size_t n);

  friend bool operator==(const Dictionary& a, const Dictionary& b) noexcept;

 private:
  // An open-addressed slot: the key's hash and 1 + its position in entries_ (0 when
  // free). Positions, unlike pointers, stay valid in copies and across reallocation.
  struct Slot {
    std::uint32_t hash;
    std::uint32_t position;
  };
  std::size_t indexOf(const Value& key, std::uint32_t hash) const noexcept;
  void growIndex(std::size_t capacity);

  std::vector<Entry> entries_;
  std::vector<Slot> slots_;  // empty while small; otherwise indexes every entry, at most half full
};

// JSON writing. Strict mode refuses what strict JSON cannot hold (NaN, infinities,
// data, non-string keys); lenient mode writes data as base64 strings, keys in their
// text form and non-finite numbers as null, for the store's JSON columns.
enum class JsonMode { Strict, Lenient };
struct JsonError {
  std::string message;
};
// Returns false and fills error (if given) when strict mode refuses the value.
bool appendJson(std::string& out, const Value& v, JsonMode mode, bool pretty, JsonError* error = nullptr,
                int indent = 0);
// The same for a dictionary held directly, without wrapping (copying) it in a Value.
bool appendJson(std::string& out, const Dictionary& d, JsonMode mode, bool pretty, JsonError* error = nullptr,
                int indent = 0);
std::optional<std::string> toJson(const Value& v, JsonMode mode, bool pretty = false, JsonError* error = nullptr);

std::string base64Encode(const Data& data);

// Formats a double in the shortest form that reads back to the same value.
void appendDouble(std::string& out, double d);

}  // namespace vireo
