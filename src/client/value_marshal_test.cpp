#include "client/value_marshal.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

namespace vireo::client::marshal {
namespace {

// A bus object that never finishes its handshake is enough to build and read
// messages locally.
class MarshalTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds_), 0);
    ASSERT_GE(sd_bus_new(&bus_), 0);
    ASSERT_GE(sd_bus_set_fd(bus_, fds_[0], fds_[0]), 0);
    ASSERT_GE(sd_bus_start(bus_), 0);
  }
  void TearDown() override {
    sd_bus_close_unref(bus_);
    close(fds_[1]);
  }
  sd_bus_message* newMessage() {
    sd_bus_message* m = nullptr;
    EXPECT_GE(sd_bus_message_new_method_call(bus_, &m, "a.b", "/a", "a.b", "M"), 0);
    return m;
  }
  static void seal(sd_bus_message* m) {
    ASSERT_GE(sd_bus_message_seal(m, 1, 0), 0);
    ASSERT_GE(sd_bus_message_rewind(m, 1), 0);
  }
  int fds_[2] = {-1, -1};
  sd_bus* bus_ = nullptr;
};

TEST_F(MarshalTest, DictionaryRoundTripKeepsKindsAndOrder) {
  Dictionary inner{{"x", Value(1.5)}, {"list", Value(Array{Value(1), Value("two")})}};
  Dictionary d{{"s", Value("text")},        {"i", Value(-7)},
               {"u", Value(7u)},            {"b", Value(true)},
               {"d", Value(Data{1, 2, 3})}, {"nested", Value(inner)}};
  sd_bus_message* m = newMessage();
  ASSERT_GE(appendDictionary(m, d), 0);
  seal(m);
  Dictionary back;
  std::string why;
  ASSERT_GE(readDictionary(m, back, &why), 0) << why;
  EXPECT_EQ(back, d);
  EXPECT_EQ(back[0].first, Value("s"));
  sd_bus_message_unref(m);
}

TEST_F(MarshalTest, ReaderKeepsSignednessOfNarrowIntegers) {
  sd_bus_message* m = newMessage();
  ASSERT_GE(sd_bus_message_append(m, "qnyu", 65535, -2, 255, 4000000000u), 0);
  seal(m);
  Value q, n, y, u;
  ASSERT_GE(readValue(m, q, nullptr), 0);
  ASSERT_GE(readValue(m, n, nullptr), 0);
  ASSERT_GE(readValue(m, y, nullptr), 0);
  ASSERT_GE(readValue(m, u, nullptr), 0);
  EXPECT_EQ(*q.asUInt(), 65535u);
  EXPECT_EQ(*n.asInt(), -2);
  EXPECT_EQ(*y.asUInt(), 255u);
  EXPECT_EQ(*u.asUInt(), 4000000000u);
  sd_bus_message_unref(m);
}

TEST_F(MarshalTest, NestingBeyondSixteenContainersIsRefused) {
  auto nested = [](int levels) {
    Value v(1);
    for (int i = 0; i < levels; ++i) v = Value(Array{v});
    return v;
  };
  for (int levels : {kMaxDepth, kMaxDepth + 1}) {
    sd_bus_message* m = newMessage();
    ASSERT_GE(appendVariant(m, nested(levels)), 0);
    seal(m);
    Value out;
    std::string why;
    int r = readValue(m, out, &why);
    if (levels <= kMaxDepth) {
      EXPECT_GE(r, 0) << why;
    } else {
      EXPECT_EQ(r, -EINVAL);
      EXPECT_NE(why.find("16"), std::string::npos);
    }
    sd_bus_message_unref(m);
  }
}

TEST_F(MarshalTest, StructsBecomeArrays) {
  sd_bus_message* m = newMessage();
  ASSERT_GE(sd_bus_message_append(m, "(si)", "a", 3), 0);
  seal(m);
  Value out;
  ASSERT_GE(readValue(m, out, nullptr), 0);
  EXPECT_EQ(out, Value(Array{Value("a"), Value(3)}));
  sd_bus_message_unref(m);
}

}  // namespace
}  // namespace vireo::client::marshal
