#include "base/value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>

namespace vireo {
namespace {

TEST(Dictionary, KeepsInsertionOrderAndReplacesInPlace) {
  Dictionary d;
  d.set("b", 1);
  d.set("a", 2);
  d.set("b", 3);
  ASSERT_EQ(d.size(), 2u);
  EXPECT_EQ(*d[0].first.asString(), "b");
  EXPECT_EQ(*d[0].second.asInt(), 3);
  EXPECT_EQ(*d[1].first.asString(), "a");
}

TEST(Dictionary, KeysOfDifferentKindsAreDistinct) {
  Dictionary d;
  d.set(Value(1), "signed");
  d.set(Value(1u), "unsigned");
  d.set(Value("1"), "string");
  EXPECT_EQ(d.size(), 3u);
  EXPECT_EQ(*d.find(Value(1u))->asString(), "unsigned");
}

TEST(Dictionary, LargeDictionariesStayCorrectPastTheIndexThreshold) {
  Dictionary d;
  for (int i = 0; i < 1000; ++i) d.set(Value(std::to_string(i)), i);
  for (int i = 0; i < 1000; i += 2) d.set(Value(std::to_string(i)), -i);
  ASSERT_EQ(d.size(), 1000u);
  EXPECT_EQ(*d.find("998")->asInt(), -998);
  EXPECT_EQ(*d.find("999")->asInt(), 999);
  EXPECT_EQ(d.find("1000"), nullptr);
  // Copies and moves must not carry an index that points into another vector.
  Dictionary copy = d;
  copy.set("new", 1);
  EXPECT_EQ(*copy.find("500")->asInt(), -500);
  Dictionary moved = std::move(copy);
  EXPECT_EQ(*moved.find("new")->asInt(), 1);
  EXPECT_EQ(moved.size(), 1001u);
}

TEST(Value, ContainersAreCopyOnWrite) {
  Value a(Dictionary{{"k", 1}});
  Value b = a;
  b.mutableDictionary()->set("k", 2);
  EXPECT_EQ(*a.asDictionary()->find("k")->asInt(), 1);
  EXPECT_EQ(*b.asDictionary()->find("k")->asInt(), 2);

  Value arr(Array{1, 2});
  Value arr2 = arr;
  arr2.mutableArray()->push_back(3);
  EXPECT_EQ(arr.asArray()->size(), 2u);
  EXPECT_EQ(arr2.asArray()->size(), 3u);
}

TEST(Value, NumbersConvert) {
  EXPECT_EQ(Value(2.9).toInt64(), 2);
  EXPECT_EQ(Value(-2.9).toInt64(), -2);
  EXPECT_EQ(Value(true).toInt64(), 1);
  EXPECT_EQ(Value(std::numeric_limits<double>::infinity()).toInt64(), INT64_MAX);
  EXPECT_EQ(Value("3").toInt64(), std::nullopt);
  EXPECT_EQ(Value(7u).toDouble(), 7.0);
}

TEST(Value, TextFormIsDeterministic) {
  EXPECT_EQ(Value("plain").text(), "plain");
  EXPECT_EQ(Value(1.5).text(), "1.5");
  EXPECT_EQ(Value(0.1).text(), "0.1");
  EXPECT_EQ(Value(-3).text(), "-3");
  EXPECT_EQ(Value(Data{0x0a, 0xff}).text(), "<0aff>");
  EXPECT_EQ(Value().text(), "(null)");
  Value nested(Dictionary{{"a", Array{1, "x"}}, {Value(5), true}});
  EXPECT_EQ(nested.text(), R"({"a": [1, "x"], 5: true})");
}

TEST(Json, CompactAndPrettyKeepOrder) {
  Value v(Dictionary{{"z", 1}, {"a", Array{2.0, "q\"\n"}}, {"e", Dictionary{}}});
  EXPECT_EQ(*toJson(v, JsonMode::Strict), R"({"z":1,"a":[2.0,"q\"\n"],"e":{}})");
  EXPECT_EQ(*toJson(Value(Array{Dictionary{{"k", 1}}}), JsonMode::Strict, true),
            "[\n  {\n    \"k\" : 1\n  }\n]");
}

TEST(Json, StrictRefusesWhatJsonCannotHold) {
  JsonError error;
  EXPECT_FALSE(toJson(Value(Array{std::nan("")}), JsonMode::Strict, false, &error));
  EXPECT_FALSE(error.message.empty());
  EXPECT_FALSE(toJson(Value(Array{Data{1}}), JsonMode::Strict));
  EXPECT_FALSE(toJson(Value(Dictionary{{Value(1), 1}}), JsonMode::Strict));
  EXPECT_FALSE(toJson(Value(-std::numeric_limits<double>::infinity()), JsonMode::Strict));
}

TEST(Json, LenientWritesEverything) {
  Value v(Dictionary{{Value(1), Data{'h', 'i'}}, {"n", std::nan("")}, {"c", "\x01"}});
  EXPECT_EQ(*toJson(v, JsonMode::Lenient), R"({"1":"aGk=","n":null,"c":"\u0001"})");
}

TEST(Base64, PadsAllRemainders) {
  EXPECT_EQ(base64Encode({}), "");
  EXPECT_EQ(base64Encode({'f'}), "Zg==");
  EXPECT_EQ(base64Encode({'f', 'o'}), "Zm8=");
  EXPECT_EQ(base64Encode({'f', 'o', 'o'}), "Zm9v");
}

}  // namespace
}  // namespace vireo
