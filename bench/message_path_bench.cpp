// The daemon's own work per message, without the bus: each step a message of
// message_load's 20-entry payload goes through between sd-bus handing it over and the
// store's writer taking its row, timed alone and all together.
//
//   floor        what message_load's floor server does per message: decode the arguments
//   clean        the payload with its keys cleaned (one copy of the tree)
//   identifier   the session's numbered message identifier ("category_type_N")
//   keep         the entry kept for the summary, packed
//   json         the payload as the JSON of a store column
//   all          decode, clean, identifier, keep, and JSON twice (telemetry and analytics rows)
//
// x_floor on each line is its time over the floor's, measured in the same run, so a
// shared, noisy machine moves both alike. Queues, locks, the log and SQLite are left
// out: message_load measures the path with them.
//
// Run: message_path_bench --benchmark_repetitions=3 --benchmark_report_aggregates_only=true
#include <benchmark/benchmark.h>
#include <sys/socket.h>
#include <systemd/sd-bus.h>

#include <cstdio>
#include <cstdlib>
#include <map>
#include <string>

#include "base/value_pack.h"
#include "load_common.h"
#include "platform/dbus/send_message_arguments.h"
#include "platform/dbus/value_codec.h"
#include "session/payload_keys.h"
#include "vocabulary/reporting_utility.h"

namespace {

using namespace vireo;

constexpr std::uint32_t kCategory = 0x40000003;
constexpr std::uint16_t kType = 1;

// One SendMessage call, sealed, read again and again. sd-bus builds messages only on a
// started bus; one end of a socket pair is enough and nothing is sent on it.
class SealedCall {
 public:
  SealedCall() {
    int fds[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0 || sd_bus_new(&bus_) < 0 ||
        sd_bus_set_fd(bus_, fds[0], fds[0]) < 0 || sd_bus_start(bus_) < 0 ||
        sd_bus_message_new_method_call(bus_, &m_, "com.orvane.vireo.Reporting1", "/com/orvane/vireo/Reporting1",
                                       "com.orvane.vireo.Reporting1", "SendMessage") < 0 ||
        dbus::appendStringDictionary(m_, bench::makePayload()) < 0 ||
        sd_bus_message_append(m_, "uqb", kCategory, kType, 1) < 0 ||
        sd_bus_message_append(m_, "ax", 1, std::int64_t{7}) < 0 || sd_bus_message_seal(m_, 1, 0) < 0) {
      std::fputs("cannot build the SendMessage call\n", stderr);
      std::exit(1);
    }
  }
  ~SealedCall() {
    sd_bus_message_unref(m_);
    sd_bus_flush_close_unref(bus_);
  }
  dbus::SendMessageArguments decode() const {
    dbus::SendMessageArguments args;
    sd_bus_error error = SD_BUS_ERROR_NULL;
    if (sd_bus_message_rewind(m_, 1) < 0 || dbus::readSendMessageArguments(m_, &args, &error) < 0) {
      std::fprintf(stderr, "decode failed: %s\n", error.message ? error.message : "?");
      std::exit(1);
    }
    return args;
  }

 private:
  sd_bus* bus_ = nullptr;
  sd_bus_message* m_ = nullptr;
};

const SealedCall& call() {
  static const SealedCall c;
  return c;
}

// As a session numbers its messages: the per-kind count lives in a dictionary.
std::string identifier(Dictionary& counts) {
  std::string kind = VRReportingCategoryName(kCategory) + "_" + VRReportingTypeName(kType);
  std::int64_t count = 1;
  if (const Value* existing = counts.find(kind)) count = existing->toInt64().value_or(0) + 1;
  counts.set(Value(kind), Value(static_cast<long long>(count)));
  return kind + "_" + std::to_string(count);
}

std::string kept(std::string id, const Value& cleaned) {
  Dictionary entry;
  entry.set(Value(std::move(id)), cleaned);
  std::string packed = packValue(Value(std::move(entry)));
  packed.shrink_to_fit();
  return packed;
}

std::string json(const Dictionary& d) {
  std::string out;
  appendJson(out, d, JsonMode::Lenient, false);
  return out;
}

void BM_Floor_Decode(benchmark::State& state) {
  for (auto _ : state) benchmark::DoNotOptimize(call().decode());
}

void BM_Clean(benchmark::State& state) {
  const Dictionary payload = call().decode().payload;
  for (auto _ : state) benchmark::DoNotOptimize(cleanPayloadKeys(payload));
}

void BM_Identifier(benchmark::State& state) {
  Dictionary counts;
  for (auto _ : state) benchmark::DoNotOptimize(identifier(counts));
}

void BM_Keep(benchmark::State& state) {
  const Value cleaned(cleanPayloadKeys(call().decode().payload));
  for (auto _ : state) benchmark::DoNotOptimize(kept("telemetry_message_1", cleaned));
}

void BM_Json(benchmark::State& state) {
  const Dictionary cleaned = cleanPayloadKeys(call().decode().payload);
  for (auto _ : state) benchmark::DoNotOptimize(json(cleaned));
}

void BM_All(benchmark::State& state) {
  Dictionary counts;
  for (auto _ : state) {
    dbus::SendMessageArguments args = call().decode();
    benchmark::DoNotOptimize(json(args.payload));  // the analytics row, from the payload as sent
    const Value cleaned(cleanPayloadKeys(args.payload));
    benchmark::DoNotOptimize(kept(identifier(counts), cleaned));
    benchmark::DoNotOptimize(json(*cleaned.asDictionary()));  // the telemetry row
  }
}

BENCHMARK(BM_Floor_Decode);
BENCHMARK(BM_Clean);
BENCHMARK(BM_Identifier);
BENCHMARK(BM_Keep);
BENCHMARK(BM_Json);
BENCHMARK(BM_All);

// Adds x_floor (time over the floor's, median against median) to every line once the
// run is over; the console reporter prints what it is given.
class RatioReporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& r : runs) {
      if (r.run_type == Run::RT_Aggregate && r.aggregate_name != "median") continue;
      pending_.push_back(r);
    }
  }
  void Finalize() override {
    double floor = 0;
    for (const Run& r : pending_)
      if (r.run_name.function_name == "BM_Floor_Decode") floor = r.GetAdjustedRealTime();
    for (Run& r : pending_)
      if (floor > 0) r.counters["x_floor"] = benchmark::Counter(r.GetAdjustedRealTime() / floor);
    ConsoleReporter::ReportRuns(pending_);
    ConsoleReporter::Finalize();
  }

 private:
  std::vector<Run> pending_;
};

}  // namespace

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  RatioReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  benchmark::Shutdown();
  return 0;
}
