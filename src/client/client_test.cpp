// The client against a small stand-in service on a private bus: answers that come
// late, the error mapping, pipelined calls and the end of the connection.
#include "vireo/client.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <fcntl.h>

#include <atomic>
#include <filesystem>
#include <cstdio>
#include <thread>

namespace vireo::client {
namespace {

using namespace std::chrono_literals;

// Answers a few methods of the service: Create true, Start held until Stop,
// SendMessage fails with the reporting-disabled error when the category is 0.
class StandIn {
 public:
  explicit StandIn(const std::string& address) {
    sd_bus_new(&bus_);
    sd_bus_set_address(bus_, address.c_str());
    sd_bus_set_bus_client(bus_, 1);
    sd_bus_start(bus_);
    sd_bus_add_object_vtable(bus_, nullptr, kObjectPath, kInterface, kVtable, this);
    sd_bus_request_name(bus_, kServiceName, 0);
    thread_ = std::thread([this] {
      while (!stop_) {
        if (sd_bus_process(bus_, nullptr) == 0) sd_bus_wait(bus_, 20'000);
      }
    });
  }
  ~StandIn() {
    stop_ = true;
    thread_.join();
    sd_bus_message_unref(heldStart_);
    sd_bus_flush_close_unref(bus_);
  }

 private:
  static int create(sd_bus_message* m, void*, sd_bus_error*) { return sd_bus_reply_method_return(m, "b", 1); }
  static int start(sd_bus_message* m, void* self, sd_bus_error*) {
    static_cast<StandIn*>(self)->heldStart_ = sd_bus_message_ref(m);
    return 1;
  }
  static int stop(sd_bus_message* m, void* userdata, sd_bus_error*) {
    auto* self = static_cast<StandIn*>(userdata);
    if (self->heldStart_) {
      sd_bus_reply_method_return(self->heldStart_, "b", 1);
      self->heldStart_ = sd_bus_message_unref(self->heldStart_);
    }
    return sd_bus_reply_method_return(m, "b", 1);
  }
  static int send(sd_bus_message* m, void*, sd_bus_error*) {
    sd_bus_message_skip(m, "a{sv}");
    std::uint32_t category = 0;
    sd_bus_message_read(m, "u", &category);
    if (category == 0)
      return sd_bus_reply_method_errorf(m, kReportingDisabledError,
                                        "reporting is disabled (com.orvane.audio.reporting, code 1)");
    return sd_bus_reply_method_return(m, "");
  }
  static int valid(sd_bus_message* m, void*, sd_bus_error*) {
    std::int64_t id = 0;
    sd_bus_message_read(m, "x", &id);
    return sd_bus_reply_method_return(m, "a{sv}", 2, "reporterID", "x", id, "serviceType", "q", 7);
  }
  static constexpr sd_bus_vtable kVtable[] = {
      SD_BUS_VTABLE_START(0),
      SD_BUS_METHOD("CreateReportingSession", "x", "b", create, 0),
      SD_BUS_METHOD("StartReportingSessionForID", "x", "b", start, 0),
      SD_BUS_METHOD("StopReportingSessionForID", "x", "b", stop, 0),
      SD_BUS_METHOD("SendMessage", "a{sv}uqbax", "", send, 0),
      SD_BUS_METHOD("ReporterIDValid", "x", "a{sv}", valid, 0),
      SD_BUS_VTABLE_END,
  };

  sd_bus* bus_ = nullptr;
  sd_bus_message* heldStart_ = nullptr;  // touched only by the bus thread
  std::atomic<bool> stop_{false};
  std::thread thread_;
};

class ClientTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char dir[] = "/tmp/vireo-client-test-XXXXXX";
    ASSERT_TRUE(mkdtemp(dir));
    dir_ = dir;
    int fds[2];
    ASSERT_EQ(pipe(fds), 0);
    busPid_ = fork();
    if (busPid_ == 0) {
      dup2(fds[1], STDOUT_FILENO);
      int devnull = ::open("/dev/null", O_WRONLY);
      dup2(devnull, STDERR_FILENO);
      execl("/usr/bin/dbus-daemon", "dbus-daemon", "--session", "--nofork", "--print-address",
            ("--address=unix:dir=" + dir_).c_str(), static_cast<char*>(nullptr));
      _exit(127);
    }
    ::close(fds[1]);
    char c;
    while (::read(fds[0], &c, 1) == 1 && c != '\n') address_ += c;
    ::close(fds[0]);
    ASSERT_FALSE(address_.empty());
    standIn_ = std::make_unique<StandIn>(address_);
  }
  void TearDown() override {
    standIn_.reset();
    if (busPid_ > 0) {
      ::kill(busPid_, SIGTERM);
      waitpid(busPid_, nullptr, 0);
    }
    std::error_code ec;
    std::filesystem::remove_all(dir_, ec);
  }
  std::unique_ptr<Client> connect() {
    auto c = Client::connectAddress(address_);
    EXPECT_TRUE(c);
    return c ? std::move(*c) : nullptr;
  }

  std::string dir_, address_;
  pid_t busPid_ = -1;
  std::unique_ptr<StandIn> standIn_;
};

TEST_F(ClientTest, StartIsAnsweredWhenTheSessionStops) {
  auto c = connect();
  ASSERT_TRUE(c);
  EXPECT_EQ(*c->createReportingSession(1), true);
  auto start = c->startReportingSessionForID(1);
  EXPECT_FALSE(start.waitFor(100ms));
  EXPECT_FALSE(start.ready());
  EXPECT_EQ(*c->stopReportingSessionForID(1), true);
  auto answer = start.waitFor(2s);
  ASSERT_TRUE(answer);
  EXPECT_EQ(**answer, true);
  EXPECT_EQ(c->pendingCalls(), 0u);
}

TEST_F(ClientTest, ReportingDisabledMapsToDomainAndCode) {
  auto c = connect();
  ASSERT_TRUE(c);
  auto s = c->sendMessage(Dictionary{{"k", Value(1)}}, 0, 1);
  ASSERT_FALSE(s);
  EXPECT_TRUE(s.error().isReportingDisabled());
  EXPECT_EQ(s.error().domain, "com.orvane.audio.reporting");
  EXPECT_EQ(s.error().code, 1);
  EXPECT_TRUE(c->sendMessage(Dictionary{{"k", Value(1)}}, 3, 1, std::vector<std::int64_t>{1, 2}));
  auto unknown = c->getAllReporters();
  ASSERT_FALSE(unknown);
  EXPECT_EQ(unknown.error().name, "org.freedesktop.DBus.Error.UnknownMethod");
  EXPECT_FALSE(unknown.error().isReportingDisabled());
}

TEST_F(ClientTest, PipelinedSendsReportEachAnswer) {
  auto c = connect();
  ASSERT_TRUE(c);
  int ok = 0, disabled = 0;
  for (std::uint32_t i = 0; i < 50; ++i)
    ASSERT_TRUE(c->sendMessageAsync(Dictionary{{"i", Value(i)}}, i % 10, 1, std::nullopt, [&](const Status& s) {
      if (s) ++ok;
      else if (s.error().isReportingDisabled()) ++disabled;
    }));
  for (int spins = 0; c->pump(100ms) > 0 && spins < 100; ++spins) {
  }
  EXPECT_EQ(ok, 45);
  EXPECT_EQ(disabled, 5);
}

TEST_F(ClientTest, ReporterInfoAndClosedConnection) {
  auto c = connect();
  ASSERT_TRUE(c);
  auto info = c->reporterIDValid(-5);
  ASSERT_TRUE(info);
  EXPECT_EQ(info->reporterID, -5);
  EXPECT_EQ(info->serviceType, 7);

  // A start still waiting when its client goes away ends with an error, not a hang.
  auto start = c->startReportingSessionForID(2);
  ASSERT_TRUE(c->reporterIDValid(2));
  c.reset();
  auto answer = start.waitFor(1s);
  ASSERT_TRUE(answer);
  EXPECT_FALSE(answer->ok());
}

TEST_F(ClientTest, DefaultBusFollowsVireoBus) {
  // Only the session bus of this test exists; VIREO_BUS=session picks it.
  std::string saved = std::getenv("DBUS_SESSION_BUS_ADDRESS") ? std::getenv("DBUS_SESSION_BUS_ADDRESS") : "";
  setenv("DBUS_SESSION_BUS_ADDRESS", address_.c_str(), 1);
  setenv("VIREO_BUS", "session", 1);
  auto c = Client::connect();
  ASSERT_TRUE(c) << c.error().message;
  EXPECT_TRUE((*c)->createReportingSession(3));
  unsetenv("VIREO_BUS");
  if (saved.empty()) unsetenv("DBUS_SESSION_BUS_ADDRESS");
  else setenv("DBUS_SESSION_BUS_ADDRESS", saved.c_str(), 1);
}

}  // namespace
}  // namespace vireo::client
