// libvireo-client's callbacks against the real daemon: answers delivered by the host's
// loop and by the event thread, the start answered at the stop, the disabled error's
// domain and code, and a service that dies with calls in flight.
#include <poll.h>
#include <signal.h>

#include <algorithm>
#include <future>
#include <mutex>
#include <stdexcept>

#include "service_fixture.h"

namespace vireo::itest {
namespace {

using client::Callback;
using client::Client;
using client::Done;
using client::Result;
using client::Status;

// Drives the connection as a host's main loop would, until done() or the timeout.
template <class Fn>
bool drive(Client& c, Fn&& done, std::chrono::milliseconds timeout = 5s) {
  auto until = std::chrono::steady_clock::now() + timeout;
  while (!done()) {
    if (std::chrono::steady_clock::now() > until) return false;
    pollfd p{c.fd(), static_cast<short>(c.events()), 0};
    int wait = c.timeout();
    ::poll(&p, 1, wait < 0 || wait > 50 ? 50 : wait);
    EXPECT_TRUE(c.process());
  }
  return true;
}

// What callbacks were given; they may run on the event thread.
struct Answers {
  std::mutex mu;
  int ok = 0;
  std::vector<std::string> errors;

  template <class T>
  Callback<T> record() {
    return [this](const Result<T>& r) {
      std::lock_guard lock(mu);
      if (r) ++ok;
      else errors.push_back(r.error().name);
    };
  }
  std::size_t errorCount() {
    std::lock_guard lock(mu);
    return errors.size();
  }
};

class ClientTest : public ServiceTest {};

TEST_F(ClientTest, CallbacksRunFromTheHostLoopAndTheStartIsAnsweredAtTheStop) {
  auto c = connect();
  ASSERT_TRUE(c);
  int prompt = 0, starts = 0;
  bool started = false;
  auto isTrue = [&](const Result<bool>& r) { prompt += r.ok() && *r; };
  ASSERT_TRUE(c->createReportingSession(5, isTrue));
  ASSERT_TRUE(c->setServiceType(2, 5, isTrue));
  ASSERT_TRUE(drive(*c, [&] { return prompt == 2; }));

  ASSERT_TRUE(c->getServiceNameForReporterID(5, [&](const Result<std::uint16_t>& r) { prompt += r.ok() && *r == 2; }));
  ASSERT_TRUE(c->getAllReporters([&](const Result<std::vector<std::int64_t>>& r) {
    prompt += r.ok() && std::count(r->begin(), r->end(), 5) == 1;
  }));
  ASSERT_TRUE(c->startReportingSessionForID(5, [&](const Result<bool>& r) {
    ++starts;
    started = r.ok() && *r;
  }));
  ASSERT_TRUE(c->sendMessage(Dictionary{{"k", 1}}, 3, 1, std::vector<std::int64_t>{5},
                             [&](const Status& s) { prompt += s.ok(); }));
  // A callback that throws is dropped; the connection goes on.
  ASSERT_TRUE(c->getAllReporters([&](const Result<std::vector<std::int64_t>>&) {
    ++prompt;
    throw std::runtime_error("thrown by the host");
  }));
  ASSERT_TRUE(drive(*c, [&] { return prompt == 6; }));
  drive(*c, [] { return false; }, 300ms);
  EXPECT_EQ(starts, 0);
  EXPECT_EQ(c->pendingCalls(), 1u);

  // The held start is answered by the stop; a blocking call meanwhile leaves it queued.
  ASSERT_TRUE(c->stopReportingSessionForID(5, isTrue));
  EXPECT_TRUE(c->ping());
  ASSERT_TRUE(drive(*c, [&] { return starts == 1 && prompt == 7; }));
  EXPECT_TRUE(started);
  EXPECT_EQ(c->pendingCalls(), 0u);
  EXPECT_EQ(*c->destroyReportingSession(5), true);
  drive(*c, [] { return false; }, 100ms);
  EXPECT_EQ(starts, 1);
}

TEST_F(ClientTest, RefusedSendCarriesDomainAndCodeOnTheEventThread) {
  auto c = connect();
  ASSERT_TRUE(c);
  writeFile(configDir_ + "/com.orvane.vireo.conf", "disable_reporting = true\n");
  ASSERT_TRUE(c->postNotification(client::kReportingNotification));
  Status blocking = Done{};
  ASSERT_TRUE(eventually([&] { return !(blocking = c->sendMessage(Dictionary{{"k", 1}}, 3, 1)).ok(); }));
  EXPECT_TRUE(blocking.error().isReportingDisabled());

  ASSERT_TRUE(c->startEventThread());
  std::promise<Status> answer;
  std::thread::id ranOn;
  ASSERT_TRUE(c->sendMessage(Dictionary{{"k", 1}}, 3, 1, std::vector<std::int64_t>{}, [&](const Status& s) {
    ranOn = std::this_thread::get_id();
    answer.set_value(s);
  }));
  auto future = answer.get_future();
  ASSERT_EQ(future.wait_for(5s), std::future_status::ready);
  Status refused = future.get();
  EXPECT_NE(ranOn, std::this_thread::get_id());
  ASSERT_FALSE(refused);
  EXPECT_EQ(refused.error().name, client::kReportingDisabledError);
  EXPECT_EQ(refused.error().domain, "com.orvane.audio.reporting");
  EXPECT_EQ(refused.error().code, 1);
}

TEST_F(ClientTest, EveryPendingCallbackFailsWhenTheServiceOrTheBusDies) {
  auto a = connect(), b = connect(), c = connect();
  ASSERT_TRUE(a && b && c);
  ASSERT_TRUE(a->startEventThread());
  Answers answers;
  ASSERT_EQ(*a->createReportingSession(1), true);
  ASSERT_EQ(*b->createReportingSession(2), true);
  ASSERT_TRUE(a->startReportingSessionForID(1, answers.record<bool>()));
  client::StartHandle held = b->startReportingSessionForID(2);
  ASSERT_TRUE(b->getAllReporters());

  // A stopped daemon keeps what comes next unanswered.
  daemon_.signal(SIGSTOP);
  ASSERT_TRUE(a->getAllReporters(answers.record<std::vector<std::int64_t>>()));
  ASSERT_TRUE(a->sendMessage(Dictionary{{"k", 1}}, 3, 1, std::nullopt, answers.record<Done>()));
  ASSERT_TRUE(c->createReportingSession(3, answers.record<bool>()));
  c.reset();  // its own call fails at once
  EXPECT_EQ(answers.errorCount(), 1u);

  daemon_.signal(SIGKILL);
  EXPECT_TRUE(eventually([&] { return answers.errorCount() == 4; }));
  EXPECT_TRUE(eventually([&] { return a->pendingCalls() == 0; }));
  EXPECT_EQ(answers.ok, 0);
  auto start = held.waitFor(5s);
  ASSERT_TRUE(start);
  EXPECT_FALSE(start->ok());
  EXPECT_FALSE(a->getAllReporters());

  // With the bus gone the connection reports it, and calls fail instead of waiting.
  bus_.signal(SIGKILL);
  EXPECT_TRUE(eventually([&] { return !b->process().ok(); }));
  EXPECT_FALSE(b->createReportingSession(4));
  if (a->createReportingSession(4, answers.record<bool>())) {
    EXPECT_TRUE(eventually([&] { return answers.errorCount() == 5; }));
  }
}

}  // namespace
}  // namespace vireo::itest
