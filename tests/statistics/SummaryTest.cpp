#include <cmath>

#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

class SummaryTest : public ServiceTest {
 protected:
  SummaryTest() { p.services.internalBuild = true; }
  std::shared_ptr<VXReportingSession> startedSession(ServiceType type = 3) {
    auto s = VXReportingSession::initWithID(42, {200});
    s->setServiceType(type);
    s->start();
    p.queues.runAll();
    return s;
  }
  const OnServiceQueue here_{p};
};

TEST_F(SummaryTest, JoinsEveryValueOfAKeyAsText) {
  const auto s = startedSession();
  EXPECT_EQ(s->createSummaryEventForSession(), std::nullopt);
  s->sendMessage(PayloadBuilder().set("a", 1).set("b", "x").build(), 3, 1, nullptr);
  s->sendMessage(PayloadBuilder().set("a", 2).build(), 3, 1, nullptr);
  s->sendMessage(PayloadBuilder().set("b", "").set("c", true).set("a", 0.5).build(), 3, 1, nullptr);
  EXPECT_EQ(s->createSummaryEventForSession()->text(),
            "{VX_Session_Summary_Event=3,a=1,2,0.5,b=x,,c=1}");
  EXPECT_TRUE(s->createSummaryEventForSession()->find("a")->isString());
}

TEST_F(SummaryTest, OneEmptyDictionaryAndAClaimedEventKey) {
  const auto s = startedSession();
  s->sendMessage(Payload(), 3, 1, nullptr);
  EXPECT_EQ(s->createSummaryEventForSession()->text(), "{VX_Session_Summary_Event=3}");
  s->sendMessage(PayloadBuilder().set("VX_Session_Summary_Event", "mine").build(), 3, 1, nullptr);
  EXPECT_EQ(s->createSummaryEventForSession()->text(), "{VX_Session_Summary_Event=3,mine}");
}

TEST_F(SummaryTest, EventThenFileThenFlush) {
  const auto s = startedSession();
  s->setConfiguration(PayloadBuilder().set("HostApplicationDisplayID", "com.example").build());
  s->sendMessage(PayloadBuilder().set("a b", 1).build(), 3, 1, nullptr);
  p.queues.runAll();
  const auto gained = during([&] {
    s->stop();
    p.queues.runAll();
  });
  const std::string path =
      "/logs/Audio/Reporting/20261116-061530+0000-sonik-com.example-haptics.json";
  EXPECT_THAT(gained, ElementsAre("trace 0x21042830",
                                  "log vxrr default sending summary event for reporter 42",
                                  "trace 0x21042838", "mkdir /logs/Audio/Reporting 777",
                                  "file " + path, "relay 65535 65535", "flush"));
  EXPECT_EQ(p.services.files[path],
            "[\n {\n  \"HostApplicationDisplayID\": \"com.example\"\n },\n"
            " {\n  \"Playback_Start_1\": {\n   \"a_b\": 1\n  }\n },\n"
            " {\n  \"Undefined_Unknown_1\": {\n   \"VX_Session_Summary_Event\": \"3\",\n"
            "   \"a_b\": \"1\"\n  }\n }\n]\n");
}

TEST_F(SummaryTest, NothingReceivedLeavesNothingBehind) {
  const auto s = startedSession();
  EXPECT_THAT(during([&] {
                s->stop();
                p.queues.runAll();
              }),
              ElementsAre("trace 0x21042830", "flush"));
  EXPECT_THAT(during([&] { s->stop(); }), IsEmpty());
}

TEST_F(SummaryTest, UnknownApplicationAndUnlistedServiceInTheName) {
  const auto s = startedSession(13);
  s->sendMessage(message(), 3, 1, nullptr);
  s->stop();
  EXPECT_EQ(p.services.files.begin()->first,
            "/logs/Audio/Reporting/20261116-061530+0000-sonik-unknown-telephony.json");
}

TEST_F(SummaryTest, WhatJsonCannotHoldIsLoggedAndTheDirectoryStillMade) {
  const auto s = startedSession();
  s->setConfiguration(PayloadBuilder().set("bad", std::nan("")).build());
  s->sendMessage(message(), 3, 1, nullptr);
  p.services.directoryError = Error{"posix", 13, "denied"};
  const auto gained = during([&] { s->stop(); }, {"JSON", "mkdir", "file", "can't", "write"});
  ASSERT_EQ(gained.size(), 3u);
  EXPECT_THAT(gained[0], HasSubstr("log vxrr error dataWithJSONObject: "));
  EXPECT_THAT(gained[1], HasSubstr("mkdir"));
  EXPECT_EQ(gained[2],
            "log vxrr error can't create logging directory at /logs/Audio/Reporting: denied "
            "(posix, code 13)");
}

TEST_F(SummaryTest, FailedWriteIsLoggedAndTheStopGoesOn) {
  const auto s = startedSession();
  s->sendMessage(message(), 3, 1, nullptr);
  p.services.fileError = Error{"posix", 28, "full"};
  s->stop();
  EXPECT_THAT(p.log.lines, Contains("vxrr error jsonOutput writeToURL: full (posix, code 28)"));
  EXPECT_FALSE(s->started());
}

TEST_F(SummaryTest, OtherBuildsWriteNothing) {
  const VXReportingProcessState another;
  p.services.internalBuild = false;
  const auto s = startedSession();
  s->sendMessage(message(), 3, 1, nullptr);
  EXPECT_THAT(during([&] { s->stop(); }, {"mkdir", "file"}), IsEmpty());
}

}  // namespace
}  // namespace vx
