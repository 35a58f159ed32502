// What the end-to-end suite cannot see from a client: dropped second answers,
// calls held for the credentials, invalidation, signal filtering, introspection.
#include "daemon/bus_service.h"

#include <gtest/gtest.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <sstream>
#include <thread>

#include "daemon/pending_call.h"
#include "dispatch/dispatch.h"
#include "service/reporting_protocol.h"

namespace vireo::daemon {
namespace {

using namespace std::chrono_literals;

// Polls until pred holds; the bound only keeps a broken test from hanging.
template <typename Pred>
bool eventually(Pred pred) {
  for (auto end = std::chrono::steady_clock::now() + 10s; std::chrono::steady_clock::now() < end;) {
    if (pred()) return true;
    std::this_thread::sleep_for(5ms);
  }
  return pred();
}

struct NullLogger : Logger {
  bool verbose(LogScope) const override { return false; }
  void write(LogScope, LogLevel, const char*, int, const char*, std::string_view message) override {
    std::lock_guard lock(mutex);
    lines.emplace_back(message);
  }
  std::mutex mutex;  // guards lines
  std::vector<std::string> lines;
};

// Stands in for the listener delegate and the exported object: records creates,
// keeps starts unanswered, and notes accepted and invalidated connections.
class Fake : public VRReportingServiceProtocol, public ListenerDelegate, public std::enable_shared_from_this<Fake> {
 public:
  bool shouldAcceptNewConnection(ClientConnection& connection) override {
    std::string description = connection.description();
    record(&accepted_, description);
    connection.setExportedObject(shared_from_this());
    connection.setInvalidationHandler([this, description] { record(&invalidated_, description); });
    connection.resume();
    return true;
  }
  void createReportingSession(std::int64_t id, BoolReply reply) override {
    record(&calls_, "create " + std::to_string(id));
    reply(true);
  }
  void getServiceNameForReporterID(std::int64_t, ServiceTypeReply reply) override { reply(7); }
  void startReportingSessionForID(std::int64_t, BoolReply reply) override {
    std::lock_guard lock(mutex_);
    kept_.push_back(reply);
  }
  void getAllReporters(ReporterListReply reply) override { reply({5}); }
  void setServiceType(std::uint16_t, std::int64_t, BoolReply reply) override { reply(true); }
  void setConfiguration(Dictionary, std::int64_t, BoolReply reply) override { reply(true); }
  void sendMessage(Dictionary, std::uint32_t, std::uint16_t, std::optional<std::vector<std::int64_t>>,
                   ErrorReply reply) override {
    reply(std::nullopt);
  }
  void stopReportingSessionForID(std::int64_t, BoolReply reply) override { reply(true); }
  void destroyReportingSession(std::int64_t, BoolReply reply) override { reply(true); }
  void reporterIDValid(std::int64_t, DictionaryReply reply) override { reply(Dictionary{}); }
  void killService(BoolReply) override {}

  std::vector<std::string> calls() { return get(calls_); }
  std::vector<std::string> accepted() { return get(accepted_); }
  std::vector<std::string> invalidated() { return get(invalidated_); }

 private:
  void record(std::vector<std::string>* to, std::string what) {
    std::lock_guard lock(mutex_);
    to->push_back(std::move(what));
  }
  std::vector<std::string> get(const std::vector<std::string>& from) {
    std::lock_guard lock(mutex_);
    return from;
  }
  std::mutex mutex_;  // guards every member below
  std::vector<std::string> calls_, accepted_, invalidated_;
  std::vector<BoolReply> kept_;
};

// A private dbus-daemon for the whole suite.
class PrivateBus {
 public:
  PrivateBus() {
    int out[2];
    if (pipe(out) != 0) return;
    pid_ = fork();
    if (pid_ == 0) {
      // Ends with the test, however the test ends; keeps quiet on the test's output.
      sigset_t none;
      sigemptyset(&none);
      sigprocmask(SIG_SETMASK, &none, nullptr);  // the suite blocks SIGTERM
      prctl(PR_SET_PDEATHSIG, SIGTERM);
      dup2(out[1], STDOUT_FILENO);
      dup2(open("/dev/null", O_WRONLY), STDERR_FILENO);
      execlp("dbus-daemon", "dbus-daemon", "--session", "--nofork", "--print-address", "--address=unix:tmpdir=/tmp",
             static_cast<char*>(nullptr));
      _exit(127);
    }
    close(out[1]);
    for (char c; read(out[0], &c, 1) == 1 && c != '\n';) address_ += c;
    close(out[0]);
  }
  ~PrivateBus() {
    if (pid_ <= 0) return;
    kill(pid_, SIGTERM);
    waitpid(pid_, nullptr, 0);
  }
  const std::string& address() const { return address_; }

 private:
  std::string address_;
  pid_t pid_ = -1;
};

dbus::BusRef connectClient(const std::string& address) {
  dbus::BusRef bus;
  EXPECT_GE(sd_bus_new(bus.out()), 0);
  EXPECT_GE(sd_bus_set_address(bus.get(), address.c_str()), 0);
  EXPECT_GE(sd_bus_set_bus_client(bus.get(), 1), 0);
  EXPECT_GE(sd_bus_start(bus.get()), 0);
  return bus;
}

class BusServiceTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    // Before any thread of the suite exists, as the daemon does.
    blockServiceSignals();
    bus_ = new PrivateBus();
  }
  static void TearDownTestSuite() {
    delete bus_;
    bus_ = nullptr;
  }
  void SetUp() override {
    BusService::Options options;
    options.address = bus_->address();
    ASSERT_EQ(service_.open(options), 0);
    service_.start();
    client_ = connectClient(bus_->address());
  }
  void TearDown() override {
    client_.reset();
    service_.stop();
    service_.close();
  }
  // A synchronous call without arguments or with one int64.
  dbus::MessageRef call(dbus::BusRef& bus, const char* method, std::optional<std::int64_t> id = {}) {
    dbus::BusError error;
    dbus::MessageRef reply;
    int r = id ? sd_bus_call_method(bus.get(), kServiceName, kObjectPath, kInterfaceName, method, error.get(),
                                    reply.out(), "x", *id)
               : sd_bus_call_method(bus.get(), kServiceName, kObjectPath, kInterfaceName, method, error.get(),
                                    reply.out(), "");
    EXPECT_GE(r, 0) << method << ": " << error.message();
    return reply;
  }

  static PrivateBus* bus_;
  NullLogger logger_;
  std::shared_ptr<Fake> fake_ = std::make_shared<Fake>();
  NotificationCenter notifications_;
  BusService service_{logger_, *fake_, notifications_};
  dbus::BusRef client_;
};

PrivateBus* BusServiceTest::bus_ = nullptr;

// On the bus, the end-to-end suite sees the first of the service's two answers for ID 0.
TEST_F(BusServiceTest, OnlyTheFirstOfTwoAnswersIsSent) {
  auto mailbox = std::make_shared<BusMailbox>();
  dbus::MessageRef m;
  ASSERT_GE(sd_bus_message_new_method_call(client_.get(), m.out(), kServiceName, kObjectPath, kInterfaceName,
                                           "GetAllReporters"),
            0);
  ASSERT_GE(sd_bus_message_seal(m.get(), 77, 0), 0);
  {
    PendingCall pending(mailbox, m.get());
    EXPECT_TRUE(pending.answer(Reply::error("com.example.Error", "first")));
    EXPECT_FALSE(pending.answer(Reply{}));
  }
  mailbox->close();  // sends the one answer, then releases the message
}

TEST_F(BusServiceTest, HeldCallsRunInArrivalOrderAfterTheConnectionIsAccepted) {
  dbus::BusRef fresh = connectClient(bus_->address());
  std::vector<dbus::SlotRef> slots(5);
  int answered = 0;
  for (int i = 0; i < 5; ++i)
    ASSERT_GE(sd_bus_call_method_async(
                  fresh.get(), slots[i].out(), kServiceName, kObjectPath, kInterfaceName, "CreateReportingSession",
                  [](sd_bus_message*, void* userdata, sd_bus_error*) {
                    ++*static_cast<int*>(userdata);
                    return 0;
                  },
                  &answered, "x", std::int64_t{100 + i}),
              0);
  while (answered < 5) {
    if (sd_bus_process(fresh.get(), nullptr) == 0) {
      ASSERT_GE(sd_bus_wait(fresh.get(), 1'000'000), 0);
    }
  }
  EXPECT_EQ(fake_->calls(),
            (std::vector<std::string>{"create 100", "create 101", "create 102", "create 103", "create 104"}));
  EXPECT_EQ(fake_->accepted().size(), 1u);
}

TEST_F(BusServiceTest, VanishedClientIsInvalidatedOnce) {
  dbus::BusRef other = connectClient(bus_->address());
  const char* unique = nullptr;
  ASSERT_GE(sd_bus_get_unique_name(other.get(), &unique), 0);
  std::string name = unique;
  // A call that is never answered is fine too: the client goes away meanwhile.
  ASSERT_GE(sd_bus_call_method_async(other.get(), nullptr, kServiceName, kObjectPath, kInterfaceName,
                                     "StartReportingSessionForID", nullptr, nullptr, "x", std::int64_t{1}),
            0);
  call(other, "CreateReportingSession", 1);
  other.reset();
  ASSERT_TRUE(eventually([&] { return fake_->invalidated().size() == 1; }));
  EXPECT_NE(fake_->invalidated()[0].find(name), std::string::npos);
  // Another client's departure is its own, and this one is not invalidated twice.
  dbus::BusRef third = connectClient(bus_->address());
  call(third, "GetAllReporters");
  third.reset();
  ASSERT_TRUE(eventually([&] { return fake_->invalidated().size() == 2; }));
  EXPECT_EQ(fake_->invalidated()[1].find(name), std::string::npos);
}

struct InlineQueue : SerialQueue {
  void async(Task task) override { task(); }
  const std::string& label() const override { return label_; }
  std::string label_ = "test";
};

TEST_F(BusServiceTest, PostedSignalReachesRegistrationsOfItsNameOnly) {
  std::mutex mutex;
  std::vector<std::string> got;
  auto queue = std::make_shared<InlineQueue>();
  int token = 0;
  auto record = [&](std::string what) {
    std::lock_guard lock(mutex);
    got.push_back(std::move(what));
  };
  notifications_.registerDispatch(kDefaultsNotification, queue, [&](int t) { record("defaults " + std::to_string(t)); },
                                  &token);
  notifications_.registerDispatch("com.example.other", queue, [&](int) { record("other"); }, nullptr);
  ASSERT_GE(sd_bus_emit_signal(client_.get(), kNotifyPath, kNotifyInterface, "Posted", "s", "com.example.unrelated"),
            0);
  ASSERT_GE(sd_bus_emit_signal(client_.get(), "/elsewhere", kNotifyInterface, "Posted", "s", kDefaultsNotification),
            0);
  ASSERT_GE(sd_bus_emit_signal(client_.get(), kNotifyPath, kNotifyInterface, "Posted", "s", kDefaultsNotification),
            0);
  sd_bus_flush(client_.get());
  ASSERT_TRUE(eventually([&] {
    std::lock_guard lock(mutex);
    return !got.empty();
  }));
  std::lock_guard lock(mutex);
  EXPECT_EQ(got, std::vector<std::string>{"defaults " + std::to_string(token)});
}

TEST_F(BusServiceTest, TheNameCanBeOwnedOnce) {
  NullLogger logger;
  auto fake = std::make_shared<Fake>();
  NotificationCenter notifications;
  BusService second(logger, *fake, notifications);
  BusService::Options options;
  options.address = bus_->address();
  options.handleSignals = false;
  EXPECT_LT(second.open(options), 0);
  ASSERT_FALSE(logger.lines.empty());
  EXPECT_NE(logger.lines.back().find("could not acquire the name com.orvane.vireo.Reporting1"), std::string::npos);
}

// The interface block of an introspection document, one trimmed line each.
std::vector<std::string> interfaceLines(const std::string& xml) {
  std::vector<std::string> lines;
  auto begin = xml.find(std::string("<interface name=\"") + kInterfaceName + "\">");
  auto end = xml.find("</interface>", begin);
  if (begin == std::string::npos || end == std::string::npos) return lines;
  std::istringstream in(xml.substr(begin, end - begin));
  for (std::string line; std::getline(in, line);) {
    auto first = line.find_first_not_of(" \t");
    if (first != std::string::npos) lines.push_back(line.substr(first));
  }
  return lines;
}

TEST_F(BusServiceTest, InstalledIntrospectionMatchesTheObject) {
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
  std::string installed((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
  auto expected = interfaceLines(installed);
  EXPECT_FALSE(expected.empty());
  EXPECT_EQ(interfaceLines(live), expected) << live;
}

}  // namespace
}  // namespace vireo::daemon
