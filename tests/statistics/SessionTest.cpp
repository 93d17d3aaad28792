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
                          .build();
  EXPECT_EQ(VXReportingSession::normalizePayloadKeys(odd).text(), "{a_b=3,c={d e=2}}");
  const Payload plain = message();
  EXPECT_TRUE(VXReportingSession::normalizePayloadKeys(plain).isSameObject(plain));
}

TEST_F(SessionTest, ReplyComesBeforeTheRelay) {
  const auto s = make();
  s->start();
  run();
  const auto gained = during([&] {
    s->sendMessage(message(), kSetup, 1, VXReportingSession::Sync::Yes, [&](const auto& error) {
      p.journal.push_back(error ? "reply error" : "reply");
    });
    run();
  });
  EXPECT_THAT(gained, ElementsAre("trace 0x21042838", "reply", "relay 5 1"));
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
  const auto s = make(42, 7);
  s->start();
  s->setServiceType(3);  // too late for the names
  s->setConfiguration(PayloadBuilder()
                          .set("HostApplicationDisplayID", "app")
                          .build());  // in time: the same dictionary
  run();
  const auto& relay = *p.vyr.sessions.at(0);
  EXPECT_EQ(relay.userInfo.text(),
            "{clientName=com.quorvel.sonik,serviceName=longformaudio_session,"
            "HostApplicationDisplayID=app}");
  EXPECT_EQ(relay.info[2],
            (std::pair<std::string_view, VyrSessionInfoValue>{"sessionID", int64_t{42}}));
  EXPECT_EQ(relay.info[3].second, VyrSessionInfoValue{true});
  EXPECT_EQ(relay.info[5].second, VyrSessionInfoValue{false});
  EXPECT_EQ(p.queues.blockingScopes, 1);
  EXPECT_THAT(p.log.lines, Contains("vxrr default List of backends (store)"));
}

TEST_F(SessionTest, ApiUsageIsRealtimeAndConfigurationMayRenameTheService) {
  const auto s = make(1, 12);
  s->setConfiguration(PayloadBuilder().set(kVyrReportingUserInfoServiceName, "mine").build());
  s->start();
  run();
  EXPECT_EQ(p.vyr.sessions[0]->info[3].second, VyrSessionInfoValue{false});
  EXPECT_EQ(p.vyr.sessions[0]->info[5].second, VyrSessionInfoValue{true});
  EXPECT_EQ(p.vyr.sessions[0]->userInfo.find(kVyrReportingUserInfoServiceName)->text(), "mine");
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
}

TEST_F(SessionTest, NoBackEndsDropsMessagesAfterNineSeconds) {
  p.vyr.backends = std::nullopt;
  const auto s = make();
  s->start();
  s->sendMessage(message(), 3, 1, nullptr);
  const Monotonic before = p.clock.monotonic();
  run();
  EXPECT_EQ(p.clock.monotonic() - before, std::chrono::seconds(9));
  EXPECT_EQ(s->vyrReportingSession(), nullptr);
  EXPECT_NE(s->vyrReportingAgentToken(), nullptr);
  EXPECT_THAT(
      p.log.lines,
      AllOf(Contains("vxrr error No backends found, this session won't get sent to the server"),
            Contains("vxrr default waiting for vyrreportingd to find backends"),
            Contains("vxrr error failed to find backend"),
            Contains("vxrr error No valid VyrReportingSession")));
  EXPECT_TRUE(s->started());
  EXPECT_EQ(s->aggregatedPayloadData()->size(), 1u);
}

TEST_F(SessionTest, LateAnswerOfTheConfigurationIsHarmless) {
  p.vyr.configurationAfter = std::chrono::seconds(20);
  auto s = make();
  s->start();
  run();
  EXPECT_EQ(s->vyrReportingSession(), nullptr);
  s.reset();
  p.threading.passTimeUntil(p.clock.monotonic() + std::chrono::seconds(30));
}

TEST_F(SessionTest, RelayFailureIsSilent) {
  const auto s = make();
  s->start();
  run();
  p.vyr.sendError = Error{"x", 5, "broken"};
  EXPECT_THAT(during([&] {
                s->sendMessage(message(), 0x40000007, 2, nullptr);
                run();
              }),
              ElementsAre("trace 0x21042838", "relay 7 2"));
}

TEST_F(SessionTest, FlushFailureIsLoggedAndTheSessionDropped) {
  p.vyr.flushError = Error{"x", 5, "broken"};
  const auto s = make();
  s->start();
  s->stop();
  run();
  EXPECT_THAT(p.log.lines, Contains("vxrr error flush error broken (x, code 5)"));
  EXPECT_EQ(s->vyrReportingSession(), nullptr);
}

TEST_F(SessionTest, UnstartedSessionSendsSinglesWithItsOwnServiceName) {
  const auto s = make(1, 3);
  s->setConfiguration(PayloadBuilder().set("secret", 1).build());
  s->sendMessage(message(), 0x40000007, 2, nullptr);
  run();
  ASSERT_EQ(p.vyr.oneOffs.size(), 1u);
  EXPECT_EQ(p.vyr.oneOffs[0].category, 7);
  EXPECT_EQ(p.vyr.oneOffs[0].userInfo.text(), "{clientName=com.quorvel.sonik,serviceName=haptics}");
}

TEST_F(SessionTest, SinglesOfAlarmsAreSpreadOverAMinute) {
  p.services.random = 59;
  std::optional<Error> answer = Error{};
  VXReportingSession::sendSingleMessage(message(), 1, 1, 4, std::nullopt,
                                        [&](const auto& error) { answer = error; });
  EXPECT_EQ(p.services.randomBound, 60u);
  p.queues.advance(std::chrono::milliseconds(58999));
  EXPECT_THAT(p.vyr.oneOffs, IsEmpty());
  p.queues.advance(std::chrono::milliseconds(1));
  EXPECT_EQ(p.vyr.oneOffs.size(), 1u);
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
  (*interface)(4);
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
