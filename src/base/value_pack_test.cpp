// Packed values come back exactly as they went in, and a damaged buffer is refused
// rather than read past its end.
#include "base/value_pack.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>

namespace vireo {
namespace {

Value everyKind() {
  Dictionary nested{{"empty array", Array{}}, {"empty dictionary", Dictionary{}}, {"absent", Value()}};
  Dictionary d{
      {"true", true},
      {"false", false},
      {"int min", static_cast<long long>(std::numeric_limits<std::int64_t>::min())},
      {"minus one", -1},
      {"int max", static_cast<long long>(std::numeric_limits<std::int64_t>::max())},
      {"uint max", static_cast<unsigned long long>(std::numeric_limits<std::uint64_t>::max())},
      {"double", -0.1},
      {"infinity", std::numeric_limits<double>::infinity()},
      {"string", std::string("a\0b", 3)},
      {"data", Data{0, 255, 7}},
      {"array", Array{1, "two", Array{3.5}, nested}},
  };
  d.set(Value(7), Value("integer key"));
  d.set(Value(std::nan("")), Value("NaN key"));
  return Value(std::move(d));
}

TEST(ValuePack, RoundTripsEveryKindAndRefusesDamage) {
  const Value original = everyKind();
  const std::string packed = packValue(original);
  std::string_view in = packed;
  auto back = unpackValue(in);
  ASSERT_TRUE(back);
  EXPECT_TRUE(in.empty());
  // NaN is never == itself, so compare what both pack to, then the rest as text.
  EXPECT_EQ(packValue(*back), packed);
  EXPECT_EQ(back->text(), original.text());
  EXPECT_EQ(back->asDictionary()->find("int min")->toInt64(), std::numeric_limits<std::int64_t>::min());

  // Every truncation is refused, and so is a length that runs past the end.
  for (std::size_t n = 0; n < packed.size(); ++n) {
    std::string_view cut(packed.data(), n);
    EXPECT_FALSE(unpackValue(cut)) << n;
  }
  std::string lying = packValue(Value("abc"));
  lying[1] = 100;
  std::string_view lie = lying;
  EXPECT_FALSE(unpackValue(lie));
}

}  // namespace
}  // namespace vireo
