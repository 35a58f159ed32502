// Orientation on an internal build: the sensor proxy (a mock on a private system
// bus) and the interface orientation pushed through the daemon, as they end up in
// session summaries and summary files.
#include <systemd/sd-bus.h>

#include <filesystem>

#include "service_fixture.h"

namespace vireo::itest {
namespace {

namespace fs = std::filesystem;

constexpr const char* kProxy = "net.hadess.SensorProxy";
constexpr const char* kProxyPath = "/net/hadess/SensorProxy";
constexpr const char* kMockInterface = "org.freedesktop.DBus.Mock";

class OrientationTest : public ServiceTest {
 protected:
  std::map<std::string, std::string> configurationFiles() override {
    return {{"device.conf", "InternalBuild=true\nDeviceClassNumber=1\n"}};
  }
  void beforeDaemonStarts() override {
    daemonEnv_["VIREO_VERBOSE"] = "reporting_session_verbose";
    fs::create_directories(dir_ + "/system");
    systemBusAddress_ = startPrivateBus(systemBus_, dir_ + "/system");
    ASSERT_FALSE(systemBusAddress_.empty());
    ASSERT_GE(sd_bus_new(&bus_), 0);
    ASSERT_GE(sd_bus_set_address(bus_, systemBusAddress_.c_str()), 0);
    ASSERT_GE(sd_bus_set_bus_client(bus_, 1), 0);
    ASSERT_GE(sd_bus_start(bus_), 0);
    startProxy();
  }
  void TearDown() override {
    ServiceTest::TearDown();
    proxy_.stop();
    if (bus_) sd_bus_flush_close_unref(bus_);
    systemBus_.stop();
  }

  void startProxy() {
    ASSERT_TRUE(proxy_.start({"/usr/bin/python3", "-m", "dbusmock", "--system", "--template", "iio-sensors-proxy",
                              "-p", R"({"has_accelerometer": true})"},
                             {{"DBUS_SYSTEM_BUS_ADDRESS", systemBusAddress_}}, dir_ + "/sensor-proxy.log"));
    ASSERT_TRUE(eventually([&] { return sd_bus_call_method(bus_, kProxy, kProxyPath, kMockInterface,
                                                           "GetInternalProperty", nullptr, nullptr, "s",
                                                           "AccelerometerOwners") >= 0; },
                           20s))
        << readFile(dir_ + "/sensor-proxy.log");
  }
  std::vector<std::string> accelerometerOwners() {
    sd_bus_message* reply = nullptr;
    std::vector<std::string> owners;
    if (sd_bus_call_method(bus_, kProxy, kProxyPath, kMockInterface, "GetInternalProperty", nullptr, &reply, "s",
                           "AccelerometerOwners") < 0)
      return {"(no answer)"};
    char** names = nullptr;
    // The mock answers a bare "as".
    if (sd_bus_message_read_strv(reply, &names) >= 0) {
      for (char** n = names; n && *n; ++n) owners.emplace_back(*n), free(*n);
      free(names);
    }
    sd_bus_message_unref(reply);
    return owners;
  }
  void turnDevice(const char* orientation) {
    ASSERT_GE(sd_bus_call_method(bus_, kProxy, kProxyPath, kMockInterface, "SetInternalProperty", nullptr, nullptr,
                                 "ssv", kProxy, "AccelerometerOrientation", "s", orientation),
              0);
  }
  // The summary payload of a session, once stored.
  nlohmann::json summaryOf(std::int64_t reporterID) {
    std::vector<nlohmann::json> found;
    eventually([&] {
      found = rows("SELECT m.payload FROM telemetry_messages m JOIN telemetry_sessions s ON m.session = s.id "
                   "WHERE m.type = 65535 AND json_extract(s.session_info, '$.session_id') = " +
                   std::to_string(reporterID));
      return !found.empty();
    });
    return found.empty() ? nlohmann::json() : found.back()["payload"];
  }

  ChildProcess systemBus_, proxy_;
  sd_bus* bus_ = nullptr;
};

TEST_F(OrientationTest, InternalTelephonySessionsRecordOrientationAndTheClaimFollowsThem) {
  auto c = connect();
  ASSERT_TRUE(c);
  auto phone = startSession(*c, 1, 2, "phone");
  auto generic = startSession(*c, 2, 0, "player");
  auto music = startSession(*c, 3, 7, "music");
  ASSERT_TRUE(c->getAllReporters());  // queued behind the starts: every session now orients
  // One claim for the process, however many sessions orient.
  ASSERT_TRUE(eventually([&] { return accelerometerOwners().size() == 1; })) << log();

  turnDevice("left-up");
  ASSERT_TRUE(waitForLog("mode=device orientation=\"left-up\" app=\"phone\""));
  turnDevice("right-up");
  ASSERT_TRUE(waitForLog("mode=device orientation=\"right-up\" app=\"phone\""));
  ASSERT_TRUE(c->setInterfaceOrientation("bottom-up"));
  ASSERT_TRUE(waitForLog("mode=ui orientation=\"bottom-up\" app=\"phone\""));
  EXPECT_EQ(c->setInterfaceOrientation("sideways").error().name, "org.freedesktop.DBus.Error.InvalidArgs");
  ASSERT_TRUE(c->sendMessage(Dictionary{{"k", 1}}, 0x40000003, 1));  // every session has a payload to summarise

  EXPECT_EQ(*c->stopReportingSessionForID(1), true);
  EXPECT_EQ(*c->stopReportingSessionForID(2), true);
  EXPECT_TRUE(answeredTrue(phone));
  EXPECT_EQ(accelerometerOwners().size(), 1u);  // the music session still orients

  auto summary = summaryOf(1);
  EXPECT_EQ(summary["device_orientation"], "left-up,right-up") << summary.dump();
  EXPECT_EQ(summary["ui_orientation"], "bottom-up");
  for (const char* key : {"device_orientation_time", "ui_orientation_time"}) {
    ASSERT_TRUE(summary[key].is_string()) << key;
    EXPECT_GT(std::stod(summary[key].get<std::string>()), 0.0);
  }
  auto plain = summaryOf(2);
  ASSERT_FALSE(plain.is_null());
  EXPECT_FALSE(plain.contains("device_orientation") || plain.contains("ui_orientation")) << plain.dump();

  // The summary file carries the same entries.
  std::string file;
  for (auto& e : fs::directory_iterator(logsDir_ + "/Audio/Reporting"))
    if (e.path().string().ends_with("-vireo-phone-telephony.json")) file = readFile(e.path());
  auto entries = nlohmann::json::parse(file, nullptr, false);
  ASSERT_TRUE(entries.is_array()) << file;
  std::vector<std::string> recorded;
  for (auto& entry : entries)
    for (const char* key : {"device_orientation", "ui_orientation"})
      if (entry.contains(key)) {
        recorded.push_back(entry[key]);
        EXPECT_TRUE(entry[std::string(key) + "_time"].is_number());
      }
  EXPECT_EQ(recorded, (std::vector<std::string>{"left-up", "right-up", "bottom-up"}));

  // The proxy restarts: the claim is made again for the session still running.
  proxy_.stop();
  startProxy();
  ASSERT_TRUE(eventually([&] { return accelerometerOwners().size() == 1; })) << log();
  turnDevice("normal");
  ASSERT_TRUE(waitForLog("mode=device orientation=\"normal\" app=\"music\""));
  EXPECT_EQ(*c->stopReportingSessionForID(3), true);
  EXPECT_TRUE(answeredTrue(music));
  EXPECT_TRUE(eventually([&] { return accelerometerOwners().empty(); }));
  EXPECT_EQ(summaryOf(3)["device_orientation"], "left-up,right-up,normal");  // it saw every change
  (void)generic;
}

}  // namespace
}  // namespace vireo::itest
