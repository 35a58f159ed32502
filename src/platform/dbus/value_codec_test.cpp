#include "platform/dbus/value_codec.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstring>
#include <string>

#include "platform/dbus/bus.h"
#include "platform/dbus/send_message_arguments.h"

namespace vireo::dbus {
namespace {

// A bus on one end of a socket pair: enough for sd-bus to build and seal
// messages, which are then read back without ever being sent.
class ValueCodecTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds_), 0);
    ASSERT_GE(sd_bus_new(bus_.out()), 0);
    ASSERT_GE(sd_bus_set_fd(bus_.get(), fds_[0], fds_[0]), 0);
    ASSERT_GE(sd_bus_start(bus_.get()), 0);
  }
  void TearDown() override {
    sd_bus_close(bus_.get());  // nothing to flush: the peer never answers; closes fds_[0]
    close(fds_[1]);
  }

  MessageRef newMessage() {
    MessageRef m;
    EXPECT_GE(sd_bus_message_new_method_call(bus_.get(), m.out(), "com.example.Peer", "/", "com.example.Peer", "Call"),
              0);
    return m;
  }
  static void seal(const MessageRef& m) {
    ASSERT_GE(sd_bus_message_seal(m.get(), 1, 0), 0);
    ASSERT_GE(sd_bus_message_rewind(m.get(), true), 0);
  }
  // Writes value as a variant and reads it back.
  Value roundTrip(const Value& value) {
    MessageRef m = newMessage();
    EXPECT_GE(appendVariant(m.get(), value), 0);
    seal(m);
    Value out;
    BusError error;
    EXPECT_EQ(readValue(m.get(), &out, error.get()), 1) << error.message();
    return out;
  }

  // A refusal as a client sees it: InvalidArgs, naming the reason.
  static void expectInvalidArgs(int r, const BusError& error, const char* reason) {
    EXPECT_LT(r, 0);
    EXPECT_STREQ(error.name(), kInvalidArgs);
    EXPECT_NE(std::strstr(error.message(), reason), nullptr) << error.message();
  }

  int fds_[2] = {-1, -1};
  BusRef bus_;
};

// Types other writers may send: signedness kept, structs as arrays, variants unwrapped.
TEST_F(ValueCodecTest, ReadsEveryDBusType) {
  MessageRef m = newMessage();
  ASSERT_GE(sd_bus_message_append(m.get(), "sogbynqiuxtd", "text", "/a/path", "a{sv}", 1, std::uint8_t{200},
                                  std::int16_t{-2}, std::uint16_t{65535}, std::int32_t{-4}, std::uint32_t{4000000000u},
                                  std::int64_t{-5}, std::uint64_t{18000000000000000000ull}, 2.5),
            0);
  const std::uint8_t bytes[] = {0, 1, 255};
  ASSERT_GE(sd_bus_message_append_array(m.get(), 'y', bytes, sizeof bytes), 0);
  ASSERT_GE(sd_bus_message_append(m.get(), "a{iv}a(si)vva{sv}", 2, -1, "s", "minus", 7, "u", 7u, 2, "a", 1, "b", 2,
                                  "v", "x", std::int64_t{9}, "s", "end", 0),
            0);
  seal(m);
  const Value expected[] = {
      Value("text"), Value("/a/path"), Value("a{sv}"), Value(true), Value(std::uint64_t{200}),
      Value(std::int64_t{-2}), Value(std::uint64_t{65535}), Value(std::int64_t{-4}), Value(std::uint64_t{4000000000u}),
      Value(std::int64_t{-5}), Value(std::uint64_t{18000000000000000000ull}), Value(2.5), Value(Data{0, 1, 255}),
      Value(Dictionary{{Value(-1), Value("minus")}, {Value(7), Value(7u)}}),
      Value(Array{Value(Array{Value("a"), Value(1)}), Value(Array{Value("b"), Value(2)})}),
      Value(std::int64_t{9}), Value("end")};
  BusError error;
  for (const Value& e : expected) {
    Value v;
    ASSERT_EQ(readValue(m.get(), &v, error.get()), 1) << error.message();
    EXPECT_EQ(v, e) << e.text();
    EXPECT_EQ(v.kind(), e.kind()) << e.text();
  }
  Dictionary empty{{"x", 1}};
  ASSERT_EQ(readDictionary(m.get(), &empty, error.get()), 1);
  EXPECT_TRUE(empty.empty());
  Value end;
  EXPECT_EQ(readValue(m.get(), &end, error.get()), 0);
}

TEST_F(ValueCodecTest, RoundTrips) {
  const Value values[] = {
      Value(true), Value(false), Value(std::int64_t{-1} << 62), Value(std::uint64_t{1} << 63), Value(-0.25),
      Value(""), Value("grüße"), Value(Data{}), Value(Data{9, 8, 7}), Value(Array{}),
      Value(Array{Value(1), Value("two"), Value(Array{Value(3.0)})}), Value(Dictionary{}),
      Value(Dictionary{{"a", 1}, {"b", Dictionary{{"c", Data{1}}}}}),
      Value(Dictionary{{Value(-3), Value("neg")}, {Value(4), Value("pos")}}),
      Value(Dictionary{{Value(3u), Value(true)}}), Value(Dictionary{{Value(true), Value(1)}}),
      Value(Dictionary{{Value(1.5), Value(1)}})};
  for (const Value& v : values) {
    Value back = roundTrip(v);
    EXPECT_EQ(back, v) << v.text() << " came back as " << back.text();
  }
  // Keys of mixed kinds cannot form one D-Bus dictionary: they travel as pairs.
  EXPECT_EQ(roundTrip(Value(Dictionary{{Value("s"), Value(1)}, {Value(2), Value("two")}})),
            Value(Array{Value(Array{Value("s"), Value(1)}), Value(Array{Value(2), Value("two")})}));
}

// What is never accepted is refused with InvalidArgs naming the reason, whatever the
// limits: file descriptors anywhere, more than 16 containers (the payload dictionary is
// the first, whatever the innermost is), and a dictionary that is not one.
TEST_F(ValueCodecTest, RefusesDescriptorsDepthAndWrongTypesWhateverTheLimits) {
  const DecodeLimits tight{1000, 1000, 1};
  for (const Value& leaf : {Value("leaf"), Value(Data{1})}) {
    for (int levels : {16, 17}) {
      Value inner = leaf.asData() ? leaf : Value(Array{leaf});
      for (int i = 2; i < levels; ++i) inner = Value(Array{inner});
      Dictionary sent{{"k", inner}};
      MessageRef m = newMessage();
      ASSERT_GE(appendStringDictionary(m.get(), sent), 0);
      seal(m);
      Dictionary d;
      BusError error;
      int r = readDictionary(m.get(), &d, error.get(), tight);
      if (levels == 17) expectInvalidArgs(r, error, "nested deeper than 16");
      else EXPECT_TRUE(r == 1 && Value(d) == Value(sent)) << r << error.message() << Value(d).text();
    }
  }
  MessageRef top = newMessage(), inDict = newMessage(), asKey = newMessage(), strings = newMessage();
  ASSERT_GE(sd_bus_message_append(top.get(), "h", 0), 0);
  ASSERT_GE(sd_bus_message_append(inDict.get(), "a{sv}", 1, "fd", "h", 0), 0);
  ASSERT_GE(sd_bus_message_append(asKey.get(), "a{hs}", 1, 0, "x"), 0);
  ASSERT_GE(sd_bus_message_append(strings.get(), "as", 1, "x"), 0);
  for (MessageRef* m : {&top, &inDict, &asKey, &strings}) seal(*m);
  for (MessageRef* m : {&top, &asKey}) {
    Value v;
    BusError error;
    expectInvalidArgs(readValue(m->get(), &v, error.get()), error, "file descriptors");
  }
  Dictionary d;
  BusError fd, wrong;
  expectInvalidArgs(readDictionary(inDict.get(), &d, fd.get(), tight), fd, "file descriptors");
  expectInvalidArgs(readDictionary(strings.get(), &d, wrong.get(), tight), wrong, "");
}

// Each limit at its boundary, through SendMessage's arguments. The payload holds
// 31 bytes (keys 8, "xyz" 3, two integers 16, data 3, "q" 1) in 7 values (the
// dictionary, its 4 values, the list's 2 items); the call names 3 reporter IDs.
TEST_F(ValueCodecTest, EachLimitPassesAtItsValueAndRefusesOneBelow) {
  const Dictionary payload{{"ab", "xyz"}, {"n", 5}, {"d", Data{1, 2, 3}}, {"list", Array{7, "q"}}};
  const std::int64_t ids[] = {1, 2, 3};
  const struct {
    DecodeLimits limits;
    const char* refusal;  // nullptr: accepted
  } cases[] = {
      {{31, 7, 3}, nullptr},
      {{}, nullptr},
      {{30, 7, 3}, "payload larger than MaxPayloadBytes=30"},
      {{31, 6, 3}, "payload has more than MaxPayloadEntries=6 values"},
      {{31, 7, 2}, "more than MaxReporterIDsPerCall=2 reporter IDs"},
      {{0, kUnlimited, kUnlimited}, "payload larger than MaxPayloadBytes=0"},
      {{kUnlimited, 0, kUnlimited}, "payload has more than MaxPayloadEntries=0 values"},
  };
  for (const auto& c : cases) {
    MessageRef m = newMessage();
    ASSERT_GE(appendStringDictionary(m.get(), payload), 0);
    ASSERT_GE(sd_bus_message_append(m.get(), "uqb", 7u, std::uint16_t{2}, 1), 0);
    ASSERT_GE(sd_bus_message_append_array(m.get(), 'x', ids, sizeof ids), 0);
    seal(m);
    SendMessageArguments args;
    BusError error;
    const int r = readSendMessageArguments(m.get(), &args, error.get(), c.limits);
    if (!c.refusal) {
      ASSERT_EQ(r, 1) << error.message();
      EXPECT_EQ(Value(args.payload), Value(payload));
      EXPECT_EQ(args.reporterIDs, (std::vector<std::int64_t>{1, 2, 3}));
      continue;
    }
    EXPECT_EQ(r, -ENOBUFS) << c.refusal;
    EXPECT_STREQ(error.name(), kLimitsExceeded);
    EXPECT_STREQ(error.message(), c.refusal);
  }
}

TEST_F(ValueCodecTest, WritingRefusesWhatDBusCannotCarry) {
  for (const Value& v : {Value("bad \xff utf-8"), Value(Dictionary{{"k", Value("\xc3")}}), Value()})
    EXPECT_LT(appendVariant(newMessage().get(), v), 0) << v.text();
  EXPECT_LT(appendStringDictionary(newMessage().get(), Dictionary{{Value(1), Value(2)}}), 0);
  Value deep("x");
  for (int i = 0; i < 40; ++i) deep = Value(Array{deep});
  EXPECT_LT(appendVariant(newMessage().get(), deep), 0);
}

}  // namespace
}  // namespace vireo::dbus
