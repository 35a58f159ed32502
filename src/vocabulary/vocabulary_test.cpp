#include "vocabulary/reporting_utility.h"

#include <gtest/gtest.h>

#include <chrono>
#include <mutex>
#include <thread>

#include "dispatch/thread_pool.h"
#include "fakes/fake_platform.h"

namespace vireo {
namespace {

using testing::FakePlatform;
using namespace std::chrono_literals;

// The label tables are not restated entry by entry (messages and events carry their
// labels in the session, sink and end-to-end tests); here the rules around them.
TEST(VocabularyLabels, UnrecognisedAndOutOfRangeCodes) {
  // An unrecognised area keeps a bare separator; combined area bits are not recognised.
  for (auto [category, name] : {std::pair{0x00010005u, "_Setup"}, {0x30000001u, "_Generic"}, {0x0000FFFFu, "Undefined"},
                                {0xFFFFFFFFu, "Undefined"}})
    EXPECT_EQ(VRReportingCategoryName(category), name) << category;
  EXPECT_EQ(VRReportingTypeName(0x0001FFFF), "Undefined");
  EXPECT_EQ(VRReportingServiceTypeName(0x0001FFFF), std::nullopt);
  EXPECT_EQ(VRReportingServiceTypeName(65534), std::nullopt);
  EXPECT_EQ(serviceNameOrUnknown(12), "unknown");
}

// The bounded wait on a queue run by hand, with manual time for its deadlines.
class BoundedWait : public ::testing::Test {
 protected:
  // Starts a wait from a closure on the queue, with another closure queued behind it.
  void start(std::shared_ptr<ReportingCondition> condition, double interval) {
    queue->async([this, condition, interval] {
      VRReportingUtilityWaitAsync(queue, condition, "waiting", "gave up", p.logger, LogScope::Session, interval,
                                  [this](bool done) { events.push_back(done ? "done" : "failed"); });
    });
    queue->async([this] { events.push_back("behind"); });
    p.dispatcher.runAll();
  }
  std::vector<std::string> lines() const {
    std::vector<std::string> out;
    for (auto& e : p.logger.entries()) out.push_back(e.message);
    return out;
  }

  FakePlatform p;
  std::shared_ptr<SerialQueue> queue = p.dispatcher.makeSerialQueue("waiter", QoS::Utility);
  std::vector<std::string> events;  // on the test's thread only
};

// Giving up after a silent interval is checked through the session's backend wait.
TEST_F(BoundedWait, SetFlagEndsAtOnceAndALateSignalDoesNot) {
  start(std::make_shared<ReportingCondition>(true), 30.0);
  EXPECT_EQ(events, (std::vector<std::string>{"done", "behind"}));
  EXPECT_EQ(p.logger.size(), 0u);
  EXPECT_EQ(p.dispatcher.parkedCount(), 0u);

  // A signal after the deadline passed, before the queue ran on: too late.
  events.clear();
  auto late = std::make_shared<ReportingCondition>();
  start(late, 9.0);
  EXPECT_EQ(p.dispatcher.parkedCount(), 1u);  // the queue waits, the closure behind too
  EXPECT_TRUE(events.empty());
  p.dispatcher.advance(9s);
  late->signalDone();
  late->signalDone();  // the second finds the wait already over
  p.dispatcher.runAll();
  EXPECT_EQ(lines(), (std::vector<std::string>{"waiting", "gave up"}));
  EXPECT_EQ(p.logger.entries()[1].scope, LogScope::Session);
  EXPECT_EQ(events, (std::vector<std::string>{"failed", "behind"}));
  EXPECT_TRUE(late->done());
}

// On the real pool, signals from another thread and deadlines race the queues.
TEST(BoundedWaitOnThePool, SignalledWaitsEndDoneAndSilentOnesGiveUp) {
  constexpr int kWaits = 400;
  FakePlatform p;
  ThreadPoolDispatcher pool;
  std::mutex mu;  // guards outcomes
  std::vector<std::string> outcomes(kWaits);
  std::vector<std::shared_ptr<ReportingCondition>> conditions;
  for (int i = 0; i < kWaits; ++i) {
    auto q = pool.makeSerialQueue("waiter", QoS::Utility);
    auto c = conditions.emplace_back(std::make_shared<ReportingCondition>());
    auto record = [&, i](const char* what) {
      std::lock_guard lock(mu);
      outcomes[i] += what;
    };
    // The odd ones are signalled; the even ones hear nothing for 50 ms.
    q->async([&p, q, c, record, interval = i % 2 ? 30.0 : 0.05] {
      VRReportingUtilityWaitAsync(q, c, "waiting", "gave up", p.logger, LogScope::Session, interval,
                                  [record](bool done) { record(done ? "done" : "failed"); });
    });
    q->async([record] { record(" behind"); });
  }
  // Each signalled wait must have begun, or the flag alone would end it.
  for (auto until = std::chrono::steady_clock::now() + 30s;
       p.logger.count("waiting") < kWaits && std::chrono::steady_clock::now() < until;)
    std::this_thread::sleep_for(1ms);
  for (int i = 1; i < kWaits; i += 2) conditions[i]->signalDone();  // from outside the pool
  ASSERT_TRUE(pool.drain(30s));
  std::lock_guard lock(mu);
  for (int i = 0; i < kWaits; ++i) EXPECT_EQ(outcomes[i], i % 2 ? "done behind" : "failed behind") << i;
  EXPECT_EQ(p.logger.count("continuing"), kWaits / 2u);
}

}  // namespace
}  // namespace vireo
