// Random calls from several connections against the daemon (the sanitizer build in
// CI) while a checker client sends acknowledged messages: every call is answered,
// the daemon stays up, and every acknowledged message reaches the store.
// VIREO_BUS_FUZZ_SECONDS sets the length (default 30), VIREO_BUS_FUZZ_SEED the seed.
#include <systemd/sd-bus.h>

#include <atomic>
#include <map>
#include <cstdlib>
#include <random>
#include <thread>

#include "platform/dbus/value_codec.h"
#include "service_fixture.h"

namespace vireo::itest {
namespace {

constexpr const char* kReporting = "com.orvane.vireo.Reporting1";
constexpr const char* kPath = "/com/orvane/vireo/Reporting1";
constexpr std::int64_t kCheckerID = 777;

double envNumber(const char* name, double fallback) {
  const char* v = std::getenv(name);
  return v && *v ? std::atof(v) : fallback;
}

// One fuzzing connection with its calls in flight.
struct FuzzConnection {
  sd_bus* bus = nullptr;
  int inFlight = 0;
  ~FuzzConnection() {
    if (bus) sd_bus_flush_close_unref(bus);
  }
};

struct Tally {
  std::uint64_t sent = 0, answered = 0, timedOut = 0;
  std::map<std::string, int> timedOutBy;  // method -> count
};

struct CallContext {
  FuzzConnection* connection;
  Tally* tally;
  std::string method;
};

class BusFuzzTest : public ServiceTest {
 protected:
  std::mt19937_64 rng{static_cast<std::uint64_t>(envNumber("VIREO_BUS_FUZZ_SEED", 1))};
  std::uint64_t pick(std::uint64_t n) { return std::uniform_int_distribution<std::uint64_t>(0, n - 1)(rng); }

  // Small random trees; one payload in twenty also carries one big thing: a 1 MiB
  // string, a 100,000-element array or 10,000 keys (past the default limits, to be
  // refused), or a tree 20 deep (past the nesting limit).
  Value randomValue(int depth) {
    switch (pick(depth > 3 ? 6 : 8)) {
      case 0: return Value(static_cast<long long>(rng()));
      case 1: return Value(std::uniform_real_distribution<double>(-1e9, 1e9)(rng));
      case 2: return Value(pick(2) == 0);
      case 3: return Value(std::string(pick(16), static_cast<char>('a' + pick(26))));
      case 4: return Value(std::nan(""));
      case 5: return Value(Data(pick(64), 7));
      case 6: {
        Array a;
        for (std::uint64_t i = pick(8); i > 0; --i) a.push_back(randomValue(depth + 1));
        return Value(std::move(a));
      }
      default: return Value(randomPayload(depth + 1));
    }
  }
  Value bigValue() {
    switch (pick(4)) {
      case 0: return Value(std::string(1 << 20, 'x'));
      case 1: return Value(Array(100000, Value(1)));
      case 2: {
        Dictionary wide;
        for (int i = 0; i < 10000; ++i) wide.set(Value("w" + std::to_string(i)), Value(i));
        return Value(std::move(wide));
      }
      default: {
        Value deep(1);
        for (int i = 0; i < 20; ++i) deep = Value(Array{deep});
        return deep;
      }
    }
  }
  Dictionary randomPayload(int depth = 0) {
    Dictionary d;
    for (std::uint64_t i = pick(6); i > 0; --i) d.set(Value("k" + std::to_string(pick(40))), randomValue(depth));
    if (depth == 0 && pick(20) == 0) d.set(Value("big"), bigValue());
    return d;
  }

  // Appends arguments for method; now and then the wrong ones.
  int fill(sd_bus_message* m, const std::string& method) {
    std::int64_t id = static_cast<std::int64_t>(pick(12));
    if (pick(25) == 0) return sd_bus_message_append(m, "sd", "wrong", 1.5);
    if (method == "SetServiceType") return sd_bus_message_append(m, "qx", static_cast<std::uint16_t>(pick(14)), id);
    if (method == "SetConfiguration") {
      int r = dbus::appendStringDictionary(m, randomPayload());
      return r < 0 ? r : sd_bus_message_append(m, "x", id);
    }
    if (method == "SendMessage") {
      int r = dbus::appendStringDictionary(m, randomPayload());
      if (r < 0) return r;
      const bool addressed = pick(2) == 0;
      std::vector<std::int64_t> ids(pick(pick(30) == 0 ? 200 : 4));
      for (auto& i : ids) i = pick(3) == 0 ? kCheckerID : static_cast<std::int64_t>(pick(12));
      if ((r = sd_bus_message_append(m, "uqb", static_cast<std::uint32_t>(rng()), static_cast<std::uint16_t>(pick(7)),
                                     addressed)) < 0)
        return r;
      return sd_bus_message_append_array(m, 'x', ids.data(), ids.size() * sizeof(std::int64_t));
    }
    if (method == "GetAllReporters" || method == "GetStatus") return 0;
    if (method == "SetInterfaceOrientation") return sd_bus_message_append(m, "s", pick(2) ? "left-up" : "sideways");
    return sd_bus_message_append(m, "x", id);
  }

  static int onReply(sd_bus_message* reply, void* userdata, sd_bus_error*) {
    auto* ctx = static_cast<CallContext*>(userdata);
    --ctx->connection->inFlight;
    if (sd_bus_message_is_method_error(reply, "org.freedesktop.DBus.Error.Timeout") ||
        sd_bus_message_is_method_error(reply, "org.freedesktop.DBus.Error.NoReply")) {
      ++ctx->tally->timedOut;
      ++ctx->tally->timedOutBy[ctx->method];
    } else {
      ++ctx->tally->answered;
    }
    return 0;
  }

  void sendRandomCall(FuzzConnection& c, Tally& tally) {
    static const std::vector<std::pair<const char*, const char*>> kMethods = {
        {kReporting, "CreateReportingSession"}, {kReporting, "SetServiceType"},
        {kReporting, "GetServiceNameForReporterID"}, {kReporting, "SetConfiguration"},
        {kReporting, "StartReportingSessionForID"}, {kReporting, "SendMessage"},
        {kReporting, "StopReportingSessionForID"}, {kReporting, "DestroyReportingSession"},
        {kReporting, "ReporterIDValid"}, {kReporting, "GetAllReporters"}, {kReporting, "NoSuchMethod"},
        {"com.orvane.vireo.Debug1", "GetStatus"}, {"com.orvane.vireo.Orientation1", "SetInterfaceOrientation"}};
    const auto& [interface, method] = kMethods[pick(kMethods.size())];
    sd_bus_message* m = nullptr;
    if (sd_bus_message_new_method_call(c.bus, &m, kReporting, kPath, interface, method) < 0) return;
    if (fill(m, method) < 0) {
      sd_bus_message_unref(m);
      return;
    }
    // A start is answered only when its session stops: ask for no answer.
    if (std::string(method) == "StartReportingSessionForID") {
      sd_bus_message_set_expect_reply(m, 0);
      sd_bus_send(c.bus, m, nullptr);
    } else {
      auto* ctx = new CallContext{&c, &tally, method};
      sd_bus_slot* slot = nullptr;
      if (sd_bus_call_async(c.bus, &slot, m, onReply, ctx, 25'000'000) < 0) {
        delete ctx;
      } else {
        // The context goes with the slot, answered or not (a closed connection drops it).
        sd_bus_slot_set_destroy_callback(slot, [](void* p) { delete static_cast<CallContext*>(p); });
        sd_bus_slot_set_floating(slot, 1);
        sd_bus_slot_unref(slot);
        ++c.inFlight;
        ++tally.sent;
      }
    }
    sd_bus_message_unref(m);
  }

  bool open(FuzzConnection& c) {
    if (sd_bus_new(&c.bus) < 0) return false;
    sd_bus_set_address(c.bus, busAddress_.c_str());
    sd_bus_set_bus_client(c.bus, 1);
    return sd_bus_start(c.bus) >= 0;
  }
};

TEST_F(BusFuzzTest, RandomCallsAreAllAnsweredAndAcknowledgedMessagesAllStored) {
  const auto duration = std::chrono::duration<double>(envNumber("VIREO_BUS_FUZZ_SECONDS", 30));
  auto checker = connect();
  ASSERT_TRUE(checker);
  ASSERT_EQ(*checker->createReportingSession(kCheckerID), true);
  auto checkerStart = checker->startReportingSessionForID(kCheckerID);
  std::atomic<bool> stop{false};
  std::atomic<std::int64_t> acknowledged{0};
  std::thread checking([&] {
    for (std::int64_t n = 0; !stop; ++n) {
      if (checker->sendMessage(Dictionary{{"checker", n}}, 0x40000003, 2, std::vector<std::int64_t>{kCheckerID}))
        ++acknowledged;
      std::this_thread::sleep_for(5ms);
    }
  });

  Tally tally;
  std::vector<std::unique_ptr<FuzzConnection>> connections;
  const auto until = std::chrono::steady_clock::now() + duration;
  while (std::chrono::steady_clock::now() < until && daemon_.running()) {
    while (connections.size() < 4) {
      connections.push_back(std::make_unique<FuzzConnection>());
      ASSERT_TRUE(open(*connections.back()));
    }
    for (auto& c : connections) {
      while (c->inFlight < 16) sendRandomCall(*c, tally);
      while (sd_bus_process(c->bus, nullptr) > 0) {
      }
    }
    sd_bus_wait(connections[pick(connections.size())]->bus, 2000);
    // Now and then a connection goes away with calls in flight.
    if (pick(200) == 0) connections.erase(connections.begin() + static_cast<long>(pick(connections.size())));
  }
  // Let the calls still in flight be answered.
  for (auto& c : connections)
    for (auto end = std::chrono::steady_clock::now() + 15s; c->inFlight > 0 && std::chrono::steady_clock::now() < end;)
      if (sd_bus_process(c->bus, nullptr) == 0) sd_bus_wait(c->bus, 100'000);
  stop = true;
  checking.join();

  std::printf("bus fuzz: %llu calls answered of %llu, %lld checker messages acknowledged\n",
              static_cast<unsigned long long>(tally.answered), static_cast<unsigned long long>(tally.sent),
              static_cast<long long>(acknowledged.load()));
  EXPECT_TRUE(daemon_.running());
  EXPECT_GT(tally.sent, 100u);
  EXPECT_EQ(tally.timedOut, 0u) << tally.answered << " of " << tally.sent << " answered; unanswered: "
                                << ::testing::PrintToString(tally.timedOutBy);
  for (auto& c : connections) EXPECT_EQ(c->inFlight, 0);
  auto stopped = checker->stopReportingSessionForID(kCheckerID);
  ASSERT_TRUE(stopped) << stopped.error().message;
  EXPECT_TRUE(checkerStart.waitFor(10s));
  const std::string query =
      "SELECT COUNT(*) FROM telemetry_messages WHERE type = 2 AND json_extract(payload, '$.checker') IS NOT NULL";
  eventually([&] { return count(query) >= acknowledged.load(); }, 20s);
  EXPECT_EQ(count(query), acknowledged.load());
}

}  // namespace
}  // namespace vireo::itest
