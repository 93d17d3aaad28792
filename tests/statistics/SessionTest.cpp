#include "Statistics/VXReportingTallyhubBridge.h"
#include "Statistics/VXReportingWattmarkUtility.h"
#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

TEST_F(SessionTest, NumbersPerKindAcrossRestartsAndStates) {
  const auto s = make();
  EXPECT_EQ(s->messageIdForCategory(kSetup, 1), "Session_Setup_Start_1");
  s->sendMessage(message, kSetup, 1, nullptr);  // into the initial arrays
  EXPECT_EQ(s->nestedAggregatedPayloadData()->size(), 1u);
  s->start();
  EXPECT_TRUE(s->nestedAggregatedPayloadData()->empty());
  s->sendMessage(message, kSetup, 1, nullptr);
  s->sendMessage(message, 3, 4, nullptr);
  EXPECT_THAT(texts(s->nestedAggregatedPayloadData()),
              ElementsAre("{Session_Setup_Start_3={a=1}}", "{Playback_Error_1={a=1}}"));
  s->start();  // already
  EXPECT_EQ(s->aggregatedPayloadData()->size(), 2u);
  s->stop();
  EXPECT_EQ(s->aggregatedPayloadData(), std::nullopt);
  s->sendMessage(message, kSetup, 1, nullptr);  // numbered, kept nowhere
  EXPECT_EQ(s->nestedAggregatedPayloadData(), std::nullopt);
  EXPECT_EQ(s->messageIdForCategory(kSetup, 1), "Session_Setup_Start_5");
  // 6 and 7 are both named Undefined: one kind.
  EXPECT_EQ(s->messageIdForCategory(0, 6), "Undefined_Undefined_1");
  EXPECT_EQ(s->messageIdForCategory(12, 7), "Undefined_Undefined_2");
}

TEST_F(SessionTest, KeysAreNormalisedAndTheLaterOfTwoStays) {
  const Payload odd = dictionary("a b", 1, "c", dictionary("d e", 2), "a_b", 3, " f g ", "h i");
  const std::string normal = "{a_b=3,c={d e=2},_f_g_=h i}";
  EXPECT_EQ(VXReportingSession::normalizePayloadKeys(odd).text(), normal);
  const auto s = startedSession();
  s->sendMessage(odd, 3, 1, nullptr);
  run();
  EXPECT_EQ(p.vyr.sent.at(0).payload.text(), normal);
  EXPECT_THAT(texts(s->aggregatedPayloadData()), ElementsAre(normal));
  EXPECT_THAT(texts(s->nestedAggregatedPayloadData()),
              ElementsAre("{Playback_Start_1=" + normal + "}"));
}

TEST_F(SessionTest, AWholeLifeInOrder) {
  p.log.verbose = true;
  mark();
  auto s = make();
  s->start();
  s->sendMessage(message, kSetup, 1, VXReportingSession::Sync::Yes,
                 [&](const auto& error) { p.journal.push_back(error ? "reply error" : "reply"); });
  run();
  s->stop();
  s->sendMessage(message, kSetup, 1, nullptr);
  s.reset();
  run();
  EXPECT_EQ(told("a life"), dataFile("life.txt"));
  EXPECT_THAT(p.queues.made.back(),
              Pair("com.quorvel.sonik.session.vyrreporting", QualityOfService::Utility));
  EXPECT_EQ(p.log.registrations.back(),
            "vxrr 1987605106 com.quorvel.sonik reporting_session_verbose 31");
}

TEST_F(SessionTest, ARestartIsAWholeLifeAgain) {
  const auto s = make();
  for (const unsigned round : {1u, 2u}) {
    s->start();
    s->sendMessage(message, 3, 1, nullptr);
    s->stop();
    run();
    EXPECT_EQ(s->vyrReportingSession(), nullptr);
    EXPECT_EQ(p.vyr.tokens, static_cast<int>(round));
    EXPECT_EQ(p.vyr.sent.size(), 2 * round);
    EXPECT_EQ(p.vyr.sent.back().payload.text(), "{VX_Session_Summary_Event=0,a=1}");
  }
  EXPECT_EQ(s->messageIdForCategory(0xFFFFFFFF, 0xFFFF), "Undefined_Unknown_3");
}

TEST_F(SessionTest, RelaySessionCarriesWhatTheSetUpTookAndTestSessionsHaveNone) {
  for (const auto& [type, name] : {std::pair(ServiceType{7}, "longformaudio"), {12, "apiusage"}}) {
    const auto s = make(type);
    EXPECT_FALSE(s->shouldReportOrientation()) << "not on this build";
    s->start();
    s->setServiceType(3);  // too late for the names
    // In time: the set-up holds the dictionary itself.
    s->setConfiguration(dictionary("HostApplicationDisplayID", "app", "b", 1));
    s->updateDefaults(dictionary("b", 2));
    s->setConfiguration(std::nullopt);
    run();
    const auto& relay = *p.vyr.sessions.back();
    EXPECT_EQ(relay.userInfo.text(),
              "{clientName=com.quorvel.sonik,serviceName=" + std::string(name) +
                  "_session,HostApplicationDisplayID=app,b=2}");
    EXPECT_EQ(relay.info, (VyrSessionInfo{{"clientType", int32_t{19}},
                                          {"clientVersion", 2.0f},
                                          {"sessionID", int64_t{42}},
                                          {"batchEvent", type != 12},
                                          {"hierarchyToken", s->vyrReportingAgentToken()},
                                          {"containsRealtimeEvents", type == 12}}));
    EXPECT_EQ(s->vyrReportingSession(), p.vyr.sessions.back());
  }
  EXPECT_EQ(p.queues.blockingScopes, 2);
  EXPECT_EQ(p.log.registrations.size(), 3u) << "one for all sessions";
  mark();
  const auto test = startedSession(11);
  test->sendMessage(message, 3, 1, nullptr);
  test->stop();
  run();
  EXPECT_THAT(gained({"relay"}), IsEmpty());
  EXPECT_EQ(p.vyr.tokens, 2);
  test->sendMessage(message, 3, 1, nullptr);  // not started: alone, like any other
  run();
  EXPECT_EQ(p.vyr.oneOffs.size(), 1u);
}

TEST_F(SessionTest, NoBackEndsDropsMessagesAfterNineSeconds) {
  for (const bool late : {false, true}) {
    p.vyr.backends = std::nullopt;
    if (late) p.vyr.configurationAfter = 20s;
    const auto s = make();
    s->start();
    s->sendMessage(message, 3, 1, nullptr);
    const Monotonic before = p.clock.monotonic();
    mark();
    run();
    EXPECT_EQ(p.clock.monotonic() - before, 9s);
    EXPECT_EQ(s->vyrReportingSession(), nullptr);
    EXPECT_THAT(gained({"log vxrr error"}).back(), HasSubstr("No valid VyrReportingSession"));
  }
  p.threading.passTimeUntil(p.clock.monotonic() + 30s);  // answered at last
}

TEST_F(SessionTest, FailedSendsAreSilentAndFailedFlushesLogged) {
  const auto s = startedSession();
  p.vyr.sendError = p.vyr.flushError = Error{"x", 5, "broken"};
  mark();
  s->sendMessage(Payload(), 0x40000007, 2, nullptr);
  run();
  EXPECT_THAT(gained(), ElementsAre("trace 0x21042838", "relay 7 2"));
  s->stop();
  run();
  EXPECT_EQ(p.log.lines.back(), "vxrr error flush error broken (x, code 5)");
  EXPECT_EQ(s->vyrReportingSession(), nullptr);
}

TEST_F(SessionTest, SinglesAreTakenAsTheyAreAndThoseOfAlarmsSpreadOverAMinute) {
  const auto s = make(4);
  s->setConfiguration(dictionary("secret", 1));
  p.services.random = 59;
  p.vyr.sendError = Error{"x", 5, "broken"};
  s->sendMessage(dictionary("a b c", 1), 0x40000007, 2, nullptr);
  s->start();  // too late for it
  p.queues.advance(58999ms);
  EXPECT_EQ(p.services.randomBound, 60u);
  EXPECT_THAT(gained({"one-off"}), IsEmpty());
  std::optional<Error> answer;
  VXReportingSession::sendSingleMessage(message, 1, 1, 5, message,
                                        [&](const auto& error) { answer = error; });
  run();
  EXPECT_EQ(answer, p.vyr.sendError);
  EXPECT_EQ(p.log.lines.back(), "vxrr error sendOneMessageWithSessionInfo broken (x, code 5)");
  p.vyr.sendError.reset();
  VXReportingSession::sendSingleMessage(dictionary("d e", 1), 1, 1, 5, message, nullptr);
  p.queues.advance(1ms);
  EXPECT_EQ(p.vyr.oneOffs.at(0).payload.text(), "{d_e=1}");
  const auto& single = p.vyr.oneOffs.at(1);
  EXPECT_EQ(single.category, 7);
  EXPECT_EQ(single.payload.text(), "{a_b_c=1}");
  EXPECT_EQ(single.userInfo.text(), "{clientName=com.quorvel.sonik,serviceName=alarms}");
  EXPECT_EQ(single.info,
            (VyrSessionInfo{
                {"clientType", int32_t{19}}, {"clientVersion", 2.0f}, {"sessionID", int32_t{-1}}}));
}

TEST_F(SessionTest, DelayedSinglesGoOutInTheirOrderWhenSomebodyIsInAHurryAndOnce) {
  const auto single = [&](int64_t number, uint32_t delay) {
    p.services.random = delay;
    VXReportingSession::sendSingleMessage(dictionary("n", number), 1, 1, 4, std::nullopt, nullptr);
  };
  const auto sent = [&] {
    std::string numbers;
    for (const auto& one : p.vyr.oneOffs) numbers += one.payload.find("n")->text() + " ";
    return numbers;
  };
  VXReportingDelayedMessages& delayed = VXReportingProcessState::current().delayedMessages();
  // Those that are too many do not wait.
  for (std::size_t i = 0; i < VXReportingDelayedMessages::kMostMessages; ++i) single(0, 20);
  run();
  EXPECT_EQ(sent(), "");
  p.queues.advance(1s);
  for (int i = 0; i < 3; ++i) single(1, 59);
  run();
  EXPECT_EQ(p.vyr.oneOffs.size(), 3u);
  EXPECT_EQ(delayed.size(), VXReportingDelayedMessages::kMostMessages);
  p.queues.advance(59s);
  EXPECT_EQ(p.vyr.oneOffs.back().payload.find("n")->asInt64(), 1);
  p.vyr.oneOffs.clear();
  single(1, 30);
  single(2, 10);
  single(3, 30);
  p.queues.advance(10s);
  EXPECT_EQ(sent(), "2 ");
  single(4, 5);
  delayed.sendAllFromNow();
  EXPECT_EQ(sent(), "2 4 1 3 ");
  p.queues.advance(60s);
  EXPECT_EQ(p.vyr.oneOffs.size(), 4u);
  single(5, 50);  // of work that was still queued
  run();
  EXPECT_EQ(sent(), "2 4 1 3 5 ");
  EXPECT_EQ(delayed.size(), 0u);
}

TEST_F(SessionTest, PowerRecords) {
  const auto s = make();
  s->setConfiguration(dictionary("HostApplicationDisplayID", 7));
  const struct {
    Payload sent;
    const char* record;
    MessageType type = 6;
  } cases[] = {{dictionary("EngineOnTime", 0, "Haptic_Active_Hardware_Time_Seconds", 1),
                "Lumo_Haptics {EngineOnDuration=0,ApplicationName=7}"},
               {dictionary("Active_Clients", "x", "vxreporting_timestamp", 1,
                           "Haptic_Active_Hardware_Time_Seconds", 1.5),
                "LeakedHapticsSessionInfo "
                "{Haptic_Active_Hardware_Time_Seconds=1.5,Active_Clients=x}"},
               {dictionary("EngineOnTime", 2), "", 5},
               {message, ""}};
  for (const auto& [sent, expected, type] : cases) {
    p.services.powers.clear();
    VXReportingWattmarkUtility::handleEvent(&sent, 1, type, s.get());
    std::string records;
    for (const auto& power : p.services.powers) records += power.name + " " + power.record.text();
    EXPECT_EQ(records, expected);
  }
  EXPECT_EQ(p.log.lines.back(), "system error failed to get VXReporting timestamp for wattmark");
  VXReportingWattmarkUtility::handleEvent(nullptr, 1, 6, nullptr);
  VXReportingTallyhubBridge::handleEvent(nullptr, 0x10000009, 0xFFFF, nullptr);
  EXPECT_EQ((*p.services.events.back().builder)().text(), "{HostApplicationDisplayID=Unknown}");
}

class OrientationTest : public SessionTest {
 protected:
  OrientationTest() { p.services.internalBuild = true; }
};

TEST_F(OrientationTest, HandlersComeAndGoInOrderWhereAllThreeConditionsHold) {
  for (const ServiceType type : {ServiceType{2}, ServiceType{8}})
    EXPECT_EQ(make(type)->shouldReportOrientation(), type == 2);
  const auto s = make(7);
  s->start();
  EXPECT_THAT(gained({"register"}), ElementsAre("register device VXReportingService 42",
                                                "register interface VXReportingService 42"));
  s->stop();
  EXPECT_THAT(gained({"register", "0x21042830"}),
              ElementsAre("unregister device VXReportingService 42",
                          "unregister interface VXReportingService 42", "trace 0x21042830"));
  s->stop();
  EXPECT_THAT(gained({"register"}), IsEmpty());
  s->start();
  s->setStarted(false);  // not started, and registered all the same
  mark();
  s->stop();
  EXPECT_EQ(gained({"register"}).size(), 2u);
  s->start();
  s->setServiceType(3);
  mark();
  s->stop();
  EXPECT_THAT(gained({"register"}), IsEmpty()) << "asked with the type of the moment";
  p.services.deviceHandlers.clear();
  p.services.interfaceHandlers.clear();
  const auto one = make(7), other = make(7);  // of the same identifier
  one->start();
  other->start();
  one->stop();
  EXPECT_EQ(p.services.deviceHandlers.size(), 1u);
  EXPECT_EQ(p.services.interfaceHandlers.size(), 1u);
  other->stop();
  p.services.deviceClass = 6;
  EXPECT_FALSE(make(7)->shouldReportOrientation());
}

TEST_F(OrientationTest, ChangesAreStampedToTheMillisecondInTheFlatAggregateOnly) {
  const auto s = make(2);
  s->start();
  const auto device = p.services.deviceHandlers.begin()->second;
  const auto interface = p.services.interfaceHandlers.begin()->second;
  p.clock.advance(1000400us);
  (*device)(3);
  p.clock.advance(11345200us);
  p.log.verbose = true;
  (*interface)(4);
  EXPECT_EQ(p.log.lines.back(),
            "vxrr debug Orientation handler callback mode=ui orientation=\"o4\" app=\"(null)\", "
            "time=12.346, id=\"VXReportingService 42\"");
  p.clock.wall -= 102345600us;  // set back
  (*device)(3);
  EXPECT_THAT(texts(s->aggregatedPayloadData()),
              ElementsAre("{device_orientation=o3,device_orientation_time=1}",
                          "{ui_orientation=o4,ui_orientation_time=12.346}",
                          "{device_orientation=o3,device_orientation_time=-90}"));
  EXPECT_TRUE(s->nestedAggregatedPayloadData()->empty());
  s->stop();
  EXPECT_EQ(p.services.files.size(), 1u);
  (*device)(5);  // still under way when it was unregistered
  EXPECT_EQ(s->aggregatedPayloadData(), std::nullopt);
}

}  // namespace
}  // namespace vx
