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

}  // namespace
}  // namespace vx
