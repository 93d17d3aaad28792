#include "Statistics/VXReportingTallyhubBridge.h"
#include "Statistics/VXReportingWattmarkUtility.h"
#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

class RoutingTest : public ServiceTest {};

TEST_F(RoutingTest, StartTakesItsSnapshotAfterStartingAndHoldsTheReply) {
  drivers.write("Speaker/x", "1");
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
  drivers.write("Speaker/x", "4");
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

}  // namespace
}  // namespace vx
