#include "daemon/client_registry.h"

#include <gtest/gtest.h>

#include <sstream>
#include <string>
#include <vector>

#include "daemon/bus_choice.h"
#include "daemon/bus_mailbox.h"

namespace vireo::daemon {
namespace {

using Lines = std::vector<std::string>;

// Records what the registry does, in one log, so that the order can be checked.
struct Recorder : ListenerDelegate {
  Lines log, lookups;
  bool accept = true;

  bool shouldAcceptNewConnection(ClientConnection& connection) override {
    log.push_back("accept " + connection.description());
    std::string name = static_cast<PeerConnection&>(connection).name();
    connection.setInvalidationHandler([this, name] { log.push_back("invalidated " + name); });
    connection.resume();
    return accept;
  }
  ClientRegistry::Call call(std::string what) {
    return [this, what](PeerConnection* c) { log.push_back(what + (c ? " on " + c->name() : " refused")); };
  }
};

// Each script step is "call NAME TAG", "creds NAME PID" or "gone NAME".
TEST(ClientRegistryTest, HeldCallsRunInOrderAfterCredentialsAndInvalidationComesOnce) {
  struct Case {
    bool accept, immediate;  // immediate: a lookup that cannot start answers inside call()
    Lines lookups, script, log;
  } cases[] = {
      {true, false, {":1.5", ":1.6"},  // one lookup per name
       {"call :1.5 a", "call :1.5 b", "call :1.6 other", "creds :1.5 42", "call :1.5 c"},
       {"accept connection :1.5 (pid 42)", "a on :1.5", "b on :1.5", "c on :1.5"}},
      {true, false, {":1.5"},
       {"call :1.5 a", "creds :1.5 42", "gone :1.5", "gone :1.5", "gone :1.99"},
       {"accept connection :1.5 (pid 42)", "a on :1.5", "invalidated :1.5"}},
      // Vanishing before the credentials: held calls still run, then the invalidation;
      // a late second answer for the forgotten name does nothing.
      {true, false, {":1.7"},
       {"call :1.7 a", "gone :1.7", "creds :1.7 -1", "creds :1.7 3"},
       {"accept connection :1.7 (pid -1)", "a on :1.7", "invalidated :1.7"}},
      // A refused client gets no connection and no invalidation.
      {false, false, {":1.8"},
       {"call :1.8 a", "creds :1.8 9", "call :1.8 b", "gone :1.8"},
       {"accept connection :1.8 (pid 9)", "a refused", "b refused"}},
      {true, true, {":1.9"}, {"call :1.9 a"}, {"accept connection :1.9 (pid -1)", "a on :1.9"}},
  };
  for (const auto& c : cases) {
    Recorder rec;
    rec.accept = c.accept;
    ClientRegistry* self = nullptr;
    ClientRegistry registry{rec, [&](const std::string& name) {
                              rec.lookups.push_back(name);
                              if (c.immediate) self->credentialsArrived(name, -1);
                            }};
    self = &registry;
    for (const auto& step : c.script) {
      std::istringstream in(step);
      std::string op, name, arg;
      in >> op >> name >> arg;
      if (op == "call") registry.call(name, rec.call(arg));
      if (op == "creds") registry.credentialsArrived(name, std::stoi(arg));
      if (op == "gone") registry.nameVanished(name);
    }
    EXPECT_EQ(rec.log, c.log) << c.script.front();
    EXPECT_EQ(rec.lookups, c.lookups) << c.script.front();
    if (c.log.back().starts_with("invalidated")) {
      EXPECT_EQ(registry.size(), 0u);
    }
  }
}

TEST(BusChoiceTest, OverrideThenStarterThenUser) {
  EXPECT_EQ(chooseBus("system", "session", false), BusKind::System);
  EXPECT_EQ(chooseBus("session", nullptr, true), BusKind::Session);
  EXPECT_EQ(chooseBus("bogus", "system", false), BusKind::System);
  EXPECT_EQ(chooseBus(nullptr, "session", true), BusKind::Session);
  EXPECT_EQ(chooseBus(nullptr, "starter", true), BusKind::System);
  EXPECT_EQ(chooseBus(nullptr, nullptr, true), BusKind::System);
  EXPECT_EQ(chooseBus(nullptr, nullptr, false), BusKind::Session);
}

TEST(BusMailboxTest, RunsInOrderAndInlineOnceClosed) {
  std::vector<int> ran;
  BusMailbox mailbox;
  ASSERT_GE(mailbox.fd(), 0);
  for (int i : {1, 2}) mailbox.post([&ran, i] { ran.push_back(i); });
  EXPECT_TRUE(ran.empty());
  mailbox.drain();
  EXPECT_EQ(ran, (std::vector<int>{1, 2}));
  mailbox.post([&] { ran.push_back(3); });
  mailbox.close();  // runs what waits
  mailbox.post([&] { ran.push_back(4); });
  EXPECT_EQ(ran, (std::vector<int>{1, 2, 3, 4}));
}

}  // namespace
}  // namespace vireo::daemon
