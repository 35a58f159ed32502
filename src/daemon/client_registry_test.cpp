#include "daemon/client_registry.h"

#include <gtest/gtest.h>

#include <algorithm>

#include <string>
#include <vector>

#include "daemon/bus_choice.h"
#include "daemon/bus_mailbox.h"
#include "daemon/notification_center.h"
#include "dispatch/dispatch.h"

namespace vireo::daemon {
namespace {

// Records what the registry does, in one log, so that the order can be checked.
struct Recorder : ListenerDelegate {
  std::vector<std::string> log;
  std::vector<std::string> lookups;
  bool accept = true;

  bool shouldAcceptNewConnection(ClientConnection& connection) override {
    log.push_back("accept " + connection.description());
    auto& peer = static_cast<PeerConnection&>(connection);
    std::string name = peer.name();
    connection.setInvalidationHandler([this, name] { log.push_back("invalidated " + name); });
    connection.resume();
    return accept;
  }
  ClientRegistry::Call call(std::string what) {
    return [this, what](PeerConnection* c) { log.push_back(what + (c ? " on " + c->name() : " refused")); };
  }
};

class ClientRegistryTest : public ::testing::Test {
 protected:
  Recorder rec;
  ClientRegistry registry{rec, [this](const std::string& name) { rec.lookups.push_back(name); }};
};

TEST_F(ClientRegistryTest, HoldsCallsUntilCredentialsThenRunsThemInOrder) {
  registry.call(":1.5", rec.call("a"));
  registry.call(":1.5", rec.call("b"));
  registry.call(":1.6", rec.call("other"));
  EXPECT_EQ(rec.lookups, (std::vector<std::string>{":1.5", ":1.6"}));  // once per name
  EXPECT_TRUE(rec.log.empty());

  registry.credentialsArrived(":1.5", 42);
  registry.call(":1.5", rec.call("c"));  // known now: runs at once
  EXPECT_EQ(rec.log, (std::vector<std::string>{"accept connection :1.5 (pid 42)", "a on :1.5", "b on :1.5",
                                               "c on :1.5"}));
  EXPECT_EQ(rec.lookups.size(), 2u);
}

TEST_F(ClientRegistryTest, InvalidatesOnceWhenTheNameVanishes) {
  registry.call(":1.5", rec.call("a"));
  registry.credentialsArrived(":1.5", 42);
  registry.nameVanished(":1.5");
  registry.nameVanished(":1.5");
  registry.nameVanished(":1.99");  // never called: nothing to do
  EXPECT_EQ(rec.log.back(), "invalidated :1.5");
  EXPECT_EQ(std::count(rec.log.begin(), rec.log.end(), "invalidated :1.5"), 1);
  EXPECT_EQ(registry.size(), 0u);
}

TEST_F(ClientRegistryTest, VanishingBeforeCredentialsRunsHeldCallsThenInvalidates) {
  registry.call(":1.7", rec.call("a"));
  registry.nameVanished(":1.7");
  EXPECT_TRUE(rec.log.empty());
  registry.credentialsArrived(":1.7", -1);
  EXPECT_EQ(rec.log, (std::vector<std::string>{"accept connection :1.7 (pid -1)", "a on :1.7", "invalidated :1.7"}));
  EXPECT_EQ(registry.size(), 0u);
  registry.credentialsArrived(":1.7", 3);  // a late answer for a forgotten name
  EXPECT_EQ(rec.log.size(), 3u);
}

TEST_F(ClientRegistryTest, RefusedClientGetsNoConnectionAndNoInvalidation) {
  rec.accept = false;
  registry.call(":1.8", rec.call("a"));
  registry.credentialsArrived(":1.8", 9);
  registry.call(":1.8", rec.call("b"));
  registry.nameVanished(":1.8");
  EXPECT_EQ(rec.log, (std::vector<std::string>{"accept connection :1.8 (pid 9)", "a refused", "b refused"}));
}

TEST_F(ClientRegistryTest, LookupThatAnswersAtOnce) {
  // A lookup that cannot start answers inside call() itself.
  ClientRegistry* self = nullptr;
  ClientRegistry immediate(rec, [&](const std::string& name) { self->credentialsArrived(name, -1); });
  self = &immediate;
  immediate.call(":1.9", rec.call("a"));
  EXPECT_EQ(rec.log, (std::vector<std::string>{"accept connection :1.9 (pid -1)", "a on :1.9"}));
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

// Runs each task at once.
struct InlineQueue : SerialQueue {
  explicit InlineQueue(std::string l) : label_(std::move(l)) {}
  void async(Task task) override { task(); }
  const std::string& label() const override { return label_; }
  std::string label_;
};

// Delivery by name is checked through the bus (bus_service_test); here the refusals.
TEST(NotificationCenterTest, RefusesEmptyNamesAndMissingQueues) {
  NotificationCenter center;
  int token = 0;
  EXPECT_NE(center.registerDispatch("", std::make_shared<InlineQueue>("q"), [](int) {}, &token), 0);
  EXPECT_NE(center.registerDispatch("a", nullptr, [](int) {}, &token), 0);
}

TEST(BusMailboxTest, RunsInOrderAndInlineOnceClosed) {
  std::vector<int> ran;
  BusMailbox mailbox;
  ASSERT_GE(mailbox.fd(), 0);
  mailbox.post([&] { ran.push_back(1); });
  mailbox.post([&] { ran.push_back(2); });
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
