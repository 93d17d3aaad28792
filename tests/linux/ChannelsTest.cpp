#include <sys/stat.h>

#include <cerrno>
#include <climits>
#include <map>

#include "platform/linux/device/CounterChannels.h"
#include "tests/linux/FolderTest.h"

namespace vx::lnx {
namespace {

using ::testing::Pair;
using Counters = std::multimap<std::string, int64_t>;
using Name = std::optional<std::string>;

class ChannelsTest : public FolderTest {
 protected:
  ChannelsTest() { drivers.root = folder + "/drivers"; }
  DriverOptions drivers;
};

// One driver group, from the channels it has to their samples.
class Group {
 public:
  Group(CounterChannels& channels, const Name& group, const Name& subGroup) : channels_(channels) {
    const ChannelDictionaryRef set = channels.copyChannelsInGroup(group, subGroup, 0, error);
    if (set == nullptr) return;
    count = channels.channelCount(*set);
    subscription_ = channels.createSubscription(set, subscribed_);
  }
  ChannelDictionaryRef sample() {
    return channels_.createSamples(subscription_, subscribed_, error);
  }
  Counters values(const ChannelDictionaryRef& samples) {
    Counters found;
    if (samples == nullptr) return found;
    channels_.iterateSamples(*samples, [&](const ChannelSample& sample) {
      found.emplace(*channels_.channelName(sample), channels_.simpleIntegerValue(sample, 0));
      return 0;
    });
    return found;
  }
  std::optional<Error> error;
  int count = -1;  // no channel set

 private:
  CounterChannels& channels_;
  ChannelSubscription* subscription_ = nullptr;
  ChannelDictionaryRef subscribed_;
};

TEST_F(ChannelsTest, CountersAreReadStrictly) {
  for (const auto& [text, value] : {std::pair("17\n", int64_t{17}),
                                    {"-3", -3},
                                    {"0x1F", 31},
                                    {"9223372036854775807", INT64_MAX}})
    EXPECT_EQ(*parseCounter(text), value);
  EXPECT_EQ(parseCounter("9223372036854775808").status().code(), ERANGE);
  for (const char* bad : {"", "\n", "x", "1 2", "1\n\n", "0x", "0x-1", "+-1", "1.5"})
    EXPECT_EQ(parseCounter(bad).status().code(), EINVAL) << bad;
}

TEST_F(ChannelsTest, CountersMoveVanishAndWrap) {
  write("drivers/Speaker/kept", "0x10\n");
  write("drivers/Speaker/gone", "1");
  write("drivers/Speaker/wraps", std::to_string(INT64_MAX));
  write("drivers/Speaker/L/kept", "5");
  CounterChannels channels(drivers);
  Group group(channels, "Speaker", std::nullopt);
  EXPECT_EQ(group.count, 4);
  const auto before = group.sample();
  write("drivers/Speaker/kept", "12");
  write("drivers/Speaker/wraps", std::to_string(INT64_MIN));
  write("drivers/Speaker/L/kept", "8");
  std::filesystem::remove(folder + "/drivers/Speaker/gone");
  const auto after = group.sample();
  EXPECT_THAT(group.values(channels.createSamplesDelta(before, after, group.error)),
              testing::UnorderedElementsAre(Pair("kept", -4), Pair("kept", 3), Pair("wraps", 1)));
}

TEST_F(ChannelsTest, OneBadFileIsLeftOutAndNamedOnceAndAnEmptyOneIsForNow) {
  write("drivers/Speaker/bad", "12 apples");
  write("drivers/Speaker/good", "1");
  write("drivers/Speaker/written", "");
  CounterChannels channels(drivers);
  Group group(channels, "Speaker", std::nullopt);
  const auto before = group.sample();
  write("drivers/Speaker/good", "3");
  write("drivers/Speaker/written", "9");
  const auto after = group.sample();
  EXPECT_THAT(group.values(after), ElementsAre(Pair("good", 3), Pair("written", 9)));
  EXPECT_THAT(group.values(channels.createSamplesDelta(before, after, group.error)),
              ElementsAre(Pair("good", 2)));
  EXPECT_FALSE(group.error);
  EXPECT_THAT(p.log.lines, ElementsAre(HasSubstr("drivers/Speaker/bad")));
}

TEST_F(ChannelsTest, ChannelsComeFromRegularFilesOfTheGroupAlone) {
  CounterChannels channels(drivers);
  EXPECT_EQ(Group(channels, std::nullopt, "MCA").count, -1);  // not even a root
  write("drivers/README", "text");
  write("drivers/A/MCA/x", "1");
  write("drivers/B/MCA/x", "2");
  write("drivers/B/Other/y", "3");
  write("drivers/B/.hidden", "4");
  ASSERT_EQ(mkfifo((folder + "/drivers/A/MCA/fifo").c_str(), 0666), 0);
  Group mca(channels, std::nullopt, "MCA");
  EXPECT_THAT(mca.values(mca.sample()), ElementsAre(Pair("x", 1), Pair("x", 2)));
  EXPECT_EQ(Group(channels, "B", std::nullopt).count, 2);
  EXPECT_EQ(Group(channels, std::nullopt, std::nullopt).count, 3);
}

TEST_F(ChannelsTest, ThoseBeyondALimitAreLeftOutAndSaid) {
  for (int i = 0; i < 4096; ++i) write("drivers/A/" + std::to_string(i), "1");
  CounterChannels channels(drivers);
  EXPECT_EQ(Group(channels, "A", std::nullopt).count, 4096);
  write("drivers/A/more", "1");
  write("drivers/B/more", "1");
  EXPECT_EQ(Group(channels, std::nullopt, std::nullopt).count, 4096);
  EXPECT_THAT(p.log.lines, ElementsAre(HasSubstr("more than 4096 channels")));
}

// A stream that is opened and closed while a session runs, and a folder of counters.
TEST_F(ChannelsTest, MappedSourcesFollowTheKernel) {
  const std::string status = "asound/card0/pcm0p/sub0/status";
  write(status, "closed\n");
  write("statistics/rx_packets", "7\n");
  drivers.mapped = {
      {"Alsa", "", MappedChannelSource::Kind::AlsaProc, folder + "/asound"},
      {"Codec", "MCA", MappedChannelSource::Kind::Statistics, folder + "/statistics"}};
  CounterChannels channels(drivers);
  Group alsa(channels, "Alsa", std::nullopt);
  EXPECT_EQ(alsa.count, 5);
  const auto closed = alsa.sample();
  EXPECT_THAT(alsa.values(closed), testing::Each(Pair(testing::_, 0)));
  write(status, "state: RUNNING\ndelay       : -5\nhw_ptr      : 4096\n");
  const auto open = alsa.sample();
  EXPECT_THAT(alsa.values(open), ElementsAre(Pair("card0_pcm0p_sub0_delay", -5),
                                             Pair("card0_pcm0p_sub0_hw_ptr", 4096)));
  EXPECT_THAT(
      alsa.values(channels.createSamplesDelta(closed, open, alsa.error)),
      ElementsAre(Pair("card0_pcm0p_sub0_delay", -5), Pair("card0_pcm0p_sub0_hw_ptr", 4096)));
  EXPECT_FALSE(alsa.error);
  Group codec(channels, std::nullopt, "MCA");
  EXPECT_THAT(codec.values(codec.sample()), ElementsAre(Pair("rx_packets", 7)));
}

}  // namespace
}  // namespace vx::lnx
