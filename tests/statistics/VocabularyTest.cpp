#include "Statistics/VXReportingUtility.h"
#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

TEST(Vocabulary, EveryCodeHasAName) {
  const auto names = [](auto name, uint16_t count) {
    std::string text;
    for (uint16_t code = 0; code < count; ++code) text += std::string(name(code)) + " ";
    return text;
  };
  EXPECT_EQ(names(VXReportingServiceTypeName, 14),
            "generic ondi telephony haptics alarms standalone soundautoconfig longformaudio "
            "nonlongformaudio audiodeviceusage alerts test apiusage telephony ");
  EXPECT_EQ(names(VXReportingCategoryName, 12),
            "Undefined Generic Record Playback PlaybackAndRecord Setup ClientRequest RouteChange "
            "Error ChannelReporting Performance Volume ");
  EXPECT_EQ(names(VXReportingMessageTypeName, 7),
            "Generic Start Stop Setup Error IssueDetector Undefined ");
  EXPECT_EQ(VXReportingServiceTypeName(65534), "telephony");
  EXPECT_EQ(VXReportingServiceTypeName(65535), "unknown");
  EXPECT_EQ(VXReportingMessageTypeName(65534), "Undefined");
  EXPECT_EQ(VXReportingMessageTypeName(65535), "Unknown");
  for (const auto& [code, name] : {std::pair(MessageCategory{0x08000005}, "Session_Setup"),
                                   {0x40000007, "Routing_RouteChange"},
                                   {0x10000009, "DSP_ChannelReporting"},
                                   {0x30000001, "_Generic"},
                                   {0x80000000, "Toolbox_Undefined"},
                                   {0xFFFFFFFF, "Undefined"},
                                   {0x0000FFFF, "Undefined"},
                                   {0x00010001, "_Generic"},
                                   {0xFFFF0001, "_Generic"},
                                   {0x2000000C, "HAL_Undefined"}}) {
    EXPECT_EQ(VXReportingCategoryName(code), name) << std::hex << code;
    EXPECT_EQ(messageKindName(messageKind(code, 4), '.'), std::string(name) + ".Error");
  }
}

TEST(Vocabulary, HostApplicationIsPassedThroughWhateverItIs) {
  auto stored = [](const std::optional<Payload>& from) {
    PayloadBuilder builder;
    VXReportingHostApplicationDisplayID(from).storeUnder("k", builder);
    return builder.build();
  };
  EXPECT_EQ(stored(std::nullopt), dictionary("k", "Unknown"));
  EXPECT_EQ(stored(dictionary("other", 1)), dictionary("k", "Unknown"));
  EXPECT_EQ(stored(dictionary("HostApplicationDisplayID", 7)), dictionary("k", 7));
}

class WaitTest : public PlatformTest {};

TEST_F(WaitTest, UnrelatedSignalStartsAWholeNewLimit) {
  const std::unique_ptr<Condition> condition = p.threading.makeCondition();
  bool done = false;
  const auto wait = [&] {
    return VXReportingUtilityWait(*condition, done, "waiting", "gave up", nullptr, 9);
  };
  p.threading.at(8s, [&] { condition->signal(); });
  p.threading.at(16s, [&] {
    done = true;
    condition->signal();
  });
  EXPECT_TRUE(wait());
  EXPECT_TRUE(wait());  // set already: at once, without a word
  EXPECT_THAT(p.log.lines, ElementsAre("system default waiting", "system default continuing",
                                       "system default waiting", "system default continuing"));
  EXPECT_EQ(p.log.functions[0], "VXReportingUtilityWait");
}

}  // namespace
}  // namespace vx
