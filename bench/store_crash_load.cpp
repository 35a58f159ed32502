// Store crash load: a child process hands telemetry messages to the local store as
// a synchronous sender would (one at a time, each acknowledged once the store
// accepts it), the parent kills it with SIGKILL at a random moment, then checks the
// file: integrity, and how many acknowledged messages are missing. Each round uses a
// fresh store in its own directory under --dir, which should be on the disk the
// daemon uses (fsync costs are what make the difference).
#include <sqlite3.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "load_common.h"
#include "platform/linux/linux_logger.h"
#include "platform/linux/store/store.h"
#include "platform/linux/system_clock.h"

namespace {

using namespace vireo;
using namespace std::chrono_literals;
using Steady = std::chrono::steady_clock;

constexpr const char* kUsage = R"(usage: store_crash_load [--rounds R] [--min-ms A] [--max-ms B] [--pause-us P] [--threads T] [--dir D]
  --rounds R     kills (default 10)
  --min-ms A     earliest kill after the first acknowledgement (default 1000)
  --max-ms B     latest kill (default 3000)
  --pause-us P   pause after each acknowledged message, a bus round trip (default 50)
  --threads T    sending threads, each a synchronous sender (default 1)
  --dir D        where the stores go (default: the current directory)
)";

constexpr int kMaxThreads = 64;

// What the child tells the parent, in memory both see.
struct Shared {
  std::atomic<std::uint64_t> acknowledged[kMaxThreads];
  std::atomic<std::uint64_t> refused;
};

Dictionary makePayload(int thread, std::uint64_t i) {
  Dictionary d;
  d.set(Value("t"), Value(static_cast<std::int64_t>(thread)));
  d.set(Value("i"), Value(static_cast<std::int64_t>(i)));
  for (int k = 0; k < 6; ++k) d.set(Value("string_" + std::to_string(k)), Value("value of entry " + std::to_string(k)));
  for (int k = 0; k < 6; ++k) d.set(Value("int_" + std::to_string(k)), Value(1234567890123LL * (k + 1)));
  for (int k = 0; k < 6; ++k) d.set(Value("double_" + std::to_string(k)), Value(3.14159 * (k + 1)));
  return d;
}

[[noreturn]] void runChild(const std::string& dir, Shared* shared, int threads, std::chrono::microseconds pause) {
  linux_platform::LinuxLogger logger("", linux_platform::LinuxLogger::Output::Stream);
  linux_platform::SystemClock clock;
  linux_platform::LocalStore store(dir, logger, clock);
  if (!store.usable()) ::_exit(3);
  const Dictionary info{{"client_type", 19}, {"session_id", 7}};
  const Dictionary user{{"client_name", "store_crash_load"}, {"service_name", "standalone"}};
  std::vector<std::thread> senders;
  for (int t = 0; t < threads; ++t) {
    senders.emplace_back([&, t] {
      // A refused send is sent again, as a client told of the failure would.
      for (std::uint64_t i = 0;;) {
        if (store.insertTelemetryMessage(std::nullopt, &info, &user, 1, 2, makePayload(t, i), store.now())) {
          shared->acknowledged[t].store(++i, std::memory_order_release);
        } else {
          shared->refused.fetch_add(1, std::memory_order_relaxed);
        }
        if (pause.count() > 0) std::this_thread::sleep_for(pause);
      }
    });
  }
  for (auto& s : senders) s.join();
  ::_exit(4);
}

std::string scalar(sqlite3* db, const std::string& sql) {
  sqlite3_stmt* s = nullptr;
  std::string out;
  if (sqlite3_prepare_v2(db, sql.c_str(), -1, &s, nullptr) == SQLITE_OK && sqlite3_step(s) == SQLITE_ROW &&
      sqlite3_column_text(s, 0))
    out = reinterpret_cast<const char*>(sqlite3_column_text(s, 0));
  sqlite3_finalize(s);
  return out;
}

std::uint64_t count(sqlite3* db, const std::string& sql) {
  sqlite3_stmt* s = nullptr;
  std::uint64_t n = 0;
  if (sqlite3_prepare_v2(db, sql.c_str(), -1, &s, nullptr) == SQLITE_OK && sqlite3_step(s) == SQLITE_ROW)
    n = static_cast<std::uint64_t>(sqlite3_column_int64(s, 0));
  sqlite3_finalize(s);
  return n;
}

std::uint64_t total(const Shared& shared, int threads) {
  std::uint64_t n = 0;
  for (int t = 0; t < threads; ++t) n += shared.acknowledged[t].load(std::memory_order_acquire);
  return n;
}

}  // namespace

int main(int argc, char** argv) {
  bench::Options options(argc, argv, kUsage);
  const int rounds = static_cast<int>(options.number("rounds", 10));
  const auto minMs = options.number("min-ms", 1000);
  const auto maxMs = std::max(minMs, options.number("max-ms", 3000));
  const std::chrono::microseconds pause{options.number("pause-us", 50)};
  const int threads = std::clamp(static_cast<int>(options.number("threads", 1)), 1, kMaxThreads);
  const std::filesystem::path base = options.text("dir", ".");

  void* memory = ::mmap(nullptr, sizeof(Shared), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
  if (memory == MAP_FAILED) {
    std::perror("mmap");
    return 1;
  }
  auto* shared = new (memory) Shared{};
  std::mt19937 random(std::random_device{}());

  std::uint64_t acknowledgedAll = 0, missingAll = 0, maxMissing = 0, refusedAll = 0;
  int intact = 0;
  double seconds = 0, windowMax = 0;
  std::printf("%5s %10s %8s %9s %10s %10s %s\n", "round", "acked", "missing", "missing%", "acked/s", "window_ms",
              "integrity_check");
  for (int round = 1; round <= rounds; ++round) {
    std::string pattern = (base / "store_crash.XXXXXX").string();
    if (!::mkdtemp(pattern.data())) {
      std::perror("mkdtemp");
      return 1;
    }
    const std::string dir = pattern;
    for (auto& a : shared->acknowledged) a.store(0);
    shared->refused.store(0);

    const pid_t child = ::fork();
    if (child < 0) {
      std::perror("fork");
      return 1;
    }
    if (child == 0) runChild(dir, shared, threads, pause);

    // The clock starts at the first acknowledgement: opening the store is not load.
    const auto waitFrom = Steady::now();
    while (total(*shared, threads) == 0 && Steady::now() - waitFrom < 10s) std::this_thread::sleep_for(1ms);
    const auto start = Steady::now();
    std::this_thread::sleep_for(std::chrono::milliseconds(std::uniform_int_distribution<long long>(minMs, maxMs)(random)));
    ::kill(child, SIGKILL);
    const double elapsed = std::chrono::duration<double>(Steady::now() - start).count();
    int status = 0;
    ::waitpid(child, &status, 0);
    if (!WIFSIGNALED(status)) {
      std::fprintf(stderr, "round %d: the sender ended on its own (status %d)\n", round, status);
      return 1;
    }

    sqlite3* db = nullptr;
    sqlite3_open_v2((dir + "/" + linux_platform::LocalStore::kFileName).c_str(), &db, SQLITE_OPEN_READWRITE, nullptr);
    const std::string integrity = scalar(db, "PRAGMA integrity_check");
    std::uint64_t acknowledged = 0, missing = 0;
    for (int t = 0; t < threads; ++t) {
      const std::uint64_t acked = shared->acknowledged[t].load();
      const std::uint64_t present =
          count(db, "SELECT COUNT(DISTINCT json_extract(payload, '$.i')) FROM telemetry_messages WHERE "
                    "json_extract(payload, '$.t') = " + std::to_string(t) +
                    " AND json_extract(payload, '$.i') < " + std::to_string(acked));
      acknowledged += acked;
      missing += acked - present;
    }
    sqlite3_close(db);
    std::filesystem::remove_all(dir);

    const double rate = acknowledged / elapsed;
    const double window = rate > 0 ? 1000.0 * missing / rate : 0;
    std::printf("%5d %10llu %8llu %8.4f%% %10.0f %10.2f %s\n", round, static_cast<unsigned long long>(acknowledged),
                static_cast<unsigned long long>(missing), acknowledged ? 100.0 * missing / acknowledged : 0.0, rate,
                window, integrity.c_str());
    acknowledgedAll += acknowledged;
    missingAll += missing;
    maxMissing = std::max(maxMissing, missing);
    refusedAll += shared->refused.load();
    intact += integrity == "ok";
    seconds += elapsed;
    windowMax = std::max(windowMax, window);
  }
  std::printf("\nrounds %d, threads %d, pause %lld us: acknowledged %llu, missing %llu (%.4f%%), at most %llu in a "
              "round (%.2f ms of sending), refused %llu, integrity_check ok %d/%d, %.0f acknowledged/s\n",
              rounds, threads, static_cast<long long>(pause.count()), static_cast<unsigned long long>(acknowledgedAll),
              static_cast<unsigned long long>(missingAll),
              acknowledgedAll ? 100.0 * missingAll / acknowledgedAll : 0.0, static_cast<unsigned long long>(maxMissing),
              windowMax, static_cast<unsigned long long>(refusedAll), intact, rounds, acknowledgedAll / seconds);
  return intact == rounds ? 0 : 2;
}
