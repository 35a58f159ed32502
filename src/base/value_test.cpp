#include "base/value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <limits>
#include <thread>
#include <vector>

namespace vireo {
namespace {

// Key identity and order are checked below; here an index must not outlive its vector.
TEST(Dictionary, CopiesAndMovesOfIndexedDictionariesKeepTheirOwnIndex) {
  Dictionary d;
  for (int i = 0; i < 1000; ++i) d.set(Value(std::to_string(i)), i);
  Dictionary copy = d;
  copy.set("new", 1);
  copy.set("500", -500);
  EXPECT_EQ(*d.find("500")->asInt(), 500);
  EXPECT_EQ(d.find("new"), nullptr);
  Dictionary moved = std::move(copy);
  EXPECT_EQ(*moved.find("new")->asInt(), 1);
  EXPECT_EQ(*moved.find("500")->asInt(), -500);
  EXPECT_EQ(moved.size(), 1001u);
}

double nanWithPayload(std::uint64_t payload, bool negative) {
  const std::uint64_t sign = negative ? 0x8000000000000000ULL : 0;
  const std::uint64_t bits = sign | 0x7ff8000000000000ULL | (payload & 0x7ffffffffffffULL);
  double d;
  std::memcpy(&d, &bits, sizeof d);
  return d;
}

// Key identity, checked with a dictionary small enough to be scanned and one big
// enough to be indexed: both must agree.
TEST(Dictionary, KeyIdentityIsTheSameScannedAndIndexed) {
  const double nan = std::numeric_limits<double>::quiet_NaN();
  const struct {
    Value a, b;
    bool same;
  } cases[] = {
      {Value(nan), Value(nanWithPayload(12345, true)), true},
      {Value(0.0), Value(-0.0), true},
      {Value(Array{nan, "x"}), Value(Array{nanWithPayload(7, false), "x"}), true},
      {Value(Dictionary{{Value(nan), 1}}), Value(Dictionary{{Value(-nan), 1}}), true},
      {Value(Data{1, 2}), Value(Data{1, 2}), true},
      {Value(1), Value(1u), false},
      {Value(1), Value(1.0), false},
      {Value("1"), Value(1), false},
      {Value(nan), Value(std::numeric_limits<double>::infinity()), false},
      {Value(Data{'a'}), Value("a"), false},
  };
  for (std::size_t filler : {0, 200}) {
    for (const auto& c : cases) {
      Dictionary d;
      for (std::size_t i = 0; i < filler; ++i) d.set(Value("filler" + std::to_string(i)), Value(i));
      d.set(c.a, "a");
      d.set(c.b, "b");
      const std::string label = c.a.text() + " then " + c.b.text();
      EXPECT_EQ(d.size(), filler + (c.same ? 1 : 2)) << label << " filler " << filler;
      ASSERT_NE(d.find(c.a), nullptr) << label;
      EXPECT_EQ(*d.find(c.a)->asString(), c.same ? "b" : "a") << label << " filler " << filler;
      EXPECT_EQ(*d.find(c.b)->asString(), "b") << label;
      EXPECT_EQ(d[filler].first.text(), c.a.text()) << label;  // the first key stays where it came
    }
  }
}

// Payload dictionaries are shared copy-on-write between threads: readers of the
// shared one run while copies are unshared and grown.
TEST(Dictionary, SharedDictionaryIsReadFromManyThreadsWhileCopiesChange) {
  Dictionary built;
  for (int i = 0; i < 1000; ++i) built.set(Value(std::to_string(i)), i);
  const Value shared{Dictionary(built)};  // a copy, as every unshared container is
  std::vector<std::thread> threads;
  std::vector<int> found(4, 0);
  for (int t = 0; t < 4; ++t)
    threads.emplace_back([&, t] {
      const Dictionary& d = *shared.asDictionary();
      for (int round = 0; round < 5; ++round)
        for (int i = 0; i < 1000; ++i)
          found[t] += d.contains(std::to_string(i)) && !d.contains("x" + std::to_string(i));
    });
  for (int t = 0; t < 2; ++t)
    threads.emplace_back([&, t] {
      for (int round = 0; round < 5; ++round) {
        Value mine = shared;
        for (int i = 0; i < 1000; ++i) mine.mutableDictionary()->set(Value("x" + std::to_string(i + t)), round);
      }
    });
  for (auto& thread : threads) thread.join();
  for (int n : found) EXPECT_EQ(n, 5000);
  EXPECT_EQ(shared.asDictionary()->size(), 1000u);
}

TEST(Value, ArraysAreCopyOnWriteAndNumbersConvert) {
  Value arr(Array{1, 2});
  Value arr2 = arr;
  arr2.mutableArray()->push_back(3);
  EXPECT_EQ(arr.asArray()->size(), 2u);

  EXPECT_EQ(Value(-2.9).toInt64(), -2);
  EXPECT_EQ(Value(true).toInt64(), 1);
  EXPECT_EQ(Value(std::numeric_limits<double>::infinity()).toInt64(), INT64_MAX);
  EXPECT_EQ(Value("3").toInt64(), std::nullopt);
}

TEST(Value, TextAndJsonForms) {
  const std::pair<Value, const char*> texts[] = {
      {Value("plain"), "plain"}, {Value(1.5), "1.5"}, {Value(0.1), "0.1"}, {Value(-3), "-3"},
      {Value(Data{0x0a, 0xff}), "<0aff>"}, {Value(), "(null)"},
      {Value(Dictionary{{"a", Array{1, "x"}}, {Value(5), true}}), R"({"a": [1, "x"], 5: true})"}};
  for (const auto& [value, text] : texts) EXPECT_EQ(value.text(), text);

  Value v(Dictionary{{"z", 1}, {"a", Array{2.0, "q\"\n"}}, {"e", Dictionary{}}});
  EXPECT_EQ(*toJson(v, JsonMode::Strict), R"({"z":1,"a":[2.0,"q\"\n"],"e":{}})");
  EXPECT_EQ(*toJson(Value(Array{Dictionary{{"k", 1}}}), JsonMode::Strict, true), "[\n  {\n    \"k\" : 1\n  }\n]");
  Value odd(Dictionary{{Value(1), Data{'h', 'i'}}, {"n", std::nan("")}, {"c", "\x01"}});
  EXPECT_EQ(*toJson(odd, JsonMode::Lenient), R"({"1":"aGk=","n":null,"c":"\u0001"})");

  // Strict mode refuses what JSON cannot hold.
  JsonError error;
  EXPECT_FALSE(toJson(Value(Array{std::nan("")}), JsonMode::Strict, false, &error));
  EXPECT_FALSE(error.message.empty());
  for (const Value& bad : {Value(Array{Data{1}}), Value(Dictionary{{Value(1), 1}}),
                           Value(-std::numeric_limits<double>::infinity())})
    EXPECT_FALSE(toJson(bad, JsonMode::Strict)) << bad.text();
  EXPECT_EQ(base64Encode({'f'}), "Zg==");
  EXPECT_EQ(base64Encode({'f', 'o'}), "Zm8=");
  EXPECT_EQ(base64Encode({'f', 'o', 'o'}), "Zm9v");
}

}  // namespace
}  // namespace vireo
