#include <cmath>

#include "propertylist/JsonWriter.h"
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
  s->sendMessage(Payload(), 3, 1, nullptr);
  EXPECT_EQ(s->createSummaryEventForSession()->text(), "{VX_Session_Summary_Event=3}");
  s->sendMessage(PayloadBuilder().set("a", 1).set("b", "").build(), 3, 1, nullptr);
  s->sendMessage(PayloadBuilder().set("a", 2).build(), 3, 1, nullptr);
  s->sendMessage(PayloadBuilder().set("b", "x").set("c", true).set("a", 0.5).build(), 3, 1,
                 nullptr);
  s->sendMessage(PayloadBuilder()
                     .set("l", ArrayBuilder().add(1).add("y"))
                     .set("VX_Session_Summary_Event", "mine")
                     .set("b", "")
                     .set("d", message())
                     .build(),
                 3, 1, nullptr);
  EXPECT_EQ(s->createSummaryEventForSession()->text(),
            "{VX_Session_Summary_Event=3,mine,a=1,2,0.5,b=,x,,c=1,l=(1,y),d={a=1}}");
  EXPECT_TRUE(s->createSummaryEventForSession()->find("a")->isString());
}

// More than any chunk of an aggregate or a text holds, and more than is written at once.
TEST_F(SummaryTest, LargeSessionsLoseNothing) {
  const auto s = startedSession();
  const std::string quote(150000, '"');
  const Payload large = PayloadBuilder().set("a", "x").set("b", quote).set("c", 0.5).build();
  s->sendMessage(large, 3, 2, nullptr);
  std::string numbers = "x", file;
  for (int i = 0; i < 25000; ++i) {
    s->sendMessage(PayloadBuilder().set("a", i).build(), 3, 1, nullptr);
    numbers += "," + std::to_string(i);
  }
  const Payload summary = *s->createSummaryEventForSession();
  EXPECT_EQ(summary.find("a")->asString(), numbers);
  EXPECT_EQ(summary.find("b")->asString(), quote);
  s->stop();
  p.queues.runAll();
  EXPECT_GT(p.threading.freedBytes, 25000 * sizeof(Payload));
  for (const auto& [name, payload] :
       {std::pair("Playback_Stop_1", large), {"Undefined_Unknown_1", summary}}) {
    std::string element = "{\n  \"" + std::string(name) + "\": ";
    appendPrettyJson(element, payload, 2);
    EXPECT_TRUE(p.services.files.begin()->second.find(element + "\n }") != std::string::npos);
  }
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
  EXPECT_THAT(p.services.files, IsEmpty());
}

TEST_F(SummaryTest, TheFileIsNamedAfterApplicationAndService) {
  const std::pair<Payload, const char*> names[] = {
      {Payload(), "unknown"},
      {PayloadBuilder().set("HostApplicationDisplayID", "../a b").build(), "%2E.%2Fa%20b"},
      {PayloadBuilder().set("HostApplicationDisplayID", 7).build(), "7"}};
  for (const auto& [configuration, name] : names) {
    const auto s = startedSession(13);
    s->setConfiguration(configuration);
    s->sendMessage(message(), 3, 1, nullptr);
    s->writeSummaryJson();
    s->stop();  // writes once more, with one more header
    ASSERT_EQ(p.services.files.size(), 1u);
    const auto& [path, text] = *p.services.files.begin();
    EXPECT_EQ(path, "/logs/Audio/Reporting/20261116-061530+0000-sonik-" + std::string(name) +
                        "-telephony.json");
    std::string header;
    appendPrettyJson(header, configuration, 1);
    EXPECT_EQ(text.find("[\n " + header + ",\n " + header + ",\n {\n"), 0u) << text;
    p.services.files.clear();
  }
}

TEST_F(SummaryTest, WhatJsonCannotHoldIsLoggedAndTheDirectoryStillMade) {
  const Payload bad = PayloadBuilder().set("bad", std::nan("")).build();
  p.services.directoryError = Error{"posix", 13, "denied"};
  for (const auto& [header, sent] : {std::pair(bad, message()), {message(), bad}}) {
    const auto s = startedSession();
    s->setConfiguration(header);
    s->sendMessage(sent, 3, 1, nullptr);
    const auto gained = during([&] { s->stop(); }, {"JSON", "mkdir", "file", "can't", "write"});
    ASSERT_EQ(gained.size(), 3u);
    EXPECT_THAT(gained[0], HasSubstr("log vxrr error dataWithJSONObject: "));
    EXPECT_THAT(gained[1], HasSubstr("mkdir"));
    EXPECT_EQ(gained[2],
              "log vxrr error can't create logging directory at /logs/Audio/Reporting: denied "
              "(posix, code 13)");
  }
}

TEST_F(SummaryTest, FailedWritesAreLoggedAndTheStopGoesOn) {
  p.services.directoryError = Error{"posix", 13, "denied"};  // the file is tried all the same
  for (const bool begins : {false, true}) {
    const auto s = startedSession();
    s->sendMessage(PayloadBuilder().set("a", std::string(70000, 'x')).build(), 3, 1, nullptr);
    (begins ? p.services.writeError : p.services.fileError) = Error{"posix", 28, "full"};
    p.log.lines.clear();
    s->stop();
    EXPECT_EQ(p.log.lines.back(), "vxrr error jsonOutput writeToURL: full (posix, code 28)");
    EXPECT_THAT(p.services.files, IsEmpty());
    EXPECT_FALSE(s->started());
    p.services.fileError.reset();
  }
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
