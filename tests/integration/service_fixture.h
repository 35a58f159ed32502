// Runs the real daemon on a private bus for the integration tests: a session
// dbus-daemon of its own, service directories in a temporary directory, stderr
// captured to a file so tests can look for log lines.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include <nlohmann/json.hpp>

#include "../fakes/child_process.h"
#include "vireo/client.h"

namespace vireo::itest {

using namespace std::chrono_literals;

class ServiceTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  // Files written before the daemon starts (relative to the configuration directory).
  virtual std::map<std::string, std::string> configurationFiles() { return {}; }
  // Runs after the buses and directories exist, before the daemon starts; may add to daemonEnv_.
  virtual void beforeDaemonStarts() {}
  // Starts a dbus-daemon of its own listening in dir; returns its address.
  static std::string startPrivateBus(ChildProcess& bus, const std::string& dir);

  std::unique_ptr<client::Client> connect();
  // Creates a session of the given type (and app, when given) and starts it; returns the held start.
  static client::StartHandle startSession(client::Client& c, std::int64_t id, std::uint16_t type,
                                          const char* app = nullptr);
  static bool answeredTrue(const client::StartHandle& start);
  static void writeFile(const std::string& path, const std::string& text);
  static std::string readFile(const std::string& path);
  std::string log() { return readFile(daemonLog_); }
  bool waitForLog(const std::string& text, std::chrono::milliseconds timeout = 5s);
  // Polls fn until it is true or the timeout passes.
  template <class Fn>
  static bool eventually(Fn&& fn, std::chrono::milliseconds timeout = 5s) {
    auto until = std::chrono::steady_clock::now() + timeout;
    for (;;) {
      if (fn()) return true;
      if (std::chrono::steady_clock::now() > until) return false;
      std::this_thread::sleep_for(20ms);
    }
  }

  // Store access, read-only.
  std::int64_t count(const std::string& sql);
  std::vector<nlohmann::json> rows(const std::string& sql);

  std::string dir_;  // removed after the test unless VIREO_KEEP_TEST_DIRS is set
  std::string busAddress_;
  // The daemon's system bus: by default an address where nothing listens.
  std::string systemBusAddress_;
  std::string configDir_, stateDir_, logsDir_, runtimeDir_;
  // Added to (or, when empty, removed from) the daemon's environment.
  std::map<std::string, std::string> daemonEnv_;
  ChildProcess bus_;
  ChildProcess daemon_;
  std::string daemonLog_;
};

}  // namespace vireo::itest
