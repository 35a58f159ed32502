// The service protocol as a client sees it on the bus: replies, sessions shared
// between clients, clients that die, input that must be refused.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>

#include "platform/dbus/bus.h"
#include "service_fixture.h"

namespace vireo::itest {
namespace {

using client::Client;

bool contains(const std::vector<std::int64_t>& ids, std::int64_t id) {
  return std::find(ids.begin(), ids.end(), id) != ids.end();
}

class ProtocolTest : public ServiceTest {};

TEST_F(ProtocolTest, ReplyTableIncludingIDZeroAndHeldStarts) {
  auto c = connect();
  ASSERT_TRUE(c);
  EXPECT_EQ(*c->createReportingSession(42), true);
  EXPECT_EQ(*c->setServiceType(2, 42), true);
  EXPECT_EQ(*c->getServiceNameForReporterID(42), 2);
  EXPECT_EQ(*c->setConfiguration(Dictionary{{"HostApplicationDisplayID", Value("Player")}, {"n", Value(1)}}, 42),
            true);
  auto valid = c->reporterIDValid(42);
  ASSERT_TRUE(valid);
  EXPECT_EQ(valid->reporterID, 42);
  EXPECT_EQ(valid->serviceType, 2);
  EXPECT_TRUE(contains(*c->getAllReporters(), 42));

  // Unknown IDs (0 among them) still answer true, or the default answers. The
  // service answers the name lookup of ID 0 twice; only the first answer reaches
  // the client and the next call gets its own answer.
  for (std::int64_t id : {99, 0}) {
    EXPECT_EQ(*c->getServiceNameForReporterID(id), 65535);
    EXPECT_EQ(*c->getServiceNameForReporterID(42), 2);
    EXPECT_EQ(*c->setServiceType(3, id), true);
    EXPECT_EQ(*c->setConfiguration(Dictionary{{"k", Value(1)}}, id), true);
    EXPECT_EQ(*c->stopReportingSessionForID(id), true);
    EXPECT_EQ(*c->destroyReportingSession(id), true);
    valid = c->reporterIDValid(id);
    EXPECT_EQ(valid->reporterID, 0);
    EXPECT_EQ(valid->serviceType, 65535);
  }
  // Start of ID 0 answers at once; create takes ID 0 like any other.
  EXPECT_TRUE(answeredTrue(c->startReportingSessionForID(0)));
  EXPECT_EQ(*c->createReportingSession(0), true);
  EXPECT_TRUE(contains(*c->getAllReporters(), 0));

  // A start is answered only when its session stops.
  ASSERT_EQ(*c->createReportingSession(7), true);
  auto first = c->startReportingSessionForID(7);
  auto again = c->startReportingSessionForID(7);    // already started: never answered
  auto unknown = c->startReportingSessionForID(8);  // no such session: never answered
  ASSERT_TRUE(c->getAllReporters());
  EXPECT_FALSE(first.waitFor(300ms));
  EXPECT_EQ(*c->stopReportingSessionForID(7), true);
  EXPECT_TRUE(answeredTrue(first));
  EXPECT_FALSE(again.waitFor(200ms));
  EXPECT_FALSE(unknown.waitFor(10ms));
  // Started again, the session keeps the new answer until the next stop.
  auto second = c->startReportingSessionForID(7);
  ASSERT_TRUE(c->getAllReporters());
  EXPECT_FALSE(second.waitFor(200ms));
  EXPECT_EQ(*c->destroyReportingSession(7), true);  // destroy stops a started session
  EXPECT_TRUE(answeredTrue(second));
  EXPECT_EQ(*c->destroyReportingSession(42), true);
  EXPECT_FALSE(contains(*c->getAllReporters(), 42));
  EXPECT_EQ(*c->getServiceNameForReporterID(42), 65535);

  // A held start whose session is replaced by a new create is told so.
  ASSERT_EQ(*c->createReportingSession(11), true);
  auto replacedStart = c->startReportingSessionForID(11);
  ASSERT_EQ(*c->createReportingSession(11), true);
  auto answer = replacedStart.waitFor(5s);
  ASSERT_TRUE(answer);
  ASSERT_FALSE(answer->ok());
  EXPECT_EQ(answer->error().name, "com.orvane.vireo.Error.SessionEnded");

  // A start still waiting when its client goes away ends with an error, not a hang.
  ASSERT_EQ(*c->createReportingSession(9), true);
  auto orphan = c->startReportingSessionForID(9);
  ASSERT_TRUE(c->getAllReporters());
  c.reset();
  answer = orphan.waitFor(2s);
  ASSERT_TRUE(answer);
  EXPECT_FALSE(answer->ok());
}

TEST_F(ProtocolTest, ClientsShareLookupsAndAKilledClientIsRemoved) {
  auto a = connect();
  auto b = connect();
  ASSERT_TRUE(a && b);
  ASSERT_EQ(*a->createReportingSession(10), true);
  ASSERT_EQ(*a->setServiceType(3, 10), true);
  ASSERT_EQ(*b->createReportingSession(20), true);
  auto valid = b->reporterIDValid(10);
  EXPECT_EQ(valid->reporterID, 10);
  EXPECT_EQ(valid->serviceType, 3);
  EXPECT_EQ(*b->getServiceNameForReporterID(10), 3);
  auto all = *a->getAllReporters();
  EXPECT_TRUE(contains(all, 10) && contains(all, 20));
  EXPECT_EQ(*b->getAllReporters(), all);

  // B starts A's session; B's stop and destroy do not reach it (own map only), A's stop does.
  auto start = b->startReportingSessionForID(10);
  EXPECT_EQ(*b->stopReportingSessionForID(10), true);
  EXPECT_EQ(*b->destroyReportingSession(10), true);
  EXPECT_FALSE(start.waitFor(300ms));
  // Setting the type from B changes nothing either.
  EXPECT_EQ(*b->setServiceType(9, 10), true);
  EXPECT_EQ(*a->getServiceNameForReporterID(10), 3);
  EXPECT_EQ(*a->stopReportingSessionForID(10), true);
  EXPECT_TRUE(answeredTrue(start));

  // A client killed with a started session is removed, its session stopped (so its
  // summary goes out), and the service goes on.
  int sync[2];
  ASSERT_EQ(pipe(sync), 0);
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    ::close(sync[0]);
    auto c = Client::connectAddress(busAddress_);
    if (!c) _exit(1);
    (*c)->createReportingSession(77);
    auto pending = (*c)->startReportingSessionForID(77);
    (*c)->sendMessage(Dictionary{{"k", 1}}, 0x40000003, 1, std::vector<std::int64_t>{77});
    if (::write(sync[1], "x", 1) != 1) _exit(1);
    for (;;) pause();
  }
  ::close(sync[1]);
  char x;
  ASSERT_EQ(::read(sync[0], &x, 1), 1);
  ::close(sync[0]);
  EXPECT_TRUE(contains(*a->getAllReporters(), 77));
  ::kill(child, SIGKILL);
  int status = 0;
  waitpid(child, &status, 0);
  EXPECT_TRUE(waitForLog("removing " + std::to_string(child) + " from the server client list"));
  EXPECT_TRUE(eventually([&] { return !contains(*a->getAllReporters(), 77); }));
  EXPECT_TRUE(eventually([&] {
    return count("SELECT COUNT(*) FROM telemetry_messages m JOIN telemetry_sessions s ON m.session = s.id "
                 "WHERE m.type = 65535 AND json_extract(s.session_info, '$.session_id') = 77") == 1;
  }, 15s));
  EXPECT_EQ(*a->createReportingSession(78), true);
  EXPECT_TRUE(contains(*b->getAllReporters(), 78));
}

Dictionary nestedPayload(int containers) {
  // The payload itself is the first container.
  Value v("leaf");
  for (int i = 0; i < containers; ++i) v = Value(Dictionary{{"n", v}});
  return *v.asDictionary();
}

TEST_F(ProtocolTest, BadInputIsRefusedUntilKillService) {
  // Raw calls for input the client library would not send.
  dbus::BusRef raw;
  ASSERT_GE(sd_bus_new(raw.out()), 0);
  sd_bus_set_address(raw.get(), busAddress_.c_str());
  sd_bus_set_bus_client(raw.get(), 1);
  sd_bus_negotiate_fds(raw.get(), 1);
  ASSERT_GE(sd_bus_start(raw.get()), 0);
  auto call = [&](const char* method, auto&& append) {
    dbus::MessageRef m, reply;
    sd_bus_message_new_method_call(raw.get(), m.out(), client::kServiceName, client::kObjectPath, client::kInterface,
                                   method);
    append(m.get());
    dbus::BusError e;
    sd_bus_call(raw.get(), m.get(), 10'000'000, e.get(), reply.out());
    return std::string(e.name());
  };
  constexpr const char* kInvalidArgs = "org.freedesktop.DBus.Error.InvalidArgs";
  EXPECT_EQ(call("CreateReportingSession", [](sd_bus_message* m) { sd_bus_message_append(m, "s", "not a number"); }),
            kInvalidArgs);
  EXPECT_EQ(call("NoSuchMethod", [](sd_bus_message*) {}), "org.freedesktop.DBus.Error.UnknownMethod");
  // A file descriptor never reaches the daemon: it does not take any, so the bus refuses the call.
  EXPECT_EQ(call("SendMessage",
                 [](sd_bus_message* m) {
                   sd_bus_message_append(m, "a{sv}uqbax", 1, "fd", "h", STDERR_FILENO, 3u, 1, 0, 0);
                 }),
            "org.freedesktop.DBus.Error.NotSupported");

  auto c = connect();
  ASSERT_TRUE(c);
  auto deep = c->sendMessage(nestedPayload(17), 3, 1, std::vector<std::int64_t>{});
  ASSERT_FALSE(deep);
  EXPECT_EQ(deep.error().name, kInvalidArgs);
  EXPECT_FALSE(deep.error().message.empty());
  EXPECT_TRUE(c->sendMessage(nestedPayload(16), 3, 1, std::vector<std::int64_t>{}));
  EXPECT_EQ(*c->setConfiguration(nestedPayload(16), 1), true);
  EXPECT_FALSE(c->setConfiguration(nestedPayload(17), 1));

  EXPECT_EQ(*c->createReportingSession(1), true);
  EXPECT_TRUE(contains(*c->getAllReporters(), 1));
  EXPECT_TRUE(daemon_.running());

  // KillService ends the process with status 2.
  ASSERT_TRUE(c->killService());
  EXPECT_EQ(daemon_.waitExit(10s), 2);
  EXPECT_NE(log().find("DESTROYING SERVICE"), std::string::npos);
}

}  // namespace
}  // namespace vireo::itest
