#include "daemon/bus_service.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <fstream>
#include <sstream>
#include <thread>

#include "daemon/pending_call.h"
#include "dispatch/dispatch.h"
#include "platform/dbus/value_codec.h"
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
  std::mutex mutex;
  std::vector<std::string> lines;
};

// A worker thread standing in for the server queue: replies come from here.
class Worker {
 public:
  Worker() : thread_([this] { loop(); }) {}
  ~Worker() {
    {
      std::lock_guard lock(mutex_);
      done_ = true;
    }
    cv_.notify_all();
    thread_.join();
  }
  void async(std::function<void()> task) {
    {
      std::lock_guard lock(mutex_);
      tasks_.push_back(std::move(task));
    }
    cv_.notify_all();
  }

 private:
  void loop() {
    std::unique_lock lock(mutex_);
    for (;;) {
      cv_.wait(lock, [this] { return done_ || !tasks_.empty(); });
      if (tasks_.empty()) return;
      auto task = std::move(tasks_.front());
      tasks_.pop_front();
      lock.unlock();
      task();
      lock.lock();
    }
  }
  std::mutex mutex_;  // guards tasks_ and done_
  std::condition_variable cv_;
  std::deque<std::function<void()>> tasks_;
  bool done_ = false;
  std::thread thread_;
};

// Answers every operation from the worker thread and records what it was asked.
class FakeObject : public VRReportingServiceProtocol {
 public:
  explicit FakeObject(Worker& worker) : worker_(worker) {}

  void createReportingSession(std::int64_t id, BoolReply reply) override {
    record("create " + std::to_string(id));
    worker_.async([reply] { reply(true); });
  }
  void setServiceType(std::uint16_t type, std::int64_t id, BoolReply reply) override {
    record("type " + std::to_string(type) + " " + std::to_string(id));
    worker_.async([reply] { reply(true); });
  }
  // Answers twice for 0, as the service does; only the first may reach the client.
  void getServiceNameForReporterID(std::int64_t id, ServiceTypeReply reply) override {
    record("name " + std::to_string(id));
    worker_.async([reply, id] {
      reply(id == 0 ? 65535 : 7);
      if (id == 0) reply(1);
    });
  }
  void setConfiguration(Dictionary configuration, std::int64_t id, BoolReply reply) override {
    record("configure " + Value(configuration).text() + " " + std::to_string(id));
    worker_.async([reply] { reply(true); });
  }
  // Kept and never answered.
  void startReportingSessionForID(std::int64_t id, BoolReply reply) override {
    record("start " + std::to_string(id));
    std::lock_guard lock(mutex_);
    kept_.push_back(reply);
  }
  void sendMessage(Dictionary payload, std::uint32_t category, std::uint16_t type,
                   std::optional<std::vector<std::int64_t>> ids, ErrorReply reply) override {
    std::string list = "absent";
    if (ids) {
      list = "[";
      for (auto id : *ids) list += std::to_string(id) + ",";
      list += "]";
    }
    record("send " + Value(payload).text() + " " + std::to_string(category) + " " + std::to_string(type) + " " +
           list);
    bool disabled = payload.contains("disabled");
    worker_.async([reply, disabled] {
      if (disabled)
        reply(Error{kReportingErrorDomain, kReportingDisabledCode, "whatever"});
      else
        reply(std::nullopt);
    });
  }
  void stopReportingSessionForID(std::int64_t, BoolReply reply) override { reply(true); }
  void destroyReportingSession(std::int64_t, BoolReply reply) override { reply(true); }
  void reporterIDValid(std::int64_t id, DictionaryReply reply) override {
    worker_.async([reply, id] { reply(Dictionary{{"reporterID", Value(id)}, {"serviceType", Value(3u)}}); });
  }
  void getAllReporters(ReporterListReply reply) override {
    worker_.async([reply] { reply({5, -6, 7}); });
  }
  void killService(BoolReply) override { record("kill"); }

  std::vector<std::string> calls() {
    std::lock_guard lock(mutex_);
    return calls_;
  }

 private:
  void record(std::string s) {
    std::lock_guard lock(mutex_);
    calls_.push_back(std::move(s));
  }
  Worker& worker_;
  std::mutex mutex_;  // guards calls_ and kept_
  std::vector<std::string> calls_;
  std::vector<BoolReply> kept_;
};

class FakeDelegate : public ListenerDelegate {
 public:
  explicit FakeDelegate(std::shared_ptr<FakeObject> object) : object_(std::move(object)) {}
  bool shouldAcceptNewConnection(ClientConnection& connection) override {
    std::string description = connection.description();
    {
      std::lock_guard lock(mutex_);
      accepted_.push_back(connection.processIdentifier());
    }
    connection.setExportedObject(object_);
    connection.setInvalidationHandler([this, description] {
      std::lock_guard lock(mutex_);
      invalidated_.push_back(description);
    });
    connection.resume();
    return true;
  }
  std::vector<std::int32_t> accepted() {
    std::lock_guard lock(mutex_);
    return accepted_;
  }
  std::vector<std::string> invalidated() {
    std::lock_guard lock(mutex_);
    return invalidated_;
  }

 private:
  std::shared_ptr<FakeObject> object_;
  std::mutex mutex_;  // guards accepted_ and invalidated_
  std::vector<std::int32_t> accepted_;
  std::vector<std::string> invalidated_;
};

// A private dbus-daemon for the whole suite.
class PrivateBus {
 public:
  PrivateBus() {
    char dirTemplate[] = "/tmp/vireo-bus-test-XXXXXX";
    dir_ = mkdtemp(dirTemplate);
    std::string socket = dir_ + "/bus";
    address_ = "unix:path=" + socket;
    std::string addressArg = "--address=" + address_;
    const char* argv[] = {"dbus-daemon", "--session", "--nofork", "--nopidfile", addressArg.c_str(), nullptr};
    pid_ = fork();
    if (pid_ == 0) {
      // Ends with the test, however the test ends; keeps quiet on the test's output.
      sigset_t none;
      sigemptyset(&none);
      sigprocmask(SIG_SETMASK, &none, nullptr);  // the suite blocks SIGTERM
      prctl(PR_SET_PDEATHSIG, SIGTERM);
      int null = open("/dev/null", O_RDWR);
      dup2(null, STDOUT_FILENO);
      dup2(null, STDERR_FILENO);
      execvp("dbus-daemon", const_cast<char**>(argv));
      _exit(127);
    }
    struct stat st;
    eventually([&] { return stat(socket.c_str(), &st) == 0; });
  }
  ~PrivateBus() {
    if (pid_ > 0) {
      kill(pid_, SIGTERM);
      waitpid(pid_, nullptr, 0);
    }
    std::string cleanup = dir_ + "/bus";
    unlink(cleanup.c_str());
    rmdir(dir_.c_str());
  }
  const std::string& address() const { return address_; }

 private:
  std::string dir_, address_;
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

  // A synchronous call; returns the reply or fills error.
  dbus::MessageRef call(const char* method, dbus::BusError* error, const char* types = nullptr, ...) {
    dbus::MessageRef m;
    EXPECT_GE(sd_bus_message_new_method_call(client_.get(), m.out(), kServiceName, kObjectPath, kInterfaceName, method),
              0);
    if (types) {
      va_list ap;
      va_start(ap, types);
      EXPECT_GE(sd_bus_message_appendv(m.get(), types, ap), 0);
      va_end(ap);
    }
    dbus::MessageRef reply;
    sd_bus_call(client_.get(), m.get(), 10'000'000, error->get(), reply.out());
    return reply;
  }

  static PrivateBus* bus_;
  NullLogger logger_;
  Worker worker_;
  std::shared_ptr<FakeObject> object_ = std::make_shared<FakeObject>(worker_);
  FakeDelegate delegate_{object_};
  NotificationCenter notifications_;
  BusService service_{logger_, delegate_, notifications_};
  dbus::BusRef client_;
};

PrivateBus* BusServiceTest::bus_ = nullptr;

TEST_F(BusServiceTest, MethodsAnswerWithTheirSignaturesFromAnotherThread) {
  dbus::BusError error;
  int b = 0;
  auto reply = call("CreateReportingSession", &error, "x", std::int64_t{11});
  ASSERT_TRUE(reply) << error.message();
  ASSERT_GE(sd_bus_message_read(reply.get(), "b", &b), 0);
  EXPECT_TRUE(b);

  reply = call("SetServiceType", &error, "qx", std::uint16_t{4}, std::int64_t{11});
  ASSERT_TRUE(reply) << error.message();
  EXPECT_STREQ(sd_bus_message_get_signature(reply.get(), true), "b");

  std::uint16_t type = 0;
  reply = call("GetServiceNameForReporterID", &error, "x", std::int64_t{11});
  ASSERT_TRUE(reply) << error.message();
  ASSERT_GE(sd_bus_message_read(reply.get(), "q", &type), 0);
  EXPECT_EQ(type, 7);

  reply = call("SetConfiguration", &error, "a{sv}x", 2, "name", "s", "x", "n", "i", -3, std::int64_t{11});
  ASSERT_TRUE(reply) << error.message();

  reply = call("SendMessage", &error, "a{sv}uqbax", 1, "k", "u", 5u, 0x10002u, std::uint16_t{3}, 0, 2,
               std::int64_t{1}, std::int64_t{2});
  ASSERT_TRUE(reply) << error.message();
  EXPECT_STREQ(sd_bus_message_get_signature(reply.get(), true), "");
  reply = call("SendMessage", &error, "a{sv}uqbax", 0, 1u, std::uint16_t{0}, 1, 0);
  ASSERT_TRUE(reply) << error.message();

  reply = call("ReporterIDValid", &error, "x", std::int64_t{-9});
  ASSERT_TRUE(reply) << error.message();
  EXPECT_STREQ(sd_bus_message_get_signature(reply.get(), true), "a{sv}");
  std::int64_t id = 0;
  const char *key1 = nullptr, *key2 = nullptr;
  ASSERT_GE(sd_bus_message_read(reply.get(), "a{sv}", 2, &key1, "x", &id, &key2, "q", &type), 0);
  EXPECT_STREQ(key1, "reporterID");
  EXPECT_STREQ(key2, "serviceType");
  EXPECT_EQ(id, -9);
  EXPECT_EQ(type, 3);

  reply = call("GetAllReporters", &error);
  ASSERT_TRUE(reply) << error.message();
  const void* ids = nullptr;
  size_t size = 0;
  ASSERT_GE(sd_bus_message_read_array(reply.get(), 'x', &ids, &size), 0);
  ASSERT_EQ(size, 3 * sizeof(std::int64_t));
  EXPECT_EQ(static_cast<const std::int64_t*>(ids)[1], -6);

  EXPECT_EQ(object_->calls(), (std::vector<std::string>{"create 11", "type 4 11", "name 11",
                                                        "configure {\"name\": \"x\", \"n\": -3} 11",
                                                        "send {\"k\": 5} 65538 3 absent", "send {} 1 0 []"}));
  EXPECT_EQ(delegate_.accepted(), std::vector<std::int32_t>{getpid()});
}

TEST_F(BusServiceTest, AddressedListAndTheDisabledError) {
  dbus::BusError error;
  auto reply = call("SendMessage", &error, "a{sv}uqbax", 1, "disabled", "b", 1, 1u, std::uint16_t{0}, 1, 2,
                    std::int64_t{4}, std::int64_t{-4});
  EXPECT_FALSE(reply);
  EXPECT_STREQ(error.name(), kReportingDisabledError);
  EXPECT_STREQ(error.message(), "reporting is disabled (com.orvane.audio.reporting, code 1)");
  EXPECT_EQ(object_->calls().back(), "send {\"disabled\": true} 1 0 [4,-4,]");
}

TEST_F(BusServiceTest, OnlyTheFirstOfTwoAnswersIsSent) {
  dbus::BusError error;
  std::uint16_t type = 0;
  auto reply = call("GetServiceNameForReporterID", &error, "x", std::int64_t{0});
  ASSERT_TRUE(reply) << error.message();
  ASSERT_GE(sd_bus_message_read(reply.get(), "q", &type), 0);
  EXPECT_EQ(type, 65535);
  // The connection still works after the dropped answer.
  reply = call("GetServiceNameForReporterID", &error, "x", std::int64_t{3});
  ASSERT_TRUE(reply) << error.message();
}

TEST_F(BusServiceTest, PendingCallAnswersOnce) {
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
  EXPECT_EQ(object_->calls(),
            (std::vector<std::string>{"create 100", "create 101", "create 102", "create 103", "create 104"}));
  EXPECT_EQ(delegate_.accepted().size(), 1u);
}

TEST_F(BusServiceTest, VanishedClientIsInvalidatedOnce) {
  dbus::BusRef other = connectClient(bus_->address());
  const char* unique = nullptr;
  ASSERT_GE(sd_bus_get_unique_name(other.get(), &unique), 0);
  std::string name = unique;
  dbus::BusError error;
  dbus::MessageRef reply;
  // A call that is never answered is fine too: the client goes away meanwhile.
  ASSERT_GE(sd_bus_call_method_async(other.get(), nullptr, kServiceName, kObjectPath, kInterfaceName,
                                     "StartReportingSessionForID", nullptr, nullptr, "x", std::int64_t{1}),
            0);
  ASSERT_GE(sd_bus_call_method(other.get(), kServiceName, kObjectPath, kInterfaceName, "CreateReportingSession",
                               error.get(), reply.out(), "x", std::int64_t{1}),
            0);
  reply.reset();
  other.reset();
  ASSERT_TRUE(eventually([&] { return delegate_.invalidated().size() == 1; }));
  EXPECT_NE(delegate_.invalidated()[0].find(name), std::string::npos);
  // Another client's departure is its own, and this one is not invalidated twice.
  dbus::BusRef third = connectClient(bus_->address());
  ASSERT_GE(sd_bus_call_method(third.get(), kServiceName, kObjectPath, kInterfaceName, "GetAllReporters", error.get(),
                               reply.out(), ""),
            0);
  reply.reset();
  third.reset();
  ASSERT_TRUE(eventually([&] { return delegate_.invalidated().size() == 2; }));
  EXPECT_EQ(delegate_.invalidated()[0].find(name), delegate_.invalidated()[0].find(name));
  EXPECT_EQ(delegate_.invalidated()[1].find(name), std::string::npos);
}

struct RecordingQueue : SerialQueue {
  void async(Task task) override { task(); }
  const std::string& label() const override { return label_; }
  std::string label_ = "test";
};

TEST_F(BusServiceTest, PostedSignalReachesRegistrationsOfItsNameOnly) {
  std::mutex mutex;
  std::vector<std::string> got;
  auto queue = std::make_shared<RecordingQueue>();
  int token = 0;
  notifications_.registerDispatch(kDefaultsNotification, queue,
                                  [&](int t) {
                                    std::lock_guard lock(mutex);
                                    got.push_back("defaults " + std::to_string(t));
                                  },
                                  &token);
  notifications_.registerDispatch("com.example.other", queue,
                                  [&](int) {
                                    std::lock_guard lock(mutex);
                                    got.push_back("other");
                                  },
                                  nullptr);
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

TEST_F(BusServiceTest, HangupPostsTheDefaultsNotificationAndTerminateEndsTheLoop) {
  std::atomic<int> delivered{0};
  notifications_.registerDispatch(kDefaultsNotification, std::make_shared<RecordingQueue>(), [&](int) { ++delivered; },
                                  nullptr);
  kill(getpid(), SIGHUP);
  ASSERT_TRUE(eventually([&] { return delivered == 1; }));
  kill(getpid(), SIGTERM);
  ASSERT_TRUE(eventually([&] {
    std::lock_guard lock(logger_.mutex);
    return !logger_.lines.empty() && logger_.lines.back().find("shutting down") != std::string::npos;
  }));
  service_.stop();  // returns: the loop has ended
  EXPECT_EQ(delivered, 1);
}

Dictionary nested(int levels) {
  Value inner = Value(Array{Value(1)});
  for (int i = 2; i < levels; ++i) inner = Value(Array{inner});
  return Dictionary{{"deep", inner}};
}

TEST_F(BusServiceTest, BadInputIsRefusedAndTheServiceGoesOn) {
  auto configure = [&](const Dictionary& configuration, dbus::BusError* error) {
    dbus::MessageRef m, reply;
    EXPECT_GE(sd_bus_message_new_method_call(client_.get(), m.out(), kServiceName, kObjectPath, kInterfaceName,
                                             "SetConfiguration"),
              0);
    EXPECT_GE(dbus::appendStringDictionary(m.get(), configuration), 0);
    EXPECT_GE(sd_bus_message_append(m.get(), "x", std::int64_t{5}), 0);
    sd_bus_call(client_.get(), m.get(), 10'000'000, error->get(), reply.out());
    return reply;
  };
  dbus::BusError deepError;
  EXPECT_FALSE(configure(nested(17), &deepError));
  EXPECT_STREQ(deepError.name(), dbus::kInvalidArgs);
  EXPECT_NE(std::strstr(deepError.message(), "nested deeper than 16"), nullptr) << deepError.message();
  dbus::BusError okError;
  EXPECT_TRUE(configure(nested(16), &okError)) << okError.message();

  dbus::BusError fdError;
  EXPECT_FALSE(call("SetConfiguration", &fdError, "a{sv}x", 1, "fd", "h", 1, std::int64_t{5}));
  EXPECT_STREQ(fdError.name(), dbus::kInvalidArgs);
  EXPECT_NE(std::strstr(fdError.message(), "file descriptors"), nullptr) << fdError.message();

  dbus::BusError signatureError;
  EXPECT_FALSE(call("CreateReportingSession", &signatureError, "s", "not a number"));
  EXPECT_STREQ(signatureError.name(), dbus::kInvalidArgs);

  dbus::BusError error;
  EXPECT_TRUE(call("CreateReportingSession", &error, "x", std::int64_t{1})) << error.message();
  EXPECT_EQ(object_->calls().back(), "create 1");
}

TEST_F(BusServiceTest, TheNameCanBeOwnedOnce) {
  NullLogger logger;
  FakeDelegate delegate(object_);
  NotificationCenter notifications;
  BusService second(logger, delegate, notifications);
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
