#include "session/reporting_session.h"

#include <gtest/gtest.h>

#include <limits>
#include <regex>
#include <thread>

#include "fakes/fake_platform.h"
#include "session/payload_keys.h"

namespace vireo {
namespace {

using testing::BackendAnswer;
using testing::FakePlatform;

class SessionTest : public ::testing::Test {
 protected:
  SessionTest() {
    p.logger.setVerbose(LogScope::Session);
    p.env->backendWaitInterval = 0.01;
  }
  std::shared_ptr<VRReportingSession> make(std::uint16_t serviceType = 2, std::int64_t id = 42) {
    auto s = VRReportingSession::initWithID(p.env, id, {100, 101});
    s->setServiceType(serviceType);
    s->setTransactionCompleteBlock([this](bool ok) { completions.push_back(ok); });
    return s;
  }
  // A started session with flat payloads filed directly, as orientation entries are.
  std::shared_ptr<VRReportingSession> withPayloads(std::uint16_t serviceType, std::vector<Dictionary> payloads,
                                                   const char* app = nullptr) {
    auto s = make(serviceType);
    Dictionary config{{"HostApplicationDisplayID", app ? app : ""}};
    if (app) s->setConfiguration(&config);
    s->start();
    auto array = s->aggregatedPayloadData();
    MutexLock guard(array->lock);
    for (auto& d : payloads) array->appendLocked(Value(std::move(d)), std::numeric_limits<std::size_t>::max());
    return s;
  }
  static Array entries(const VRReportingSession& s) {
    auto payloads = s.aggregatedPayloadData();
    if (!payloads) return {};
    MutexLock guard(payloads->lock);
    return payloads->arrayLocked();
  }

  FakePlatform p;
  std::vector<bool> completions;
};

TEST_F(SessionTest, CreationNamesConfigurationAndDestruction) {
  auto s = VRReportingSession::initWithID(p.env, 42, {7});
  auto created = p.logger.matching("created reporting session for ID: 42");
  ASSERT_EQ(created.size(), 1u);
  EXPECT_EQ(created[0].level, LogLevel::Info);
  EXPECT_EQ(created[0].function, "-[VRReportingSession initWithID:processIdentifiers:]");
  s->setServiceType(1);
  EXPECT_TRUE(p.logger.contains("setting service type vesper"));
  Dictionary first{{"a", 1}}, second{{"a", 2}, {"b", 3}};
  s->setConfiguration(&first);
  s->updateDefaults(&second);
  s->setConfiguration(nullptr);
  EXPECT_EQ(s->userInfo(), second);
  s->stop();  // never started: nothing happens
  p.dispatcher.runUntilIdle();
  EXPECT_TRUE(completions.empty());
  EXPECT_EQ(p.tracer.count(trace::kSessionStop), 0u);
  s.reset();
  EXPECT_EQ(p.tracer.count(trace::kSessionDestroy), 1u);
}

// Before start and after stop a message goes out on its own, without the session's user info.
TEST_F(SessionTest, MessagesWaitForTheBackendThenSummaryThenFlush) {
  // The backends come from the service's own thread, while the queue may be parked.
  p.telemetry.setBehaviour({BackendAnswer::List, true, false});
  auto s = make(2);
  Dictionary config{{"HostApplicationDisplayID", "x"}};
  s->setConfiguration(&config);
  s->sendMessage(Dictionary{{"a b", 1}}, 0x40000008, 4, nullptr);  // created: filed, then single
  EXPECT_EQ(entries(*s).size(), 1u);
  s->start();
  auto array = s->aggregatedPayloadData();
  s->start();
  EXPECT_TRUE(p.logger.contains("42 is already started"));
  EXPECT_EQ(s->aggregatedPayloadData(), array);
  EXPECT_TRUE(p.telemetry.created().empty());  // only on the session's queue
  // Submitted before the backend closure has run: must wait behind it.
  std::optional<bool> reply;
  s->sendMessage(Dictionary{{"n", 1}}, 0x40000003, 1, [&](bool v) { reply = v; });
  EXPECT_EQ(reply, false);
  s->sendMessage(Dictionary{{"n", 2}}, 0x40000003, 2, true, nullptr);
  p.dispatcher.runAll();
  ASSERT_TRUE(p.dispatcher.awaitUnparked());
  p.dispatcher.runAll();

  auto created = p.telemetry.created();
  ASSERT_EQ(created.size(), 1u);
  EXPECT_EQ(p.tracer.count(trace::kSessionStart), 1u);
  ASSERT_NE(s->skylarkReportingAgentToken(), nullptr);
  EXPECT_EQ(created[0].sessionInfo, (Dictionary{{"client_type", 19}, {"client_version", 2.0}, {"session_id", 42},
                                                {"batch_event", true},
                                                {"hierarchy_token", s->skylarkReportingAgentToken()->text}}));
  EXPECT_EQ(created[0].userInfo, (Dictionary{{"client_name", "com.orvane.vireo"}, {"service_name", "telephony_session"},
                                             {"HostApplicationDisplayID", "x"}}));
  auto telemetry = p.telemetry.lastSession();
  auto sent = telemetry->sent();
  ASSERT_EQ(sent.size(), 2u);
  EXPECT_EQ(sent[0], (testing::SentMessage{3, 1, Dictionary{{"n", 1}}}));  // low 16 bits of the category

  s->stop();
  EXPECT_EQ(s->aggregatedPayloadData(), nullptr);
  EXPECT_EQ(completions, std::vector<bool>{true});
  EXPECT_EQ(telemetry->flushes.load(), 0);  // flush waits on the queue behind the summary
  p.dispatcher.runAll();
  sent = telemetry->sent();
  ASSERT_EQ(sent.size(), 3u);
  EXPECT_EQ(sent[2].category & sent[2].type, 0xFFFF);  // both are 0xFFFF
  EXPECT_EQ(sent[2].payload.find("VR_Session_Summary_Event")->text(), "2");
  EXPECT_EQ(telemetry->flushes.load(), 1);
  EXPECT_EQ(s->skylarkReportingSession(), nullptr);

  s->sendMessage(Dictionary{{"c", 2}}, 3, 1, nullptr);  // stopped: not filed
  EXPECT_EQ(s->aggregatedPayloadData(), nullptr);
  p.dispatcher.runAll();
  EXPECT_EQ(p.logger.count("session not started, will send as a single message"), 2u);
  ASSERT_EQ(p.dispatcher.runLowPriority(), 2u);
  auto shots = p.telemetry.oneShots();
  ASSERT_EQ(shots.size(), 2u);
  EXPECT_EQ(shots[0], (testing::OneShotMessage{{8, 4, Dictionary{{"a_b", 1}}},
                                               Dictionary{{"client_type", 19}, {"client_version", 2.0}, {"session_id", -1}},
                                               Dictionary{{"client_name", "com.orvane.vireo"}, {"service_name", "telephony"}}}));
  EXPECT_EQ(shots[1].payload, (Dictionary{{"c", 2}}));
}

// Only top-level keys are cleaned; a later duplicate wins.
TEST_F(SessionTest, PayloadKeyCleaning) {
  EXPECT_EQ(cleanPayloadKeys(Dictionary{{"buffer size", 512}, {"a  b", 1}, {5, "five"}, {"n", Dictionary{{"x y", 1}}}}),
            (Dictionary{{"buffer_size", 512}, {"a__b", 1}, {5, "five"}, {"n", Dictionary{{"x y", 1}}}}));
  EXPECT_EQ(cleanPayloadKeys(Dictionary{{"a b", 1}, {"a_b", 2}}), (Dictionary{{"a_b", 2}}));
}

// Without an answer the queue stays parked for the whole interval, holding the
// message behind it; then the wait gives up, the telemetry session goes and the
// message is dropped, in that order.
TEST_F(SessionTest, BackendAnswers) {
  using namespace std::chrono_literals;
  struct Case { BackendAnswer answer; bool ownThread; double wait; bool kept; const char* line; };
  for (Case c : {Case{BackendAnswer::EmptyList, false, 0.01, true, "List of backends"},
                 Case{BackendAnswer::List, true, 30.0, true, "List of backends"},
                 Case{BackendAnswer::Nothing, false, 9.0, false,
                      "No backends found, this session won't get sent to the server"},
                 Case{BackendAnswer::Never, false, 9.0, false, nullptr}}) {
    SCOPED_TRACE(static_cast<int>(c.answer));
    p.logger.clear();
    p.telemetry.setBehaviour({c.answer, c.ownThread, false});
    p.env->backendWaitInterval = c.wait;
    auto s = make();
    s->start();
    s->sendMessage(Dictionary{{"n", 1}}, 3, 1, nullptr);
    p.dispatcher.runAll();
    if (c.ownThread) {
      ASSERT_TRUE(p.dispatcher.awaitUnparked());
    } else if (!c.kept) {
      EXPECT_EQ(p.dispatcher.parkedCount(), 1u);
      EXPECT_FALSE(p.logger.contains("failed to find backend"));
      EXPECT_FALSE(p.logger.contains("No valid SkylarkReportingSession"));
      EXPECT_EQ(p.dispatcher.advance(8999ms), 0u);
      p.dispatcher.runAll();
      EXPECT_FALSE(p.logger.contains("failed to find backend"));
      EXPECT_EQ(p.dispatcher.advance(1ms), 1u);
    }
    p.dispatcher.runAll();
    EXPECT_EQ(c.line ? p.logger.count(c.line) : 1u, 1u);
    EXPECT_EQ(s->skylarkReportingSession() != nullptr, c.kept);
    EXPECT_EQ(p.telemetry.lastSession()->sent().size(), c.kept ? 1u : 0u);
    using Lines = std::vector<std::pair<LogLevel, std::string>>;
    Lines wait;
    for (auto& e : p.logger.entries())
      if (e.function == "VRReportingUtilityWait" || e.message == "No valid SkylarkReportingSession")
        wait.emplace_back(e.level, e.message);
    // An answer from another thread may come after the wait began.
    if (c.ownThread) std::erase_if(wait, [](auto& line) { return line.first == LogLevel::Default; });
    EXPECT_EQ(wait, (c.kept ? Lines{}
                            : Lines{{LogLevel::Default, "waiting for skylarkreportingd to find backends"},
                                    {LogLevel::Error, "failed to find backend"},
                                    {LogLevel::Error, "No valid SkylarkReportingSession"}}));
    EXPECT_FALSE(s->skylarkReportingSessionStarted());
    s->stop();
    p.dispatcher.runAll();
    p.telemetry.dropHeld();
  }
}

TEST_F(SessionTest, TestServiceTypeNeverTouchesTelemetry) {
  auto s = make(11);
  s->start();
  s->sendMessage(Dictionary{{"n", 1}}, 3, 1, nullptr);
  p.dispatcher.runAll();
  EXPECT_TRUE(p.telemetry.created().empty());
  EXPECT_EQ(p.logger.count("transactions aren't allowed on this platform"), 1u);
  EXPECT_EQ(p.logger.count("No valid SkylarkReportingSession"), 0u);
  s->stop();
  p.dispatcher.runUntilIdle();
  EXPECT_EQ(completions, std::vector<bool>{true});

  // Switching to type 11 after the backend exists: stop keeps it and never flushes.
  auto t = make(2, 43);
  t->start();
  p.dispatcher.runAll();
  auto telemetry = t->skylarkReportingSession();
  ASSERT_NE(telemetry, nullptr);
  t->setServiceType(11);
  t->stop();
  p.dispatcher.runAll();
  EXPECT_EQ(t->skylarkReportingSession(), telemetry);
  EXPECT_EQ(p.telemetry.lastSession()->flushes.load(), 0);
}

// Only service 4 spreads its sends over a minute (97 % 60 = 37 s pins the range).
TEST_F(SessionTest, SingleMessageDelayNamesAndRefusal) {
  p.random.next = 97;
  VRReportingSession::sendSingleMessage(p.env, Dictionary{{"a b", 1}}, 0x40000008, 4, 4, nullptr, nullptr);
  for (std::uint16_t type : {2, 0xFFFF, 300})
    VRReportingSession::sendSingleMessage(p.env, Dictionary{}, 1, 0, type, nullptr, nullptr);
  using namespace std::chrono_literals;
  EXPECT_EQ(p.dispatcher.lowPriorityDelays(), (std::vector<std::chrono::nanoseconds>{37s, 0s, 0s, 0s}));
  EXPECT_TRUE(p.logger.contains("sending single message after delta 37 for service 4"));
  p.dispatcher.runLowPriority();
  auto shots = p.telemetry.oneShots();
  ASSERT_EQ(shots.size(), 4u);
  std::vector<std::string> names;
  for (auto& shot : shots) names.push_back(shot.userInfo.find("service_name")->text());
  EXPECT_EQ(names, (std::vector<std::string>{"alarms", "telephony", "unknown", "unknown"}));
  EXPECT_EQ(p.tracer.count(trace::kSessionSend), 4u);
  EXPECT_TRUE(p.logger.contains("category 1073741832 : type 4"));
  EXPECT_TRUE(p.logger.contains("\"a b\""));

  p.telemetry.setBehaviour({BackendAnswer::List, false, true});
  std::optional<std::optional<Error>> got;
  VRReportingSession::sendSingleMessage(p.env, Dictionary{}, 1, 0, 0, nullptr,
                                        [&](std::optional<Error> e) { got = e; });
  p.dispatcher.runLowPriority();
  ASSERT_TRUE(got.has_value());
  EXPECT_TRUE(got->has_value());
  auto lines = p.logger.matching("sendOneMessageWithSessionInfo refused by fake");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, LogLevel::Error);
}

// Queued work also keeps the session alive after its last owner lets go.
TEST_F(SessionTest, ConcurrentSendsCountEveryMessage) {
  auto s = make();
  s->start();
  auto sender = [&] {
    for (int i = 0; i < 200; ++i) s->sendMessage(Dictionary{{"i", i}}, 3, 1, nullptr);
  };
  std::thread a(sender), b(sender);
  a.join();
  b.join();
  EXPECT_EQ(s->messageTypeCounts().find("Playback_Start")->toInt64(), 400);
  EXPECT_EQ(entries(*s).size(), 400u);
  s.reset();
  EXPECT_FALSE(p.logger.contains("deallocing"));
  p.dispatcher.runAll();
  EXPECT_TRUE(p.logger.contains("deallocing this session 42"));
  EXPECT_EQ(p.telemetry.lastSession()->sent().size(), 400u);
}

// The user info filed first into the summary file is checked end to end.
TEST_F(SessionTest, SummaryJoinsValuesPerKeyAndAnEmptySessionSendsNone) {
  auto s = withPayloads(7, {Dictionary{{"a", 1}, {"b", "x"}}, Dictionary{{"a", 2}}, Dictionary{{"a", 2}}}, "player");
  EXPECT_EQ(s->createSummaryEventForSession(),
            (Dictionary{{"VR_Session_Summary_Event", "7"}, {"a", "1,2,2"}, {"b", "x"}}));
  auto empty = withPayloads(7, {});
  EXPECT_FALSE(empty->createSummaryEventForSession().has_value());
  empty->stop();
  p.dispatcher.runAll();
  EXPECT_FALSE(p.logger.contains("sending summary event"));
  EXPECT_TRUE(p.telemetry.lastSession()->sent().empty());
}

TEST_F(SessionTest, KeptPayloadsStayWithinTheirBudgetOldestDroppedFirst) {
  auto s = make(2);
  s->start();
  const std::size_t one = payloadFootprint(Value(Dictionary{{"Routing_Playback_Start_1", Dictionary{{"n", 1}}}}));
  p.env->maxKeptBytesPerSession = 3 * one + one / 2;
  for (int n = 1; n <= 6; ++n) s->sendMessage(Dictionary{{"n", n}}, 0x40000003, 1, nullptr);
  Array kept = entries(*s);
  ASSERT_EQ(kept.size(), 3u);
  EXPECT_EQ(kept[0], Value(Dictionary{{"Routing_Playback_Start_4", Dictionary{{"n", 4}}}}));
  EXPECT_EQ(p.env->keptPayloadsDropped.load(), 3u);
  EXPECT_EQ(p.logger.count("keeps more than MaxKeptBytesPerSession="), 1u);  // once per session
  // Every message is still delivered; only what the summary keeps is bounded.
  p.dispatcher.runAll();
  EXPECT_EQ(p.telemetry.lastSession()->sent().size(), 6u);
}

TEST_F(SessionTest, SummaryFilesOnInternalBuilds) {
  p.device.internalBuild.set(true);
  withPayloads(2, {Dictionary{{"a", 1}}}, "player")->createSummaryEventForSession();
  withPayloads(0xFFFF, {Dictionary{{"a", 1}}})->createSummaryEventForSession();
  withPayloads(300, {Dictionary{{"a", 1}}}, "../../etc/x")->createSummaryEventForSession();
  std::set<std::string> suffixes;
  for (auto& [path, text] : p.files.files()) {
    std::smatch m;
    ASSERT_TRUE(std::regex_match(path, m, std::regex(R"(/fake/logs/Audio/Reporting/\d{8}-\d{6}[+-]\d{4}(-vireo-.*))")))
        << path;
    suffixes.insert(m[1]);
    EXPECT_NE(text.find('\n'), std::string::npos);  // pretty-printed
  }
  EXPECT_EQ(suffixes, (std::set<std::string>{"-vireo-player-telephony.json", "-vireo-unknown-unknown.json",
                                             "-vireo-.._.._etc_x-unknown.json"}));

  // Failures are reported again at the write; an unserialisable summary writes no file.
  auto s = withPayloads(2, {Dictionary{{"x", std::numeric_limits<double>::quiet_NaN()}}});
  ASSERT_TRUE(s->createSummaryEventForSession().has_value());
  EXPECT_EQ(p.files.files().size(), 3u);
  auto first = p.logger.matching("dataWithJSONObject: ");
  auto second = p.logger.matching("jsonOutput writeToURL: ");
  ASSERT_EQ(first.size(), 1u);
  ASSERT_EQ(second.size(), 1u);
  EXPECT_EQ(first[0].message.substr(first[0].message.find(": ")),
            second[0].message.substr(second[0].message.find(": ")));
  EXPECT_EQ(first[0].level, LogLevel::Error);
  EXPECT_EQ(second[0].function, "-[VRReportingSession createSummaryEventForSession]");

  p.files.createDirectoryError.set(Error{kGeneralErrorDomain, 13, "denied"});
  withPayloads(2, {Dictionary{{"a", 1}}})->createSummaryEventForSession();
  EXPECT_TRUE(p.logger.contains("can't create logging directory at /fake/logs/Audio/Reporting: denied"));
  EXPECT_TRUE(p.logger.contains("jsonOutput writeToURL: denied"));
}

TEST_F(SessionTest, OrientationChangesAreRecordedWhileAnInternalTelephonySessionRuns) {
  using namespace std::chrono_literals;
  p.device.internalBuild.set(true);
  auto& orientation = p.orientation;
  auto s = withPayloads(2, {}, "phone");
  EXPECT_EQ(orientation.calls(),
            (std::vector<std::string>{"register device VRReportingService 42", "register ui VRReportingService 42"}));
  p.clock.advance(1234400us);
  orientation.fire(orientation.device, Orientation::LeftUp);
  p.clock.advance(59765600us);  // 61.0 s after start
  orientation.fire(orientation.ui, Orientation::Normal);
  auto late = orientation.device()["VRReportingService 42"];
  EXPECT_EQ(entries(*s), (Array{Dictionary{{"device_orientation", "left-up"}, {"device_orientation_time", 1.234}},
                                Dictionary{{"ui_orientation", "normal"}, {"ui_orientation_time", 61.0}}}));
  EXPECT_TRUE(p.logger.contains(
      "Orientation handler callback mode=device orientation=\"left-up\" app=\"phone\", time=1.234, "
      "id=\"VRReportingService 42\""));

  orientation.calls.set({});
  s->stop();
  EXPECT_EQ(orientation.calls(),
            (std::vector<std::string>{"unregister device VRReportingService 42", "unregister ui VRReportingService 42"}));
  late(Orientation::RightUp);  // in flight when stop dropped the payloads: nothing recorded
  p.dispatcher.runAll();
  const Dictionary summary = p.telemetry.lastSession()->sent().back().payload;
  EXPECT_EQ(*summary.find("device_orientation"), Value("left-up"));
  EXPECT_EQ(*summary.find("ui_orientation_time"), Value("61"));

  // Service type 7 records too, except on the excluded device class; other types never.
  struct Case { std::uint16_t type; std::optional<std::int32_t> deviceClass; bool reports; };
  for (const Case& c : {Case{7, 5, true}, Case{7, 6, false}, Case{0, {}, false}}) {
    SCOPED_TRACE(c.type);
    orientation.calls.set({});
    p.device.deviceClass.set(c.deviceClass);
    auto other = make(c.type, 7);
    other->start();
    EXPECT_EQ(orientation.calls().size(), c.reports ? 2u : 0u);
    other->stop();
    EXPECT_EQ(orientation.calls().size(), c.reports ? 4u : 0u);
  }
}

}  // namespace
}  // namespace vireo
