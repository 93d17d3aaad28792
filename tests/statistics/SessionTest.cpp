#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

class SessionTest : public ServiceTest {
 protected:
  std::shared_ptr<VXReportingSession> make(ReporterID id = 42, ServiceType type = 0) {
    auto made = VXReportingSession::initWithID(id, {200});
    if (type != kServiceTypeUnknown) made->setServiceType(type);
    return made;
  }
  void run() { p.queues.runAll(); }
  std::vector<std::string> texts(const std::optional<std::vector<Payload>>& payloads) {
    std::vector<std::string> all;
    for (const Payload& payload : payloads.value_or(std::vector<Payload>()))
      all.push_back(payload.text());
    return all;
  }
  const OnServiceQueue here_{p};
};

TEST_F(SessionTest, NumbersPerKindAcrossRestartsAndStates) {
  const auto s = make();
  EXPECT_EQ(s->messageIdForCategory(kSetup, 1), "Session_Setup_Start_1");
  s->sendMessage(message(), kSetup, 1, nullptr);  // into the initial arrays
  EXPECT_EQ(s->nestedAggregatedPayloadData()->size(), 1u);
  s->start();
  EXPECT_TRUE(s->nestedAggregatedPayloadData()->empty());
  s->sendMessage(message(), kSetup, 1, nullptr);
  s->sendMessage(message(), 3, 4, nullptr);
  EXPECT_THAT(texts(s->nestedAggregatedPayloadData()),
              ElementsAre("{Session_Setup_Start_3={a=1}}", "{Playback_Error_1={a=1}}"));
  s->stop();
  EXPECT_EQ(s->aggregatedPayloadData(), std::nullopt);
  s->sendMessage(message(), kSetup, 1, nullptr);  // numbered, kept nowhere
  EXPECT_EQ(s->nestedAggregatedPayloadData(), std::nullopt);
  EXPECT_EQ(s->messageIdForCategory(kSetup, 1), "Session_Setup_Start_5");
  // 6 and 7 are both named Undefined: one kind.
  EXPECT_EQ(s->messageIdForCategory(0, 6), "Undefined_Undefined_1");
  EXPECT_EQ(s->messageIdForCategory(12, 7), "Undefined_Undefined_2");
}

TEST_F(SessionTest, KeysAreNormalisedAndTheLaterOfTwoStays) {
  const Payload odd = PayloadBuilder()
                          .set("a b", 1)
                          .set("c", PayloadBuilder().set("d e", 2).build())
                          .set("a_b", 3)
                          .set(" f g ", "h i")
                          .build();
  EXPECT_EQ(VXReportingSession::normalizePayloadKeys(odd).text(), "{a_b=3,c={d e=2},_f_g_=h i}");
  const auto s = make();
  s->start();
  s->sendMessage(odd, 3, 1, nullptr);
  run();
  const std::string sent = p.vyr.sent.at(0).payload.text();
  EXPECT_EQ(sent, "{a_b=3,c={d e=2},_f_g_=h i}");
  EXPECT_THAT(texts(s->aggregatedPayloadData()), ElementsAre(sent));
  EXPECT_THAT(texts(s->nestedAggregatedPayloadData()),
              ElementsAre("{Playback_Start_1=" + sent + "}"));
}

TEST_F(SessionTest, AWholeLifeInOrder) {
  p.log.verbose = true;
  auto gained = during([&] {
    auto s = make();
    s->start();
    s->sendMessage(message(), kSetup, 1, VXReportingSession::Sync::Yes, [&](const auto& error) {
      p.journal.push_back(error ? "reply error" : "reply");
    });
    run();
    s->stop();
    s->sendMessage(message(), kSetup, 1, nullptr);
    s.reset();
    run();
  });
  EXPECT_THAT(
      gained,
      ElementsAre(
          "log vxrr info created reporting session for ID: 42", "trace 0x21042828",
          "log vxrr info setting service type generic",
          "log vxrr debug starting session owned by 42", "trace 0x2104282C",
          "log vxrr debug sending message for session owned by 42", "trace 0x21042838", "reply",
          "relay session", "log vxrr default waiting for vyrreportingd to find backends",
          "log vxrr default List of backends (store)", "log vxrr default continuing", "relay 5 1",
          "log vxrr debug VyrReportingAgent <relay> : message {a=1} : category 134217733 : type 1",
          "log vxrr debug ending session 42", "log vxrr debug ending session 42",
          "trace 0x21042830", "log vxrr default sending summary event for reporter 42",
          "log vxrr debug sending message for session owned by 42", "trace 0x21042838",
          "log vxrr debug sending message for session owned by 42", "trace 0x21042838",
          "relay 65535 65535",
          "log vxrr debug VyrReportingAgent <relay> : message {VX_Session_Summary_Event=0,a=1} : "
          "category -1 : type 65535",
          "flush", "log vxrr debug session not started, will send as a single message",
          "log vxrr debug sending single message after delta 0 for service 0", "trace 0x21042834",
          "log vxrr info deallocing this session 42", "trace 0x21042838",
          "log vxrr debug sending single message", "one-off 5 1",
          "log vxrr debug message {a=1} : category 134217733 : type 1"));
  EXPECT_EQ(p.queues.made.back(),
            (std::pair<std::string, QualityOfService>("com.quorvel.sonik.session.vyrreporting",
                                                      QualityOfService::Utility)));
  EXPECT_EQ(p.log.registrations.back(),
            "vxrr 1987605106 com.quorvel.sonik reporting_session_verbose 31");
}

TEST_F(SessionTest, ARestartIsAWholeLifeAgain) {
  const auto s = make();
  for (const int round : {1, 2}) {
    s->start();
    s->sendMessage(message(), 3, 1, nullptr);
    s->stop();
    run();
    EXPECT_EQ(s->vyrReportingSession(), nullptr);
    EXPECT_EQ(p.vyr.tokens, round);
    EXPECT_EQ(p.vyr.sent.size(), 2u * static_cast<unsigned>(round));
    EXPECT_EQ(p.vyr.sent.back().payload.text(), "{VX_Session_Summary_Event=0,a=1}");
  }
  EXPECT_EQ(s->messageIdForCategory(0xFFFFFFFF, 0xFFFF), "Undefined_Unknown_3");
}

TEST_F(SessionTest, SecondStartChangesNothing) {
  const auto s = make();
  s->start();
  s->sendMessage(message(), 3, 1, nullptr);
  const auto gained = during([&] { s->start(); });
  EXPECT_THAT(gained, ElementsAre("log vxrr info 42 is already started"));
  EXPECT_EQ(s->aggregatedPayloadData()->size(), 1u);
}

TEST_F(SessionTest, ConfigurationMergesAndNothingIsRemoved) {
  const auto s = make();
  s->setConfiguration(PayloadBuilder().set("a", 1).set("b", 1).build());
  s->updateDefaults(PayloadBuilder().set("b", 2).build());
  s->setConfiguration(std::nullopt);
  EXPECT_EQ(s->userInfo()->snapshot().text(), "{a=1,b=2}");
}

TEST_F(SessionTest, RelaySessionCarriesWhatTheSetUpTook) {
  for (const auto& [type, name] : {std::pair(ServiceType{7}, "longformaudio"), {12, "apiusage"}}) {
    const auto s = make(42, type);
    s->start();
    s->setServiceType(3);  // too late for the names
    // In time: the set-up holds the dictionary itself.
    s->setConfiguration(PayloadBuilder().set("HostApplicationDisplayID", "app").build());
    run();
    const auto& relay = *p.vyr.sessions.back();
    EXPECT_EQ(relay.userInfo.text(),
              "{clientName=com.quorvel.sonik,serviceName=" + std::string(name) +
                  "_session,HostApplicationDisplayID=app}");
    EXPECT_EQ(relay.info, (VyrSessionInfo{{"clientType", int32_t{19}},
                                          {"clientVersion", 2.0f},
                                          {"sessionID", int64_t{42}},
                                          {"batchEvent", type != 12},
                                          {"hierarchyToken", s->vyrReportingAgentToken()},
                                          {"containsRealtimeEvents", type == 12}}));
    EXPECT_EQ(s->vyrReportingSession(), p.vyr.sessions.back());
  }
  EXPECT_EQ(p.queues.blockingScopes, 2);
  const auto unnamed = make(1, kServiceTypeUnknown);
  EXPECT_EQ(unnamed->serviceType(), 0xFFFF);
  EXPECT_EQ(unnamed->serviceName(), "unknown");
  unnamed->setConfiguration(PayloadBuilder().set("serviceName", "mine").build());
  unnamed->start();
  run();
  EXPECT_EQ(p.vyr.sessions.back()->userInfo.text(),
            "{clientName=com.quorvel.sonik,serviceName=mine}");
}

TEST_F(SessionTest, TestSessionsNeverTouchTheRelay) {
  const auto s = make(1, 11);
  s->start();
  s->sendMessage(message(), 3, 1, nullptr);
  s->stop();
  run();
  EXPECT_THAT(p.vyr.sessions, IsEmpty());
  EXPECT_EQ(p.vyr.tokens, 0);
  EXPECT_THAT(p.log.lines, Contains("vxrr info transactions aren't allowed on this platform"));
  s->sendMessage(message(), 3, 1, nullptr);  // not started: alone, like any other
  run();
  EXPECT_EQ(p.vyr.oneOffs.size(), 1u);
  const auto later = make(2, 3);
  later->start();
  run();
  later->setServiceType(11);
  EXPECT_THAT(during([&] {
                later->stop();
                run();
              }),
              ElementsAre("trace 0x21042830"));
  EXPECT_NE(later->vyrReportingSession(), nullptr);
}

TEST_F(SessionTest, NoBackEndsDropsMessagesAfterNineSeconds) {
  for (const bool late : {false, true}) {
    p.vyr.backends = std::nullopt;
    if (late) p.vyr.configurationAfter = std::chrono::seconds(20);
    auto s = make();
    s->start();
    s->sendMessage(message(), 3, 1, nullptr);
    const Monotonic before = p.clock.monotonic();
    p.log.lines.clear();
    run();
    EXPECT_EQ(p.clock.monotonic() - before, std::chrono::seconds(9));
    EXPECT_EQ(s->vyrReportingSession(), nullptr);
    EXPECT_NE(s->vyrReportingAgentToken(), nullptr);
    std::vector<std::string> lines = {"vxrr default waiting for vyrreportingd to find backends",
                                      "vxrr error failed to find backend",
                                      "vxrr error No valid VyrReportingSession"};
    if (!late)
      lines.insert(lines.begin() + 1,
                   "vxrr error No backends found, this session won't get sent to the server");
    EXPECT_EQ(p.log.lines, lines);
    EXPECT_EQ(s->aggregatedPayloadData()->size(), 1u);
  }
  p.threading.passTimeUntil(p.clock.monotonic() + std::chrono::seconds(30));  // answered at last
}

TEST_F(SessionTest, FailedSendsAreSilentAndFailedFlushesLogged) {
  const auto s = make();
  s->start();
  run();
  p.vyr.sendError = p.vyr.flushError = Error{"x", 5, "broken"};
  EXPECT_THAT(during([&] {
                s->sendMessage(Payload(), 0x40000007, 2, nullptr);
                run();
              }),
              ElementsAre("trace 0x21042838", "relay 7 2"));
  s->stop();
  run();
  EXPECT_EQ(p.log.lines.back(), "vxrr error flush error broken (x, code 5)");
  EXPECT_EQ(s->vyrReportingSession(), nullptr);
}

TEST_F(SessionTest, UnstartedSessionSendsSinglesWithItsOwnServiceName) {
  const auto s = make(1, 3);
  s->setConfiguration(PayloadBuilder().set("secret", 1).build());
  s->sendMessage(message(), 0x40000007, 2, nullptr);
  s->start();  // too late for it
  run();
  ASSERT_EQ(p.vyr.oneOffs.size(), 1u);
  EXPECT_EQ(p.vyr.oneOffs[0].category, 7);
  EXPECT_EQ(p.vyr.oneOffs[0].userInfo.text(), "{clientName=com.quorvel.sonik,serviceName=haptics}");
}

TEST_F(SessionTest, SinglesOfAlarmsAreSpreadOverAMinute) {
  p.services.random = 59;
  std::optional<Error> answer = Error{};
  const Payload spaced = PayloadBuilder().set("a b c", 1).build();
  VXReportingSession::sendSingleMessage(spaced, 1, 1, 4, std::nullopt,
                                        [&](const auto& error) { answer = error; });
  EXPECT_EQ(p.services.randomBound, 60u);
  p.queues.advance(std::chrono::milliseconds(58999));
  EXPECT_THAT(p.vyr.oneOffs, IsEmpty());
  p.queues.advance(std::chrono::milliseconds(1));
  ASSERT_EQ(p.vyr.oneOffs.size(), 1u);
  EXPECT_EQ(p.vyr.oneOffs[0].payload.text(), "{a_b_c=1}");
  EXPECT_EQ(answer, std::nullopt);
}

TEST_F(SessionTest, FailedSingleIsLoggedAndHandedToTheReply) {
  p.vyr.sendError = Error{"x", 5, "broken"};
  std::optional<Error> answer;
  VXReportingSession::sendSingleMessage(message(), 1, 1, 5, message(),
                                        [&](const auto& error) { answer = error; });
  run();
  EXPECT_EQ(answer, p.vyr.sendError);
  EXPECT_THAT(p.log.lines,
              Contains("system error sendOneMessageWithSessionInfo broken (x, code 5)"));
}

// ---------------------------------------------------------------------------------------------------------------------

class OrientationTest : public SessionTest {
 protected:
  OrientationTest() { p.services.internalBuild = true; }
};

TEST_F(OrientationTest, HandlersComeAndGoInOrder) {
  const auto s = make(42, 7);
  EXPECT_THAT(during([&] { s->start(); }, {"register"}),
              ElementsAre("register device VXReportingService 42",
                          "register interface VXReportingService 42"));
  EXPECT_THAT(during([&] { s->stop(); }, {"register", "0x21042830"}),
              ElementsAre("unregister device VXReportingService 42",
                          "unregister interface VXReportingService 42", "trace 0x21042830"));
  EXPECT_THAT(during([&] { s->stop(); }, {"register"}), IsEmpty());
  s->start();
  s->setStarted(false);  // not started, and registered all the same
  EXPECT_EQ(during([&] { s->stop(); }, {"register"}).size(), 2u);
}

TEST_F(OrientationTest, OnlyWhereAllThreeConditionsHold) {
  for (const ServiceType type : {ServiceType{7}, ServiceType{2}, ServiceType{8}}) {
    EXPECT_EQ(make(1, type)->shouldReportOrientation(), type != 8);
  }
  p.services.deviceClass = 6;
  EXPECT_FALSE(make(1, 7)->shouldReportOrientation());
  p.services.deviceClass = 0;
  const VXReportingProcessState another;
  p.services.internalBuild = false;
  EXPECT_FALSE(make(1, 7)->shouldReportOrientation());
}

TEST_F(OrientationTest, TypeChangedMeanwhileLeavesHandlersRegistered) {
  const auto s = make(42, 7);
  s->start();
  s->setServiceType(3);
  EXPECT_THAT(during([&] { s->stop(); }, {"register"}), IsEmpty());
  const auto other = make(43, 3);
  other->start();
  other->setServiceType(7);
  EXPECT_THAT(during([&] { other->stop(); }, {"register"}), IsEmpty());
  p.services.deviceHandlers.clear();
  p.services.interfaceHandlers.clear();
}

TEST_F(OrientationTest, ChangesAreStampedToTheMillisecondInTheFlatAggregateOnly) {
  const auto s = make(42, 2);
  s->start();
  const auto device = p.services.deviceHandlers.begin()->second;
  const auto interface = p.services.interfaceHandlers.begin()->second;
  p.clock.advance(std::chrono::microseconds(1000400));
  (*device)(3);
  p.clock.advance(std::chrono::microseconds(11345200));
  p.log.verbose = true;
  (*interface)(4);
  EXPECT_EQ(p.log.lines.back(),
            "vxrr debug Orientation handler callback mode=ui orientation=\"o4\" app=\"(null)\", "
            "time=12.346, id=\"VXReportingService 42\"");
  EXPECT_THAT(texts(s->aggregatedPayloadData()),
              ElementsAre("{device_orientation=o3,device_orientation_time=1}",
                          "{ui_orientation=o4,ui_orientation_time=12.346}"));
  EXPECT_TRUE(s->nestedAggregatedPayloadData()->empty());
  s->stop();
  (*device)(5);  // still under way when it was unregistered
  EXPECT_EQ(s->aggregatedPayloadData(), std::nullopt);
}

TEST_F(OrientationTest, ClockSetBackMeanwhile) {
  const auto s = make(42, 2);
  s->start();
  p.clock.wall -= std::chrono::seconds(90);
  (*p.services.deviceHandlers.begin()->second)(3);
  EXPECT_THAT(texts(s->aggregatedPayloadData()),
              ElementsAre("{device_orientation=o3,device_orientation_time=-90}"));
  s->stop();
  EXPECT_EQ(p.services.files.size(), 1u);
}

}  // namespace
}  // namespace vx
