#include "base/value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>

namespace vireo {
namespace {

TEST(Dictionary, OrderKindsAndTheIndexOfLargeDictionaries) {
  Dictionary d;
  d.set("b", 1);
  d.set("a", 2);
  d.set("b", 3);  // replaced in place
  ASSERT_EQ(d.size(), 2u);
  EXPECT_EQ(*d[0].first.asString(), "b");
  EXPECT_EQ(*d[0].second.asInt(), 3);
  d.set(Value(1), "signed");
  d.set(Value(1u), "unsigned");
  d.set(Value("1"), "string");
  EXPECT_EQ(d.size(), 5u);
  EXPECT_EQ(*d.find(Value(1u))->asString(), "unsigned");

  for (int i = 0; i < 1000; ++i) d.set(Value(std::to_string(i)), i);
  for (int i = 0; i < 1000; i += 2) d.set(Value(std::to_string(i)), -i);
  EXPECT_EQ(*d.find("998")->asInt(), -998);
  EXPECT_EQ(*d.find("999")->asInt(), 999);
  EXPECT_EQ(d.find("1000"), nullptr);
  // Copies and moves must not carry an index that points into another vector.
  Dictionary copy = d;
  copy.set("new", 1);
  EXPECT_EQ(*copy.find("500")->asInt(), -500);
  Dictionary moved = std::move(copy);
  EXPECT_EQ(*moved.find("new")->asInt(), 1);
  EXPECT_EQ(moved.size(), 1005u);
}

TEST(Value, ContainersAreCopyOnWriteAndNumbersConvert) {
  Value a(Dictionary{{"k", 1}});
  Value b = a;
  b.mutableDictionary()->set("k", 2);
  EXPECT_EQ(*a.asDictionary()->find("k")->asInt(), 1);
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
