#include "Statistics/VXReportingTallyhubBridge.h"
#include "Statistics/VXReportingWattmarkUtility.h"
#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

class RoutingTest : public ServiceTest {
 protected:
  const std::vector<std::string> kDelivery = {"event ", "power ", "0x21042838", "reply send"};
  const Payload engineOn = dictionary("EngineOnTime", 2, "vxreporting_timestamp", 9);
};

TEST_F(RoutingTest, ListedSessionsAreServedAfterTheSinks) {
  auto& client = connect();
  create(client, 1);  // need not be started
  send(client, engineOn, 1, 6, {{0, 99, 1}}, "com.quorvel.sonik.session.vyrreporting");
  EXPECT_THAT(gained(kDelivery),
              ElementsAre("event com.quorvel.sonik.Generic.Undefined", "power Lumo_Haptics",
                          "trace 0x21042838", "reply send"));
  run();
  for (const std::vector<ReporterID>& nobody : {std::vector<ReporterID>{}, {0, 12345}}) {
    send(client, message, 1, 1, nobody);
    EXPECT_THAT(gained({"event", "one-off", "relay", "reply"}), ElementsAre("reply send"));
  }
}

TEST_F(RoutingTest, StartedSessionsOfAllClientsAreServedBeforeTheSinks) {
  auto &a = connect(200), &b = connect(201);
  started(b, 1);
  create(b, 2);
  started(a, 3);
  const std::string event = "event com.quorvel.sonik.Session_Setup.Undefined";
  send(a, engineOn, kSetup, 6);
  EXPECT_THAT(gained(kDelivery),
              ElementsAre("trace 0x21042838", event, "power Lumo_Haptics", "trace 0x21042838",
                          event, "power Lumo_Haptics", "reply send"));
  stop(a, 3);
  send(a, engineOn, kSetup, 6);
  EXPECT_EQ(gained(kDelivery).size(), 4u);
  for (const char* line : {"sessions for client 200 : (<VXReportingSession 3>)",
                           "sessions for client 201 : (<VXReportingSession 1>, "
                           "<VXReportingSession 2>)",
                           "active reporting sessions 1 : (<VXReportingSession 1>)"})
    EXPECT_THAT(p.log.lines, Contains(std::string("vxrs default ") + line));
}

TEST_F(RoutingTest, MessageToNobodyGoesOutAloneWithoutAnalyticsOrUserInformation) {
  auto& client = connect();
  p.services.preferences["device_name"] = "Pocket";
  notify();
  send(client, engineOn, kSetup, 6);
  EXPECT_THAT(
      gained({"event", "power", "one-off", "standalone"}),
      ElementsAre("log vxrs default no active reporting sessions found, sending as standalone",
                  "power Lumo_Haptics", "one-off 5 6"));
  EXPECT_EQ(p.vyr.oneOffs.at(0).userInfo.text(),
            "{clientName=com.quorvel.sonik,serviceName=standalone}");
  EXPECT_EQ(p.vyr.oneOffs[0].info,
            (VyrSessionInfo{
                {"clientType", int32_t{19}}, {"clientVersion", 2.0f}, {"sessionID", int32_t{-1}}}));
  EXPECT_EQ(p.services.powers[0].record.text(),
            "{EngineOnDuration=2,ApplicationName=Unknown,TimestampEnd=9}");
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
  start(client, 1);
  EXPECT_THAT(gained({"trace", "sample", "reply"}),
              ElementsAre("trace 0x21042818", "trace 0x2104282C", "sample"));
  EXPECT_TRUE(startedThen);
  start(client, 1);
  EXPECT_THAT(gained({"sample", "reply"}), ElementsAre("reply start true"));
  drivers.count("Speaker/x", "4");
  stop(client, 1);
  EXPECT_THAT(gained({"0x2104281C", "0x21042838", "event com", "fetching", "0x21042830", "reply",
                      "default stopping"}),
              ElementsAre("trace 0x2104281C", "trace 0x21042838",
                          "event com.quorvel.sonik.ChannelReporting.Generic",
                          "log vxrs default fetching driver logs {Speaker_x=3}", "trace 0x21042830",
                          "trace 0x21042838", "reply start true", "log vxrs default stopping 1",
                          "reply stop true"));
  EXPECT_EQ(session(client, 1)->driverSnapShot(), nullptr);
  start(client, 1);
  onQueue([&] { session(client, 1)->stop(); });
  start(client, 1);
  EXPECT_THAT(gained({"reply"}), ElementsAre("reply start true")) << "held over another's stop";
  EXPECT_TRUE(session(client, 1)->hasTransactionCompleteBlock());
}

TEST_F(RoutingTest, AnotherClientsSessionCanBeStartedButNotStopped) {
  auto &owner = connect(200), &other = connect(201);
  create(owner, 1);
  start(other, 1);
  EXPECT_TRUE(session(owner, 1)->started());
  stop(other, 1);
  EXPECT_THAT(gained({"reply", "default stopping"}),
              ElementsAre("log vxrs default stopping 1", "reply stop true"));
  EXPECT_TRUE(session(owner, 1)->started());
  stop(owner, 1);
  EXPECT_THAT(gained({"reply"}), ElementsAre("reply start true", "reply stop true"));
}

TEST_F(RoutingTest, SessionsOwnIdentifierWinsInAnalytics) {
  auto& client = connect();
  started(client, 1);
  configure(client, 1, dictionary("HostApplicationDisplayID", "com.example"));
  const Payload claimed = dictionary("HostApplicationDisplayID", "liar", "b", 1);
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
  configure(client, 1, dictionary("HostApplicationDisplayID", 7));
  const struct {
    Payload sent;
    const char* record;
    MessageCategory category = 1;
    MessageType type = 6;
  } cases[] = {
      {dictionary("EngineOnTime", 0, "Haptic_Active_Hardware_Time_Seconds", 1),
       "Lumo_Haptics {EngineOnDuration=0,ApplicationName=7}"},
      {dictionary("Haptic_Active_Hardware_Time_Seconds", 1.5),
       "LeakedHapticsSessionInfo {Haptic_Active_Hardware_Time_Seconds=1.5}", 0xFFFFFFFF},
      {dictionary("Active_Clients", "x", "vxreporting_timestamp", 1,
                  "Haptic_Active_Hardware_Time_Seconds", 1.5),
       "LeakedHapticsSessionInfo {Haptic_Active_Hardware_Time_Seconds=1.5,Active_Clients=x}"},
      {engineOn, "", 1, 5},
      {message, ""}};
  for (const auto& [sent, expected, category, type] : cases) {
    p.services.powers.clear();
    send(client, sent, category, type);
    std::string records;
    for (const auto& power : p.services.powers) records += power.name + " " + power.record.text();
    EXPECT_EQ(records, expected);
    for (const auto& power : p.services.powers) EXPECT_EQ(power.client, 28);
  }
  EXPECT_THAT(p.log.lines,
              Contains("system error failed to get VXReporting timestamp for wattmark"));
  VXReportingWattmarkUtility::handleEvent(nullptr, 1, 6, nullptr);
}

}  // namespace
}  // namespace vx
