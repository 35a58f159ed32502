// What the end-to-end suite cannot see from a client: signal filtering,
// the owned name.
#include "daemon/bus_service.h"

#include <gtest/gtest.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <thread>

#include "fakes/fake_platform.h"
#include "service/reporting_protocol.h"

namespace vireo::daemon {
namespace {

using namespace std::chrono_literals;

// No test here calls the service's methods: no connection is ever accepted.
struct Refuse : ListenerDelegate {
  bool shouldAcceptNewConnection(ClientConnection&) override { return false; }
};

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
    ASSERT_GE(sd_bus_open_user(client_.out()), 0);  // the private bus, which the suite made the session bus
  }
  void TearDown() override {
    client_.reset();
    service_.stop();
    service_.close();
  }

  static inline pid_t busPid_ = -1;
  static inline std::string address_;
  testing::RecordingLogger logger_;
  Refuse refuse_;
  NotificationCenter notifications_;
  BusService service_{logger_, refuse_, notifications_};
  dbus::BusRef client_;
};

TEST_F(BusServiceTest, PostedSignalReachesRegistrationsOfItsNameAndPathOnly) {
  std::vector<std::string> got;  // filled on this thread, by the queue
  auto queue = std::make_shared<testing::ManualQueue>("test");
  int token = 0;
  notifications_.registerDispatch(kDefaultsNotification, queue,
                                  [&](int t) { got.push_back("defaults " + std::to_string(t)); }, &token);
  notifications_.registerDispatch("com.example.other", queue, [&](int) { got.push_back("other"); }, nullptr);
  for (auto [path, name] : {std::pair{kNotifyPath, "com.example.unrelated"}, {"/elsewhere", kDefaultsNotification},
                            {kNotifyPath, kDefaultsNotification}})
    ASSERT_GE(sd_bus_emit_signal(client_.get(), path, kNotifyInterface, "Posted", "s", name), 0);
  sd_bus_flush(client_.get());
  for (int i = 0; i < 2000 && got.empty(); ++i) {
    std::this_thread::sleep_for(5ms);
    queue->runOne();
  }
  while (queue->runOne()) {
  }
  EXPECT_EQ(got, std::vector<std::string>{"defaults " + std::to_string(token)});
}

TEST_F(BusServiceTest, TheNameCanBeOwnedOnce) {
  testing::RecordingLogger logger;
  NotificationCenter notifications;
  BusService second(logger, refuse_, notifications);
  BusService::Options options;
  options.address = address_;
  options.handleSignals = false;
  EXPECT_LT(second.open(options), 0);
  ASSERT_GT(logger.size(), 0u);
  EXPECT_NE(logger.entries().back().message.find("could not acquire the name com.orvane.vireo.Reporting1"),
            std::string::npos);
}

}  // namespace
}  // namespace vireo::daemon
