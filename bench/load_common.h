// Shared pieces of the load tools: bus connections, option parsing, the daemon's
// process id and CPU time, and a barrier to start client threads together.
#pragma once

#include <sqlite3.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <sstream>
#include <memory>
#include <string>
#include <thread>

#include "base/value.h"
#include "vireo/client.h"

namespace vireo::bench {

inline constexpr const char* kService = "com.orvane.vireo.Reporting1";
inline constexpr const char* kPath = "/com/orvane/vireo/Reporting1";
inline constexpr const char* kInterface = "com.orvane.vireo.Reporting1";

// --name value or --name=value options; bare words are rejected.
class Options {
 public:
  Options(int argc, char** argv, const char* usage) {
    for (int i = 1; i < argc; ++i) {
      std::string a = argv[i];
      if (a == "-h" || a == "--help") {
        std::fputs(usage, stdout);
        std::exit(0);
      }
      if (a.rfind("--", 0) != 0) fail(usage, "unexpected argument " + a);
      auto eq = a.find('=');
      if (eq != std::string::npos) {
        values_[a.substr(2, eq - 2)] = a.substr(eq + 1);
      } else if (i + 1 < argc) {
        values_[a.substr(2)] = argv[++i];
      } else {
        fail(usage, "missing value for " + a);
      }
    }
  }
  std::string text(const std::string& name, const std::string& fallback) const {
    auto it = values_.find(name);
    return it == values_.end() ? fallback : it->second;
  }
  long long number(const std::string& name, long long fallback) const {
    auto it = values_.find(name);
    return it == values_.end() ? fallback : std::atoll(it->second.c_str());
  }

 private:
  [[noreturn]] static void fail(const char* usage, const std::string& why) {
    std::fprintf(stderr, "%s\n%s", why.c_str(), usage);
    std::exit(2);
  }
  std::map<std::string, std::string> values_;
};

// A new bus connection: the given address, else VIREO_BUS / the default bus rules.
inline sd_bus* openBus(const std::string& address) {
  sd_bus* bus = nullptr;
  int r;
  if (!address.empty()) {
    r = sd_bus_new(&bus);
    if (r >= 0) r = sd_bus_set_address(bus, address.c_str());
    if (r >= 0) r = sd_bus_set_bus_client(bus, 1);
    if (r >= 0) r = sd_bus_start(bus);
  } else {
    const char* env = std::getenv("VIREO_BUS");
    bool system = env ? std::strcmp(env, "system") == 0 : geteuid() == 0;
    r = system ? sd_bus_open_system(&bus) : sd_bus_open_user(&bus);
  }
  if (r < 0) {
    std::fprintf(stderr, "cannot connect to the bus: %s\n", std::strerror(-r));
    std::exit(1);
  }
  return bus;
}

// The process id of the daemon as the bus reports it.
inline std::optional<pid_t> daemonPid(sd_bus* bus) {
  sd_bus_message* reply = nullptr;
  sd_bus_error e = SD_BUS_ERROR_NULL;
  int r = sd_bus_call_method(bus, "org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
                             "GetConnectionUnixProcessID", &e, &reply, "s", kService);
  sd_bus_error_free(&e);
  if (r < 0) return std::nullopt;
  std::uint32_t pid = 0;
  r = sd_bus_message_read(reply, "u", &pid);
  sd_bus_message_unref(reply);
  if (r < 0) return std::nullopt;
  return static_cast<pid_t>(pid);
}

// utime + stime in seconds from a /proc stat file (a process's or one thread's).
inline std::optional<double> cpuSecondsOf(const std::string& statPath) {
  std::ifstream in(statPath);
  std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  auto close = text.rfind(')');
  if (close == std::string::npos) return std::nullopt;
  std::istringstream fields(text.substr(close + 2));
  std::string f;
  unsigned long long utime = 0, stime = 0;
  // Fields after the name: state(3) ... utime(14) stime(15).
  for (int i = 3; i <= 15 && fields >> f; ++i) {
    if (i == 14) utime = std::stoull(f);
    if (i == 15) stime = std::stoull(f);
  }
  return static_cast<double>(utime + stime) / static_cast<double>(sysconf(_SC_CLK_TCK));
}
inline std::optional<double> cpuSeconds(pid_t pid) { return cpuSecondsOf("/proc/" + std::to_string(pid) + "/stat"); }
// One thread of this process.
inline std::optional<double> threadCpuSeconds(pid_t tid) {
  return cpuSecondsOf("/proc/self/task/" + std::to_string(tid) + "/stat");
}

// A numeric field of /proc/<pid>/status ("VmRSS", "Threads"); pid 0 is this process.
// -1 when it cannot be read (the process is gone).
inline double procStatus(pid_t pid, const char* field) {
  std::ifstream in(pid ? "/proc/" + std::to_string(pid) + "/status" : std::string("/proc/self/status"));
  const std::string prefix = std::string(field) + ":";
  for (std::string line; std::getline(in, line);)
    if (line.rfind(prefix, 0) == 0) return std::atof(line.c_str() + prefix.size());
  return -1;
}
// VmRSS in MiB; 0 when it cannot be read.
inline double rssMiB(pid_t pid) { return std::max(0.0, procStatus(pid, "VmRSS") / 1024.0); }

// The payload of the message loads: 20 entries (7 strings, 7 64-bit integers, 6 doubles).
inline Dictionary makePayload() {
  Dictionary d;
  for (int i = 0; i < 7; ++i) d.set(Value("string_" + std::to_string(i)), Value("value of entry " + std::to_string(i)));
  for (int i = 0; i < 7; ++i) d.set(Value("int_" + std::to_string(i)), Value(1234567890123LL * (i + 1)));
  for (int i = 0; i < 6; ++i) d.set(Value("double_" + std::to_string(i)), Value(3.14159 * (i + 1)));
  return d;
}

// Waits until read() gives the same figure three times in a row, step apart: the
// store has taken the rows of a phase that were still on their way.
inline void waitUntilStill(const std::function<std::int64_t()>& read, std::chrono::milliseconds step) {
  std::int64_t last = read();
  for (int still = 0; still < 3;) {
    std::this_thread::sleep_for(step);
    const std::int64_t now = read();
    still = now == last ? still + 1 : 0;
    last = now;
  }
}

// The daemon's store, opened read-only beside it (WAL readers do not block its writer).
class ReadOnlyStore {
 public:
  ReadOnlyStore(const std::string& path, int busyMs) {
    if (sqlite3_open_v2(path.c_str(), &db_, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
      sqlite3_close(db_);
      db_ = nullptr;
    } else {
      sqlite3_busy_timeout(db_, busyMs);
    }
  }
  ~ReadOnlyStore() { sqlite3_close(db_); }
  ReadOnlyStore(const ReadOnlyStore&) = delete;
  ReadOnlyStore& operator=(const ReadOnlyStore&) = delete;

  // The first column of the first row; ?1, when the query has it, is arg. -1 when the
  // store cannot be read.
  std::int64_t scalar(const std::string& sql, std::int64_t arg = 0) {
    if (!db_) return -1;
    sqlite3_stmt* st = nullptr;
    std::int64_t n = -1;
    if (sqlite3_prepare_v2(db_, sql.c_str(), -1, &st, nullptr) == SQLITE_OK &&
        (sqlite3_bind_parameter_count(st) == 0 || sqlite3_bind_int64(st, 1, arg) == SQLITE_OK) &&
        sqlite3_step(st) == SQLITE_ROW)
      n = sqlite3_column_int64(st, 0);
    sqlite3_finalize(st);
    return n;
  }

 private:
  sqlite3* db_ = nullptr;
};

// Releases every waiting client thread at once.
class StartGate {
 public:
  void wait() {
    std::unique_lock lock(mu_);
    cv_.wait(lock, [&] { return open_; });
  }
  void open() {
    {
      std::lock_guard lock(mu_);
      open_ = true;
    }
    cv_.notify_all();
  }

 private:
  std::mutex mu_;  // guards open_
  std::condition_variable cv_;
  bool open_ = false;
};

inline double secondsSince(std::chrono::steady_clock::time_point t) {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - t).count();
}

// A client of the daemon on the given bus address (the default bus when empty); a
// load tool cannot go on without one.
inline std::unique_ptr<client::Client> connectClient(const std::string& address) {
  auto c = address.empty() ? client::Client::connect() : client::Client::connectAddress(address);
  if (!c) {
    std::fprintf(stderr, "cannot connect: %s\n", c.error().message.c_str());
    std::exit(1);
  }
  return std::move(*c);
}

}  // namespace vireo::bench
