// Reads D-Bus messages the way the daemon reads a client's call: any value, a
// configuration dictionary, or SendMessage's arguments. sd-bus only hands over messages
// that passed its own validation, so the input drives a generator (signatures nested past
// the limits, variants in variants, every basic type, file descriptors) instead of being
// taken as wire bytes. Whatever is read must write back (appendVariant, the daemon's way
// of answering) and read again to the same value, and convert to JSON as the store does;
// a refusal must name an error.
#include <fcntl.h>
#include <fuzzer/FuzzedDataProvider.h>
#include <sys/socket.h>
#include <unistd.h>

#include <bit>
#include <cstdint>
#include <string>
#include <string_view>

#include "fuzz_support.h"
#include "platform/dbus/bus.h"
#include "platform/dbus/send_message_arguments.h"
#include "platform/dbus/value_codec.h"

namespace vireo::fuzz {
namespace {

using dbus::BusError;
using dbus::BusRef;
using dbus::MessageRef;

// Deeper than the codec accepts (16 containers, 64 variants), within what sd-bus builds.
constexpr int kMaxTypeDepth = 20;
constexpr int kMaxVariantChain = 70;
constexpr std::size_t kMaxSignature = 250;

// sd-bus builds messages only on a started bus; one end of a socket pair is enough,
// and nothing is ever sent on it.
sd_bus* messageFactory() {
  static sd_bus* bus = [] {
    int fds[2];
    sd_bus* b = nullptr;
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0 || sd_bus_new(&b) < 0 ||
        sd_bus_set_fd(b, fds[0], fds[0]) < 0 || sd_bus_start(b) < 0)
      fail("cannot set up a bus to build messages on", __FILE__, __LINE__);
    return b;
  }();
  return bus;
}

constexpr std::string_view kBasic = "ybnqiuxtdsogh";

// Length of the single complete type at the start of s.
std::size_t completeTypeLength(std::string_view s) {
  if (s.empty()) return 0;
  if (s[0] == 'a') return 1 + completeTypeLength(s.substr(1));
  if (s[0] == '(' || s[0] == '{') {
    const char close = s[0] == '(' ? ')' : '}';
    std::size_t i = 1;
    while (i < s.size() && s[i] != close) i += completeTypeLength(s.substr(i));
    return i + 1;
  }
  return 1;
}

class Generator {
 public:
  Generator(FuzzedDataProvider& in) : in_(in) {}

  char basicType() { return kBasic[in_.ConsumeIntegralInRange<std::size_t>(0, kBasic.size() - 1)]; }

  // A random complete type, kept short enough for a D-Bus signature.
  std::string type(int depth, std::size_t budget) {
    switch (in_.ConsumeIntegralInRange<int>(0, depth >= kMaxTypeDepth || budget < 8 ? 0 : 5)) {
      case 0:
      case 1: return std::string(1, basicType());
      case 2: return "v";
      case 3: return "a" + type(depth + 1, budget - 1);
      case 4: {
        std::string key(1, basicType());
        return "a{" + key + type(depth + 1, budget - 4) + "}";
      }
      default: {
        std::string fields;
        const int count = in_.ConsumeIntegralInRange<int>(1, 4);
        for (int i = 0; i < count && fields.size() + 2 < budget; ++i)
          fields += type(depth + 1, budget - 2 - fields.size());
        return "(" + fields + ")";
      }
    }
  }

  // Appends one value of the complete type t. False when sd-bus refused something the
  // generator cannot repair; the input is then skipped.
  bool value(sd_bus_message* m, std::string_view t) {
    const char c = t[0];
    if (kBasic.find(c) != std::string_view::npos) return basic(m, c);
    if (c == 'v') {
      ++variants_;
      std::string inner = variants_ >= kMaxVariantChain ? std::string(1, basicType())
                          : in_.ConsumeBool()           ? std::string("v")
                                                        : type(0, 64);
      int r = sd_bus_message_open_container(m, 'v', inner.c_str());
      bool ok = r >= 0 && value(m, inner) && sd_bus_message_close_container(m) >= 0;
      --variants_;
      return ok;
    }
    if (c == '(') {
      std::string contents(t.substr(1, t.size() - 2));
      return sd_bus_message_open_container(m, 'r', contents.c_str()) >= 0 && values(m, contents) &&
             sd_bus_message_close_container(m) >= 0;
    }
    // Arrays and dictionaries.
    std::string element(t.substr(1));
    if (element == "y" && in_.ConsumeBool()) {
      std::string bytes = in_.ConsumeRandomLengthString(64);
      return sd_bus_message_append_array(m, 'y', bytes.data(), bytes.size()) >= 0;
    }
    if (sd_bus_message_open_container(m, 'a', element.c_str()) < 0) return false;
    const int count = in_.ConsumeIntegralInRange<int>(0, 4);
    for (int i = 0; i < count; ++i) {
      if (element[0] == '{') {
        std::string entry = element.substr(1, element.size() - 2);
        if (sd_bus_message_open_container(m, 'e', entry.c_str()) < 0) return false;
        if (!basic(m, entry[0]) || !value(m, std::string_view(entry).substr(1))) return false;
        if (sd_bus_message_close_container(m) < 0) return false;
      } else if (!value(m, element)) {
        return false;
      }
    }
    return sd_bus_message_close_container(m) >= 0;
  }

  // Appends every complete type of a signature in turn.
  bool values(sd_bus_message* m, std::string_view signature) {
    while (!signature.empty()) {
      std::size_t n = completeTypeLength(signature);
      if (!value(m, signature.substr(0, n))) return false;
      signature.remove_prefix(n);
    }
    return true;
  }

 private:
  template <typename T>
  static bool append(sd_bus_message* m, char c, T v) { return sd_bus_message_append_basic(m, c, &v) >= 0; }

  bool basic(sd_bus_message* m, char c) {
    switch (c) {
      case 'y': return append(m, c, in_.ConsumeIntegral<std::uint8_t>());
      case 'b': return append(m, c, int{in_.ConsumeBool()});
      case 'n': return append(m, c, in_.ConsumeIntegral<std::int16_t>());
      case 'q': return append(m, c, in_.ConsumeIntegral<std::uint16_t>());
      case 'i': return append(m, c, in_.ConsumeIntegral<std::int32_t>());
      case 'u': return append(m, c, in_.ConsumeIntegral<std::uint32_t>());
      case 'x': return append(m, c, in_.ConsumeIntegral<std::int64_t>());
      case 't': return append(m, c, in_.ConsumeIntegral<std::uint64_t>());
      // Raw bits, so NaNs, infinities and subnormals all occur.
      case 'd': return append(m, c, std::bit_cast<double>(in_.ConsumeIntegral<std::uint64_t>()));
      case 'h': {
        static const int devNull = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
        return append(m, c, devNull);
      }
      default: {
        // s o g: sd-bus refuses bad UTF-8, object paths and signatures without
        // touching the message, so a refused text is replaced by a valid one.
        std::string text = in_.ConsumeRandomLengthString(24);
        if (sd_bus_message_append_basic(m, c, text.c_str()) >= 0) return true;
        return sd_bus_message_append_basic(m, c, c == 'o' ? "/a/b" : c == 'g' ? "a{sv}" : "text") >= 0;
      }
    }
  }

  FuzzedDataProvider& in_;
  int variants_ = 0;
};

// Equality that takes every NaN as equal to itself: a dictionary's key identity.
bool same(const Value& a, const Value& b) {
  Dictionary d;
  d.set(a, 0);
  d.set(b, 1);
  return d.size() == 1;
}

MessageRef newMessage() {
  MessageRef m;
  if (sd_bus_message_new_method_call(messageFactory(), m.out(), "com.example.Fuzz", "/", "com.example.Fuzz", "Call") <
      0)
    fail("sd_bus_message_new_method_call", __FILE__, __LINE__);
  return m;
}

bool seal(sd_bus_message* m) { return sd_bus_message_seal(m, 1, 0) >= 0 && sd_bus_message_rewind(m, true) >= 0; }

// A value the codec read: it must survive the way back, and JSON (lenient) never refuses.
void checkReadValue(const Value& v) {
  if (tracing()) std::fprintf(stderr, "read: %s\n", v.text().c_str());
  MessageRef m = newMessage();
  FUZZ_CHECK(dbus::appendVariant(m.get(), v) >= 0);
  FUZZ_CHECK(seal(m.get()));
  Value back;
  BusError error;
  FUZZ_CHECK(dbus::readValue(m.get(), &back, error.get()) == 1);
  FUZZ_CHECK(same(back, v));
  FUZZ_CHECK(toJson(v, JsonMode::Lenient).has_value());
  (void)toJson(v, JsonMode::Strict);
  (void)v.text();
}

// A refusal must name an error for the client.
void checkRefusal(int r, BusError& error) {
  if (tracing()) std::fprintf(stderr, "refused: %s\n", error.message());
  FUZZ_CHECK(r < 0);
  FUZZ_CHECK(sd_bus_error_is_set(error.get()));
}

}  // namespace
}  // namespace vireo::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace vireo;
  using namespace vireo::fuzz;
  FuzzedDataProvider in(data, size);
  Generator generate(in);

  // What the daemon would be reading: 0 a run of values, 1 a method taking a
  // dictionary (SetConfiguration), 2 SendMessage.
  const int mode = in.ConsumeIntegralInRange<int>(0, 2);
  std::string signature;
  switch (mode) {
    case 0:
      for (int n = in.ConsumeIntegralInRange<int>(1, 4); n > 0 && signature.size() < kMaxSignature / 2; --n)
        signature += generate.type(0, kMaxSignature / 2);
      break;
    case 1:
      signature = in.ConsumeBool() ? "a{s" + generate.type(1, 100) + "}x" : generate.type(0, 100) + "x";
      break;
    default:
      signature = "a{" + std::string(1, in.ConsumeBool() ? 's' : generate.basicType()) + "v}" +
                  (in.ConsumeBool() ? std::string("uqbax") : generate.type(0, 100) + generate.type(0, 100));
      break;
  }
  if (signature.size() > kMaxSignature) return 0;

  MessageRef m = newMessage();
  const bool built = generate.values(m.get(), signature) && seal(m.get());
  if (tracing()) std::fprintf(stderr, "mode %d signature %s built %d\n", mode, signature.c_str(), built);
  if (!built) return 0;

  BusError error;
  switch (mode) {
    case 0: {
      int r = 0;
      for (Value v; (r = dbus::readValue(m.get(), &v, error.get())) > 0; v = Value()) checkReadValue(v);
      if (r < 0) checkRefusal(r, error);
      break;
    }
    case 1: {
      Dictionary configuration;
      if (int r = dbus::readDictionary(m.get(), &configuration, error.get()); r < 0) checkRefusal(r, error);
      else checkReadValue(Value(configuration));
      break;
    }
    default: {
      dbus::SendMessageArguments arguments;
      int r = dbus::readSendMessageArguments(m.get(), &arguments, error.get());
      if (r < 0) break;  // sd_bus_message_read's own failures leave error unset
      if (tracing())
        std::fprintf(stderr, "category %u type %u addressed to %zu\n", arguments.category, arguments.type,
                     arguments.reporterIDs ? arguments.reporterIDs->size() : std::size_t{0});
      checkReadValue(Value(arguments.payload));
      break;
    }
  }
  return 0;
}
