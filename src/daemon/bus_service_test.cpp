// What the end-to-end suite cannot see from a client: calls held for the
// credentials, invalidation, signal filtering, introspection, the owned name.
#include "daemon/bus_service.h"

#include <gtest/gtest.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <thread>

#include "dispatch/dispatch.h"
#include "fakes/fake_platform.h"
#include "service/reporting_protocol.h"

namespace vireo::daemon {
namespace {

using namespace std::chrono_literals;

// Polls until pred holds; the bound only keeps a broken test from hanging.
template <typename Pred>
bool eventually(Pred pred) {
  for (int i = 0; i < 2000 && !pred(); ++i) std::this_thread::sleep_for(5ms);
  return pred();
}

// The listener delegate and exported object: records creates, keeps starts
// unanswered, notes accepted and invalidated connections.
class Fake : public VRReportingServiceProtocol, public ListenerDelegate, public std::enable_shared_from_this<Fake> {
 public:
  bool shouldAcceptNewConnection(ClientConnection& connection) override {
    std::string description = connection.description();
    record(accepted, description);
    connection.setExportedObject(shared_from_this());
    connection.setInvalidationHandler([this, description] { record(invalidated, description); });
    connection.resume();
    return true;
  }
  void createReportingSession(std::int64_t id, BoolReply reply) override {
    record(calls, "create " + std::to_string(id));
    reply(true);
  }
  void startReportingSessionForID(std::int64_t, StartReply reply) override {
    std::lock_guard lock(mutex);
    kept.push_back(reply.answer);
  }
  void getServiceNameForReporterID(std::int64_t, ServiceTypeReply) override {}
  void getAllReporters(ReporterListReply) override {}
  void setServiceType(std::uint16_t, std::int64_t, BoolReply) override {}
  void setConfiguration(Dictionary, std::int64_t, BoolReply) override {}
  void sendMessage(Dictionary, std::uint32_t, std::uint16_t, std::optional<std::vector<std::int64_t>>,
                   ErrorReply) override {}
  void stopReportingSessionForID(std::int64_t, BoolReply) override {}
  void destroyReportingSession(std::int64_t, BoolReply) override {}
  void reporterIDValid(std::int64_t, DictionaryReply) override {}
  void killService(BoolReply) override {}

  void record(std::vector<std::string>& to, std::string what) {
    std::lock_guard lock(mutex);
    to.push_back(std::move(what));
  }
  std::vector<std::string> get(const std::vector<std::string>& from) {
    std::lock_guard lock(mutex);
    return from;
  }
  std::mutex mutex;  // guards every member below
  std::vector<std::string> calls, accepted, invalidated;
  std::vector<BoolReply> kept;
};

// A client of the private bus, which the suite made the session bus.
dbus::BusRef connectClient() {
  dbus::BusRef bus;
  EXPECT_GE(sd_bus_open_user(bus.out()), 0);
  return bus;
}

// A private dbus-daemon for the whole suite and a started service on it per test.
class BusServiceTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    blockServiceSignals();  // before any thread of the suite exists, as the daemon does
    int out[2];
    ASSERT_EQ(pipe(out), 0);
    if ((busPid_ = fork()) == 0) {
      sigset_t none;
      sigemptyset(&none);
      sigprocmask(SIG_SETMASK, &none, nullptr);
      prctl(PR_SET_PDEATHSIG, SIGTERM);  // ends with the test, however the test ends
      dup2(out[1], STDOUT_FILENO);
      dup2(open("/dev/null", O_WRONLY), STDERR_FILENO);
      execlp("dbus-daemon", "dbus-daemon", "--session", "--nofork", "--print-address", "--address=unix:tmpdir=/tmp",
             static_cast<char*>(nullptr));
      _exit(127);
    }
    close(out[1]);
    address_.clear();  // a repeated suite starts a new bus
    for (char c; read(out[0], &c, 1) == 1 && c != '\n';) address_ += c;
    close(out[0]);
    setenv("DBUS_SESSION_BUS_ADDRESS", address_.c_str(), 1);
  }
  static void TearDownTestSuite() {
    kill(busPid_, SIGTERM);
    waitpid(busPid_, nullptr, 0);
  }
  void SetUp() override {
    BusService::Options options;
    options.address = address_;
    ASSERT_EQ(service_.open(options), 0);
    service_.start();
    client_ = connectClient();
  }
  void TearDown() override {
    client_.reset();
    service_.stop();
    service_.close();
  }

  static inline pid_t busPid_ = -1;
  static inline std::string address_;
  testing::RecordingLogger logger_;
  std::shared_ptr<Fake> fake_ = std::make_shared<Fake>();
  NotificationCenter notifications_;
  BusService service_{logger_, *fake_, notifications_};
  dbus::BusRef client_;
};

TEST_F(BusServiceTest, HeldCallsRunInOrderAfterAcceptanceAndAVanishedClientIsInvalidatedOnce) {
  const char* unique = nullptr;
  ASSERT_GE(sd_bus_get_unique_name(client_.get(), &unique), 0);
  const std::string name = unique;
  int answered = 0;
  for (int i = 0; i < 5; ++i)
    ASSERT_GE(sd_bus_call_method_async(
                  client_.get(), nullptr, kServiceName, kObjectPath, kInterfaceName, "CreateReportingSession",
                  [](sd_bus_message*, void* userdata, sd_bus_error*) { return ++*static_cast<int*>(userdata), 0; },
                  &answered, "x", std::int64_t{100 + i}),
              0);
  // A call still unanswered when the client goes away.
  ASSERT_GE(sd_bus_call_method_async(client_.get(), nullptr, kServiceName, kObjectPath, kInterfaceName,
                                     "StartReportingSessionForID", nullptr, nullptr, "x", std::int64_t{1}),
            0);
  while (answered < 5) {
    int r = sd_bus_process(client_.get(), nullptr);
    ASSERT_GE(r == 0 ? sd_bus_wait(client_.get(), 1'000'000) : r, 0);
  }
  EXPECT_EQ(fake_->get(fake_->calls),
            (std::vector<std::string>{"create 100", "create 101", "create 102", "create 103", "create 104"}));
  EXPECT_EQ(fake_->get(fake_->accepted).size(), 1u);

  client_.reset();
  ASSERT_TRUE(eventually([&] { return fake_->get(fake_->invalidated).size() == 1; }));
  EXPECT_NE(fake_->get(fake_->invalidated)[0].find(name), std::string::npos);
  // Another client's departure is its own, and the first is not invalidated twice.
  dbus::BusRef other = connectClient();
  dbus::BusError error;
  ASSERT_GE(sd_bus_call_method(other.get(), kServiceName, kObjectPath, kInterfaceName, "CreateReportingSession",
                               error.get(), nullptr, "x", std::int64_t{2}),
            0)
      << error.message();
  other.reset();
  ASSERT_TRUE(eventually([&] { return fake_->get(fake_->invalidated).size() == 2; }));
  EXPECT_EQ(fake_->get(fake_->invalidated)[1].find(name), std::string::npos);
}

TEST_F(BusServiceTest, PostedSignalReachesRegistrationsOfItsNameAndPathOnly) {
  std::vector<std::string> got;  // filled on this thread, by the queue
  auto queue = std::make_shared<testing::ManualQueue>("test", QoS::Default);
  int token = 0;
  notifications_.registerDispatch(kDefaultsNotification, queue,
                                  [&](int t) { got.push_back("defaults " + std::to_string(t)); }, &token);
  notifications_.registerDispatch("com.example.other", queue, [&](int) { got.push_back("other"); }, nullptr);
  for (auto [path, name] : {std::pair{kNotifyPath, "com.example.unrelated"}, {"/elsewhere", kDefaultsNotification},
                            {kNotifyPath, kDefaultsNotification}})
    ASSERT_GE(sd_bus_emit_signal(client_.get(), path, kNotifyInterface, "Posted", "s", name), 0);
  sd_bus_flush(client_.get());
  ASSERT_TRUE(eventually([&] { return queue->runOne(), !got.empty(); }));
  while (queue->runOne()) {
  }
  EXPECT_EQ(got, std::vector<std::string>{"defaults " + std::to_string(token)});
}

TEST_F(BusServiceTest, TheNameCanBeOwnedOnce) {
  testing::RecordingLogger logger;
  NotificationCenter notifications;
  BusService second(logger, *fake_, notifications);
  BusService::Options options;
  options.address = address_;
  options.handleSignals = false;
  EXPECT_LT(second.open(options), 0);
  ASSERT_GT(logger.size(), 0u);
  EXPECT_NE(logger.entries().back().message.find("could not acquire the name com.orvane.vireo.Reporting1"),
            std::string::npos);
}

// Our interfaces' blocks of an introspection document, whitespace dropped.
std::string interfaceBlocks(std::string xml) {
  std::erase_if(xml, [](unsigned char c) { return std::isspace(c); });
  std::string blocks;
  for (const char* name : {kInterfaceName, kDebugInterfaceName, kOrientationInterfaceName}) {
    auto begin = xml.find(std::string("<interfacename=\"") + name + "\">");
    blocks += begin == std::string::npos ? "" : xml.substr(begin, xml.find("</interface>", begin) - begin);
  }
  return blocks;
}

TEST_F(BusServiceTest, LiveIntrospectionMatchesTheInstalledInterface) {
  dbus::BusError error;
  dbus::MessageRef reply;
  ASSERT_GE(sd_bus_call_method(client_.get(), kServiceName, kObjectPath, "org.freedesktop.DBus.Introspectable",
                               "Introspect", error.get(), reply.out(), ""),
            0)
      << error.message();
  const char* live = nullptr;
  ASSERT_GE(sd_bus_message_read(reply.get(), "s", &live), 0);
  std::ifstream file(VIREO_INTERFACE_XML);
  ASSERT_TRUE(file) << VIREO_INTERFACE_XML;
  auto expected = interfaceBlocks(std::string(std::istreambuf_iterator<char>(file), {}));
  EXPECT_NE(expected.find("<methodname=\"CreateReportingSession\">"), std::string::npos);
  EXPECT_NE(expected.find("<methodname=\"SetInterfaceOrientation\">"), std::string::npos);
  EXPECT_EQ(interfaceBlocks(live), expected) << live;
}

}  // namespace
}  // namespace vireo::daemon
