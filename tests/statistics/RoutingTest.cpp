#include "Statistics/VXReportingTallyhubBridge.h"
#include "Statistics/VXReportingWattmarkUtility.h"
#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

class RoutingTest : public ServiceTest {
 protected:
  const std::vector<std::string> kDelivery = {"event ", "power ", "0x21042838", "reply send"};
  static Payload engineOn() {
    return PayloadBuilder().set("EngineOnTime", 2).set("vxreporting_timestamp", 9).build();
  }
};

TEST_F(RoutingTest, ListedSessionsAreServedAfterTheSinks) {
  auto& client = connect();
  create(client, 1);  // need not be started
  const auto gained = during(
      [&] {
        client.sendMessage(engineOn(), 1, 6, std::vector<ReporterID>{0, 99, 1},
                           [&](const auto&) { p.journal.push_back("reply send"); });
        p.queues.runAll("com.quorvel.sonik.session.vyrreporting");
      },
      kDelivery);
  EXPECT_THAT(gained, ElementsAre("event com.quorvel.sonik.Generic.Undefined", "power Lumo_Haptics",
                                  "trace 0x21042838", "reply send"));
}

TEST_F(RoutingTest, StartedSessionsOfAllClientsAreServedBeforeTheSinks) {
  auto& a = connect(200);
  auto& b = connect(201);
  started(b, 1);
  create(b, 2);
  started(a, 3);
  const std::string event = "event com.quorvel.sonik.Session_Setup.Undefined";
  const auto gained = during([&] { send(a, engineOn(), kSetup, 6); }, kDelivery);
  EXPECT_THAT(gained, ElementsAre("trace 0x21042838", event, "power Lumo_Haptics",
                                  "trace 0x21042838", event, "power Lumo_Haptics", "reply send"));
  stop(a, 3);
  EXPECT_EQ(during([&] { send(a, engineOn(), kSetup, 6); }, kDelivery).size(), 4u);
  EXPECT_THAT(p.log.lines,
              Contains("vxrs default sessions for client 200 : (<VXReportingSession 3>)"));
  EXPECT_THAT(p.log.lines, Contains("vxrs default sessions for client 201 : (<VXReportingSession "
                                    "1>, <VXReportingSession 2>)"));
  EXPECT_THAT(p.log.lines,
              Contains("vxrs default active reporting sessions 1 : (<VXReportingSession 1>)"));
}

TEST_F(RoutingTest, MessageToNobodyGoesOutAloneWithoutAnalyticsOrUserInformation) {
  auto& client = connect();
  p.services.preferences["device_name"] = "Pocket";
  onQueue([&] { (*p.services.notifyHandler)(p.services.kToken); });
  const auto gained = during([&] { send(client, engineOn(), kSetup, 6); },
                             {"event", "power", "one-off", "standalone"});
  EXPECT_THAT(
      gained,
      ElementsAre("log vxrs default no active reporting sessions found, sending as standalone",
                  "power Lumo_Haptics", "one-off 5 6"));
  ASSERT_EQ(p.vyr.oneOffs.size(), 1u);
  EXPECT_EQ(p.vyr.oneOffs[0].userInfo.text(),
            "{clientName=com.quorvel.sonik,serviceName=standalone}");
  EXPECT_EQ(p.vyr.oneOffs[0].info,
            (VyrSessionInfo{
                {"clientType", int32_t{19}}, {"clientVersion", 2.0f}, {"sessionID", int32_t{-1}}}));
  EXPECT_EQ(p.services.powers[0].record.find("ApplicationName")->text(), "Unknown");
}

TEST_F(RoutingTest, ListsThatNameNobodyRouteNothing) {
  auto& client = connect();
  for (const std::vector<ReporterID>& ids :
       {std::vector<ReporterID>{}, std::vector<ReporterID>{0, 12345}}) {
    EXPECT_THAT(
        during([&] { send(client, message(), 1, 1, ids); }, {"event", "one-off", "relay", "reply"}),
        ElementsAre("reply send"));
  }
}

TEST_F(RoutingTest, StartTakesItsSnapshotAfterStartingAndHoldsTheReply) {
  drivers.count("Speaker/x", "1");
  service = VXReportingServiceDelegate::create();
  auto& client = connect();
  create(client, 1);
  bool startedThen = false;
  drivers.onSample = [&] {
    p.journal.push_back("sample");
    startedThen = session(client, 1)->started();
  };
  EXPECT_THAT(during([&] { start(client, 1); }, {"trace", "sample", "reply"}),
              ElementsAre("trace 0x21042818", "trace 0x2104282C", "sample"));
  EXPECT_TRUE(startedThen);
  EXPECT_THAT(during([&] { start(client, 1); }, {"sample", "reply"}),
              ElementsAre("reply start true"));
  drivers.count("Speaker/x", "4");
  EXPECT_THAT(during([&] { stop(client, 1); }, {"0x2104281C", "0x21042838", "event com", "fetching",
                                                "0x21042830", "reply", "default stopping"}),
              ElementsAre("trace 0x2104281C", "trace 0x21042838",
                          "event com.quorvel.sonik.ChannelReporting.Generic",
                          "log vxrs default fetching driver logs {Speaker_x=3}", "trace 0x21042830",
                          "trace 0x21042838", "reply start true", "log vxrs default stopping 1",
                          "reply stop true"));
  EXPECT_EQ(session(client, 1)->driverSnapShot(), nullptr);
}

TEST_F(RoutingTest, AReplyHeldOverAStopElsewhereIsReleasedByTheNextStart) {
  auto& client = connect();
  started(client, 1);
  onQueue([&] { session(client, 1)->stop(); });
  EXPECT_THAT(during([&] { start(client, 1); }, {"reply"}), ElementsAre("reply start true"));
  EXPECT_TRUE(session(client, 1)->hasTransactionCompleteBlock());
}

TEST_F(RoutingTest, StopOfASessionNeverStartedStillAsksTheDrivers) {
  auto& client = connect();
  create(client, 1);
  EXPECT_THAT(during([&] { stop(client, 1); }, {"nothing", "0x21042830", "reply"}),
              ElementsAre("log vxrs default nothing interesting to fetch from the drivers",
                          "reply stop true"));
  EXPECT_THAT(during([&] { stop(client, 0); }), ElementsAre("trace 0x2104281C", "reply stop true"));
  for (const ReporterID nobody : {0, 99})
    EXPECT_THAT(during([&] { start(client, nobody); }, {"trace", "reply"}),
                ElementsAre("trace 0x21042818", "reply start true"));
}

TEST_F(RoutingTest, AnotherClientsSessionCanBeStartedButNotStopped) {
  auto& owner = connect(200);
  auto& other = connect(201);
  create(owner, 1);
  start(other, 1);
  EXPECT_TRUE(session(owner, 1)->started());
  EXPECT_THAT(during([&] { stop(other, 1); }, {"reply", "default stopping"}),
              ElementsAre("log vxrs default stopping 1", "reply stop true"));
  EXPECT_TRUE(session(owner, 1)->started());
  EXPECT_THAT(during([&] { stop(owner, 1); }, {"reply"}),
              ElementsAre("reply start true", "reply stop true"));
}

TEST_F(RoutingTest, SessionsOwnIdentifierWinsInAnalytics) {
  auto& client = connect();
  started(client, 1);
  configure(client, 1, PayloadBuilder().set("HostApplicationDisplayID", "com.example").build());
  const Payload claimed =
      PayloadBuilder().set("HostApplicationDisplayID", "liar").set("b", 1).build();
  send(client, claimed, 3, 6);
  const auto event = p.services.events.back();
  EXPECT_EQ(event.name, "com.quorvel.sonik.Playback.Undefined");
  EXPECT_EQ((*event.builder)().text(), "{HostApplicationDisplayID=com.example,b=1}");
  EXPECT_TRUE((*event.builder)() == (*event.builder)());
  VXReportingTallyhubBridge::handleEvent(nullptr, 0x10000009, 0xFFFF, nullptr);
  EXPECT_EQ(p.services.events.back().name, "com.quorvel.sonik.DSP_ChannelReporting.Unknown");
  EXPECT_EQ((*p.services.events.back().builder)().text(), "{HostApplicationDisplayID=Unknown}");
  EXPECT_EQ(claimed.find("HostApplicationDisplayID")->text(), "liar");
  EXPECT_EQ(p.vyr.sent.back().payload.text(), claimed.text());
}

TEST_F(RoutingTest, PowerRecords) {
  auto& client = connect();
  started(client, 1);
  configure(client, 1, PayloadBuilder().set("HostApplicationDisplayID", "com.example").build());
  send(
      client,
      PayloadBuilder().set("EngineOnTime", 0).set("Haptic_Active_Hardware_Time_Seconds", 1).build(),
      1, 6);
  EXPECT_EQ(p.services.powers[0].client, 28);
  EXPECT_EQ(p.services.powers[0].record.text(), "{EngineOnDuration=0,ApplicationName=com.example}");
  EXPECT_THAT(p.log.lines,
              Contains("system error failed to get VXReporting timestamp for wattmark"));
  PayloadBuilder leaked;
  leaked.set("Haptic_Active_Hardware_Time_Seconds", 1.5);
  send(client, leaked.build(), 0xFFFFFFFF, 6);
  send(client, leaked.set("Active_Clients", "x").set("vxreporting_timestamp", 1).build(), 1, 6);
  send(client, engineOn(), 1, 5);
  send(client, message(), 1, 6);
  VXReportingWattmarkUtility::handleEvent(nullptr, 1, 6, nullptr);
  ASSERT_EQ(p.services.powers.size(), 3u);
  EXPECT_EQ(p.services.powers[1].name, "LeakedHapticsSessionInfo");
  EXPECT_EQ(p.services.powers[1].record.text(), "{Haptic_Active_Hardware_Time_Seconds=1.5}");
  EXPECT_EQ(p.services.powers[2].record.text(),
            "{Haptic_Active_Hardware_Time_Seconds=1.5,Active_Clients=x}");
  const Payload alone = engineOn();
  VXReportingWattmarkUtility::handleEvent(&alone, 1, 6, nullptr);
  EXPECT_EQ(p.services.powers[3].record.text(),
            "{EngineOnDuration=2,ApplicationName=Unknown,TimestampEnd=9}");
}

}  // namespace
}  // namespace vx
