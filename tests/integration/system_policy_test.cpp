// The installed bus policy on a bus of the system type, with the daemon running
// as an unprivileged service user: who may own the name, call what, and whose
// notification the daemon acts on. Needs root (to switch users).
#include <grp.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <functional>

#include "platform/dbus/bus.h"
#include "service_fixture.h"

namespace vireo::itest {
namespace {

namespace fs = std::filesystem;

constexpr const char* kName = "com.orvane.vireo.Reporting1";
constexpr const char* kPath = "/com/orvane/vireo/Reporting1";
constexpr const char* kAccessDenied = "org.freedesktop.DBus.Error.AccessDenied";
constexpr const char* kDisabled = "com.orvane.audio.reporting.ReportingDisabled";
// Existing accounts stand in for the ones sysusers.d creates.
constexpr const char* kServiceUser = "daemon";
constexpr const char* kOrientationGroup = "video";

// The stock system bus configuration's default context: method calls denied.
constexpr const char* kBusConfig = R"(<!DOCTYPE busconfig PUBLIC "-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN"
 "http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd">
<busconfig>
  <type>system</type>
  <auth>EXTERNAL</auth>
  <listen>unix:path=@DIR@/system_bus_socket</listen>
  <policy context="default">
    <allow user="*"/>
    <deny own="*"/>
    <deny send_type="method_call"/>
    <allow send_type="signal"/>
    <allow send_requested_reply="true" send_type="method_return"/>
    <allow send_requested_reply="true" send_type="error"/>
    <allow receive_type="method_call"/>
    <allow receive_type="method_return"/>
    <allow receive_type="error"/>
    <allow receive_type="signal"/>
    <allow send_destination="org.freedesktop.DBus" send_interface="org.freedesktop.DBus"/>
  </policy>
  <include>@DIR@/policy.conf</include>
</busconfig>
)";

struct Identity {
  uid_t uid = 0;
  gid_t gid = 0;
  std::vector<gid_t> groups;
};

std::string replaceAll(std::string text, const std::string& from, const std::string& to) {
  for (auto p = text.find(from); p != std::string::npos; p = text.find(from, p + to.size())) text.replace(p, from.size(), to);
  return text;
}

int connectTo(const std::string& address, sd_bus** out) {
  int r = sd_bus_new(out);
  if (r >= 0) r = sd_bus_set_address(*out, address.c_str());
  if (r >= 0) r = sd_bus_set_bus_client(*out, 1);
  if (r >= 0) r = sd_bus_start(*out);
  return r;
}

// The fixture's helpers and child processes, with a bus and a daemon started differently.
class SystemPolicyTest : public ServiceTest {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to run the daemon and its callers as other users";
    // getpwnam and getgrnam answer in static storage: each copied before the next call.
    const passwd* pw = getpwnam(kServiceUser);
    if (pw) service_ = {pw->pw_uid, pw->pw_gid, {}};
    if ((pw = getpwnam("nobody"))) stranger_ = {pw->pw_uid, pw->pw_gid, {}};
    const group* gr = getgrnam("audio");
    if (gr) audioMember_ = {stranger_.uid, stranger_.gid, {gr->gr_gid}};
    if ((gr = getgrnam(kOrientationGroup))) orientationMember_ = {stranger_.uid, stranger_.gid, {gr->gr_gid}};
    if (!service_.uid || !stranger_.uid || audioMember_.groups.empty() || orientationMember_.groups.empty() ||
        !fs::exists("/usr/bin/setpriv"))
      GTEST_SKIP() << "needs the accounts daemon, nobody, audio and video, and setpriv";

    char tmpl[] = "/tmp/vireo-policy-XXXXXX";
    ASSERT_TRUE(mkdtemp(tmpl));
    dir_ = tmpl;
    chmod(dir_.c_str(), 0755);  // the callers reach the bus socket through it
    std::string policy = readFile(VIREO_DATA_DIR "/com.orvane.vireo.Reporting1.conf");
    ASSERT_NE(policy.find("user=\"vireo\""), std::string::npos);
    ASSERT_NE(policy.find("group=\"vireo-orientation\""), std::string::npos);
    policy = replaceAll(policy, "user=\"vireo\"", std::string("user=\"") + kServiceUser + "\"");
    policy = replaceAll(policy, "group=\"vireo-orientation\"", std::string("group=\"") + kOrientationGroup + "\"");
    writeFile(dir_ + "/policy.conf", policy);
    writeFile(dir_ + "/system.conf", replaceAll(kBusConfig, "@DIR@", dir_));

    int out = -1;
    ASSERT_TRUE(bus_.start({"/usr/bin/dbus-daemon", "--config-file=" + dir_ + "/system.conf", "--nofork",
                            "--print-address"},
                           {}, dir_ + "/dbus-daemon.log", &out));
    for (char c; ::read(out, &c, 1) == 1 && c != '\n';) address_ += c;
    ::close(out);
    ASSERT_FALSE(address_.empty()) << readFile(dir_ + "/dbus-daemon.log");

    configDir_ = dir_ + "/conf";
    std::map<std::string, std::string> env{{"VIREO_BUS", "system"}, {"DBUS_SYSTEM_BUS_ADDRESS", address_},
                                           {"DBUS_SESSION_BUS_ADDRESS", ""}, {"DBUS_STARTER_BUS_TYPE", ""},
                                           {"JOURNAL_STREAM", ""}, {"VIREO_VERBOSE", "reporting_server_verbose"},
                                           {"CONFIGURATION_DIRECTORY", configDir_}};
    for (const char* d : {"conf", "state", "logs", "run"}) fs::create_directories(dir_ + "/" + d);
    for (auto [variable, d] : {std::pair{"STATE_DIRECTORY", "state"}, {"LOGS_DIRECTORY", "logs"},
                               {"RUNTIME_DIRECTORY", "run"}}) {
      env[variable] = dir_ + "/" + d;
      ASSERT_EQ(chown(env[variable].c_str(), service_.uid, service_.gid), 0);
    }
    daemonLog_ = dir_ + "/vireo-reportingd.log";
    ASSERT_TRUE(daemon_.start({"/usr/bin/setpriv", "--reuid=" + std::to_string(service_.uid),
                               "--regid=" + std::to_string(service_.gid), "--clear-groups", "--", VIREO_DAEMON_PATH},
                              env, daemonLog_));
    ASSERT_GE(connectTo(address_, root_.out()), 0);
    bool up = eventually(
        [&] {
          return sd_bus_call_method(root_.get(), kName, kPath, "org.freedesktop.DBus.Peer", "Ping", nullptr, nullptr,
                                    "") >= 0 ||
                 !daemon_.running();
        },
        20s);
    ASSERT_TRUE(up && daemon_.running()) << "the daemon did not come up:\n" << log();
  }

  void TearDown() override {
    root_.reset();
    ServiceTest::TearDown();
  }

  // Runs fn in a child process as who, on a connection of its own, and then
  // whileConnected here before the child leaves the bus; returns the name of the
  // error fn met ("" for none).
  std::string as(const Identity& who, const std::function<int(sd_bus*, sd_bus_error*)>& fn,
                 const std::function<void()>& whileConnected = {}) {
    int result[2], release[2];
    if (pipe(result) != 0 || pipe(release) != 0) return "pipe";
    pid_t pid = fork();
    if (pid == 0) {
      ::close(result[0]);
      ::close(release[1]);
      std::string outcome = "could not switch user";
      sd_bus* bus = nullptr;
      if (setgroups(who.groups.size(), who.groups.data()) == 0 && setresgid(who.gid, who.gid, who.gid) == 0 &&
          setresuid(who.uid, who.uid, who.uid) == 0) {
        sd_bus_error error = SD_BUS_ERROR_NULL;
        int r = connectTo(address_, &bus);
        if (r < 0) outcome = std::string("connect: ") + std::strerror(-r);
        else if ((r = fn(bus, &error)) >= 0) outcome.clear();
        else outcome = error.name ? error.name : std::strerror(-r);
      }
      (void)!::write(result[1], outcome.data(), outcome.size());
      ::close(result[1]);
      for (char c; ::read(release[0], &c, 1) > 0;) {
      }
      _exit(0);
    }
    ::close(result[1]);
    ::close(release[0]);
    std::string outcome;
    for (char c; ::read(result[0], &c, 1) == 1;) outcome += c;
    ::close(result[0]);
    if (whileConnected) whileConnected();
    ::close(release[1]);
    waitpid(pid, nullptr, 0);
    return outcome;
  }

  using Action = std::function<int(sd_bus*, sd_bus_error*)>;
  static Action call(const char* interface, const char* member) {
    return [=](sd_bus* b, sd_bus_error* e) { return sd_bus_call_method(b, kName, kPath, interface, member, e, nullptr, ""); };
  }
  static int orient(sd_bus* bus, sd_bus_error* error) {
    return sd_bus_call_method(bus, kName, kPath, "com.orvane.vireo.Orientation1", "SetInterfaceOrientation", error,
                              nullptr, "s", "left-up");
  }
  static int create(sd_bus* bus, sd_bus_error* error) {
    sd_bus_message* reply = nullptr;
    int r = sd_bus_call_method(bus, kName, kPath, kName, "CreateReportingSession", error, &reply, "x", INT64_C(1));
    int ok = 0;
    if (r >= 0) r = sd_bus_message_read(reply, "b", &ok) < 0 || !ok ? -EBADMSG : 0;
    sd_bus_message_unref(reply);
    return r;
  }
  static int post(sd_bus* bus, sd_bus_error* = nullptr) {
    int r = sd_bus_emit_signal(bus, "/com/orvane/Notify1", "com.orvane.Notify1", "Posted", "s",
                               "com.orvane.vireo.reporting");
    return r < 0 ? r : sd_bus_flush(bus);
  }
  // The error name of a broadcast SendMessage from root ("" when accepted).
  std::string sendAsRoot() {
    dbus::BusError error;
    sd_bus_call_method(root_.get(), kName, kPath, kName, "SendMessage", error.get(), nullptr, "a{sv}uqbax", 0,
                       std::uint32_t{3}, 1, 0, 0);
    return error.name();
  }
  Identity service_, stranger_, audioMember_, orientationMember_;
  std::string address_;
  dbus::BusRef root_;
};

TEST_F(SystemPolicyTest, OnlyTheGroupsOfThePolicyReachTheService) {
  // The name is the service user's alone, even against root.
  dbus::BusError error;
  sd_bus_call_method(root_.get(), "org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
                     "RequestName", error.get(), nullptr, "su", kName, 0u);
  EXPECT_STREQ(error.name(), kAccessDenied);

  EXPECT_EQ(as(stranger_, create), kAccessDenied);
  EXPECT_EQ(as(stranger_, call("org.freedesktop.DBus.Peer", "Ping")), kAccessDenied);
  EXPECT_EQ(as(orientationMember_, create), kAccessDenied);
  EXPECT_EQ(as(orientationMember_, orient), "");
  EXPECT_EQ(as(audioMember_, create), "");
  EXPECT_EQ(as(audioMember_, call("com.orvane.vireo.Debug1", "GetStatus")), "");
  EXPECT_EQ(as(audioMember_, orient), kAccessDenied);
  EXPECT_EQ(as(audioMember_, call(kName, "KillService")), kAccessDenied);
  ASSERT_TRUE(daemon_.running());

  // Root may stop it: the daemon leaves without answering.
  dbus::BusError killed;
  sd_bus_call_method(root_.get(), kName, kPath, kName, "KillService", killed.get(), nullptr, "");
  EXPECT_STRNE(killed.name(), kAccessDenied);
  EXPECT_EQ(daemon_.waitExit(10s), 2);
}

TEST_F(SystemPolicyTest, NotificationsCountFromRootAndTheServiceUserOnly) {
  ASSERT_EQ(sendAsRoot(), "");
  writeFile(configDir_ + "/com.orvane.vireo.conf", "disable_reporting=true\n");
  // Each poster stays on the bus until the daemon has dealt with its notification.
  EXPECT_EQ(as(stranger_, post,
               [&] {
                 EXPECT_TRUE(eventually([&] {
                   return log().find("ignored the notification com.orvane.vireo.reporting") != std::string::npos;
                 }));
               }),
            "");
  EXPECT_EQ(sendAsRoot(), "") << "a stranger's notification was acted on";

  EXPECT_EQ(as(service_, post, [&] { EXPECT_TRUE(eventually([&] { return sendAsRoot() == kDisabled; })); }), "");

  writeFile(configDir_ + "/com.orvane.vireo.conf", "disable_reporting=false\n");
  ASSERT_GE(post(root_.get()), 0);
  EXPECT_TRUE(eventually([&] { return sendAsRoot().empty(); }));
}

}  // namespace
}  // namespace vireo::itest
