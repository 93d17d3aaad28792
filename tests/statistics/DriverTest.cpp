#include "Statistics/VXReportingDriverUtility.h"
#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

class DriverTest : public ::testing::Test {
 protected:
  fakes::FakeServices::Group& group(const std::string& name,
                                    std::map<std::string, int64_t> channels) {
    p.services.groups[name].channels = std::move(channels);
    return p.services.groups[name];
  }
  std::vector<std::string> subscribed(const VXReportingDriverUtility& utility) {
    std::vector<std::string> names;
    for (const auto& s : utility.ioChannelSubscriptions()) names.push_back(s.driver->description());
    return names;
  }
  fakes::FakePlatform p;
};

TEST_F(DriverTest, SubscribesInListOrderToGroupsWithChannels) {
  group("Haptics-Stats", {{"x", 1}});
  group("QuorvelAE2MCA-(null)", {{"x", 1}});
  group("Speaker-(null)", {});
  group("(null)-MCA", {{"x", 1}}).lookupError = Error{"d", -5, ""};
  const VXReportingDriverUtility utility;
  EXPECT_THAT(subscribed(utility),
              ElementsAre("QuorvelAE2MCA-(null)", "(null)-MCA", "Haptics-Stats"));
  EXPECT_THAT(p.log.lines,
              ElementsAre("vxrd info creating channelreporting driver utility",
                          "vxrd default subscribed to group group QuorvelAE2MCA-(null)",
                          "vxrd info couldn't find any channels for driver group Speaker-(null)",
                          "vxrd default subscribed to group group Speaker-(null)",
                          "vxrd error error -5 getting channels for driver (null)-MCA",
                          "vxrd default subscribed to group group (null)-MCA",
                          "vxrd default subscribed to group group Haptics-Stats"));
}

TEST_F(DriverTest, NoGroupsNoWordsNoStatistics) {
  p.log.refuseScopes = true;
  const VXReportingDriverUtility utility;
  EXPECT_TRUE(utility.getSnapShot()->empty());
  EXPECT_EQ(utility.getDriverStatisticsRelativeToSnapShot(nullptr), std::nullopt);
  EXPECT_THAT(p.log.lines, ElementsAre("system info creating channelreporting driver utility"));
}

TEST_F(DriverTest, OnlyGrowthOfAtLeastOneIsReported) {
  auto& speaker = group("Speaker-(null)", {{"up", 1}, {"same", 5}, {"down", 9}, {"one", 0}});
  group("(null)-MCA", {{"c", 3}});
  group("Haptics-Stats", {{"c", 3}});
  const VXReportingDriverUtility utility;
  const auto snapShot = utility.getSnapShot();
  speaker.channels = {{"up", 11}, {"same", 5}, {"down", 2}, {"one", 1}};
  p.services.groups["(null)-MCA"].channels["c"] = 4;
  p.services.groups["Haptics-Stats"].channels["c"] = 5;
  EXPECT_EQ(utility.getDriverStatisticsRelativeToSnapShot(snapShot)->text(),
            "{Speaker_one=1,Speaker_up=10,MCA_c=1,Haptics_Stats_c=2}");
  EXPECT_EQ(utility.getDriverStatisticsRelativeToSnapShot(nullptr)->find("Speaker_up")->text(),
            "11");
  speaker.nameless = true;
  EXPECT_TRUE(utility.getDriverStatisticsRelativeToSnapShot(snapShot)->contains("Speaker_"));
}

TEST_F(DriverTest, FailuresOfOneDriverLeaveTheOthersAlone) {
  auto& speaker = group("Speaker-(null)", {{"s", 10}});
  auto& haptics = group("Haptics-Stats", {{"h", 10}});
  const VXReportingDriverUtility utility;
  speaker.sampleError = Error{"d", 13, ""};
  auto snapShot = utility.getSnapShot();
  EXPECT_EQ(snapShot->size(), 1u);
  EXPECT_EQ(p.log.lines.back(), "vxrd info sampling driver Haptics-Stats");
  EXPECT_THAT(p.log.lines, Contains("vxrd error ChannelReportCreateSamples error 13"));
  haptics.channels["h"] = 12;
  EXPECT_EQ(utility.getDriverStatisticsRelativeToSnapShot(snapShot)->text(), "{Haptics_Stats_h=2}");
  speaker.sampleError
      .reset();  // not in the snapshot: absolute values beside the others' differences
  EXPECT_EQ(utility.getDriverStatisticsRelativeToSnapShot(snapShot)->text(),
            "{Speaker_s=10,Haptics_Stats_h=2}");
  EXPECT_THAT(p.log.lines, Contains("vxrd error ChannelReportCreateSamplesDelta error 22"));
}

}  // namespace
}  // namespace vx
