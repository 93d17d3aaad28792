#include "Statistics/VXReportingDriverUtility.h"
#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

class DriverTest : public PlatformTest {
 protected:
  void counters(std::initializer_list<std::pair<const char*, const char*>> values) {
    for (const auto& [name, value] : values) drivers.write(name, value);
  }
};

TEST_F(DriverTest, SubscribesInListOrderToGroupsWithChannels) {
  counters({{"Haptics/Stats/x", "1"}, {"QuorvelAE2MCA/x", "1"}, {"Codec/MCA/x", "1"}});
  std::filesystem::create_directory(std::filesystem::path(drivers.folder) / "Speaker");
  std::filesystem::create_symlink("Broken", std::filesystem::path(drivers.folder) / "Broken");
  const VXReportingDriverUtility utility;
  std::vector<std::string> names;
  for (const auto& s : utility.ioChannelSubscriptions()) names.push_back(s.driver->description());
  EXPECT_THAT(names, ElementsAre("QuorvelAE2MCA-(null)", "(null)-MCA", "Haptics-Stats"));
  EXPECT_EQ(told("subscribing"), dataFile("subscribing.txt"));
}

TEST_F(DriverTest, OnlyGrowthOfAtLeastOneIsReported) {
  counters({{"Speaker/up", "1"}, {"Speaker/same", "5"}, {"Speaker/down", "9"}});
  counters({{"Speaker/one", "0"}, {"Codec/MCA/c", "3"}, {"Haptics/Stats/c", "3"}});
  const VXReportingDriverUtility utility;
  const auto snapShot = utility.getSnapShot();
  counters({{"Speaker/up", "11"}, {"Speaker/down", "2"}, {"Speaker/one", "1"}});
  counters({{"Codec/MCA/c", "4"}, {"Haptics/Stats/c", "5"}});
  const auto since = [&](const auto& from) {
    return *utility.getDriverStatisticsRelativeToSnapShot(from);
  };
  EXPECT_EQ(since(snapShot).text(), "{Speaker_one=1,Speaker_up=10,MCA_c=1,Haptics_Stats_c=2}");
  EXPECT_EQ(since(nullptr).find("Speaker_up")->text(), "11");
  drivers.nameless = true;
  EXPECT_TRUE(since(snapShot).contains("Speaker_"));
}

TEST_F(DriverTest, FailuresOfOneDriverLeaveTheOthersAlone) {
  counters({{"Speaker/s", "1"}, {"Haptics/Stats/h", "10"}});
  const VXReportingDriverUtility utility;
  drivers.failNext = true;
  auto snapShot = utility.getSnapShot();
  EXPECT_EQ(snapShot->size(), 1u);
  EXPECT_EQ(p.log.lines.back(), "vxrd info sampling driver Haptics-Stats");
  EXPECT_THAT(p.log.lines, Contains("vxrd error ChannelReportCreateSamples error 9"));
  drivers.write("Haptics/Stats/h", "12");
  drivers.failNext = true;
  EXPECT_EQ(utility.getDriverStatisticsRelativeToSnapShot(snapShot)->text(), "{Haptics_Stats_h=2}");
  drivers.write("Speaker/s", "10");
  // Not in the snapshot: absolute values beside the others' differences.
  EXPECT_EQ(utility.getDriverStatisticsRelativeToSnapShot(snapShot)->text(),
            "{Speaker_s=10,Haptics_Stats_h=2}");
  EXPECT_THAT(p.log.lines, Contains("vxrd error ChannelReportCreateSamplesDelta error 22"));
}

TEST_F(ServiceTest, StartTakesItsSnapshotAfterStartingAndHoldsTheReply) {
  drivers.write("Speaker/x", "1");
  service = VXReportingServiceDelegate::create();
  auto& client = connect();
  create(client, 1);
  bool startedThen = false;
  drivers.onSample = [&] {
    p.journal.push_back("sample");
    startedThen = session(client, 1)->started();
  };
  const std::vector<std::string> steps = {"trace",     "sample",   "reply",
                                          "event com", "fetching", "default stopping"};
  start(client, 1);
  std::string seen = told("start", steps);
  EXPECT_TRUE(startedThen);
  start(client, 1);
  seen += told("start again", steps);
  drivers.write("Speaker/x", "4");
  stop(client, 1);
  seen += told("stop", steps);
  EXPECT_EQ(session(client, 1)->driverSnapShot(), nullptr);
  start(client, 1);
  onQueue([&] { session(client, 1)->stop(); });
  start(client, 1);  // held over another's stop
  EXPECT_EQ(seen + told("start after another stop", {"reply"}), dataFile("snapshot.txt"));
  EXPECT_TRUE(session(client, 1)->hasTransactionCompleteBlock());
}

}  // namespace
}  // namespace vx
