#include "ctl/arguments.h"

#include <gtest/gtest.h>

namespace vireo::ctl {
namespace {

std::optional<Operation> parse(std::vector<std::string> words, std::string* error = nullptr) {
  return parseOperation(words, error);
}

TEST(Arguments, TypedValuesAndNumbers) {
  const std::pair<const char*, Value> typed[] = {
      {"12", Value(12)}, {"-3", Value(-3)}, {"0x10", Value(16)}, {"18446744073709551615", Value(18446744073709551615ull)},
      {"1.5", Value(1.5)}, {"true", Value(true)}, {"false", Value(false)}, {"s:12", Value("12")},
      {"speaker", Value("speaker")}, {"inf", Value("inf")}, {"", Value("")}};
  for (const auto& [word, value] : typed) EXPECT_EQ(parseTypedValue(word), value) << word;
  EXPECT_EQ(parseUInt("0x40000003", UINT32_MAX), 0x40000003u);
  EXPECT_EQ(parseUInt("4294967296", UINT32_MAX), std::nullopt);
  EXPECT_EQ(parseUInt("-1", UINT32_MAX), std::nullopt);
  EXPECT_EQ(parseInt64("-9223372036854775808"), INT64_MIN);
  EXPECT_EQ(parseInt64("9223372036854775808"), std::nullopt);
}

// Sends with --to, entries and broadcasts run end to end; here the other addressing forms.
TEST(Arguments, SendAddressing) {
  auto op = parse({"send", "--to", "1,-2", "0x40000003", "4"});
  ASSERT_TRUE(op);
  EXPECT_EQ(op->to, (std::vector<std::int64_t>{1, -2}));
  op = parse({"send", "--to-none", "1", "2"});
  ASSERT_TRUE(op);
  EXPECT_EQ(op->addressing, Addressing::ToNone);
  EXPECT_TRUE(op->to.empty());
}

TEST(Arguments, UsageErrorsAreReported) {
  std::string error;
  EXPECT_FALSE(parse({"send", "1", "70000"}, &error));
  EXPECT_NE(error.find("type"), std::string::npos);
  for (std::vector<std::string> words : std::vector<std::vector<std::string>>{
           {"create", "1", "2"}, {"configure", "1", "novalue"}, {"start", "1", "--later"}, {"frobnicate"},
           {"sleep", "-1"}})
    EXPECT_FALSE(parse(words)) << words[0];
  auto start = parse({"start", "5", "--no-wait"});
  ASSERT_TRUE(start);
  EXPECT_EQ(start->startMode, StartMode::NoWait);
}

// Sequences and plain script lines are run end to end; here the quoting.
TEST(Arguments, ScriptLineQuoting) {
  auto words = splitLine("configure 1 'name=a b' \"x=#1\"  # comment", nullptr);
  ASSERT_TRUE(words);
  EXPECT_EQ(*words, (std::vector<std::string>{"configure", "1", "name=a b", "x=#1"}));
  EXPECT_FALSE(splitLine("send 'open", nullptr));
}

TEST(Arguments, Times) {
  EXPECT_EQ(parseTime("1700000000.5"), 1700000000.5);
  EXPECT_EQ(parseTime("2023-11-14T22:13:20Z"), 1700000000.0);
  EXPECT_EQ(parseTime("2023-11-14 22:13:20"), 1700000000.0);
  EXPECT_EQ(parseTime("2023-11-15T00:13:20+02:00"), 1700000000.0);
  EXPECT_EQ(parseTime("2023-11-14"), 1699920000.0);
  EXPECT_EQ(parseTime("yesterday"), std::nullopt);
}

}  // namespace
}  // namespace vireo::ctl
