#include "Statistics/VXReportingUtility.h"
#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

TEST(Vocabulary, EveryCodeHasAName) {
  std::string services, kinds, types;
  for (ServiceType type = 0; type < 13; ++type)
    services += std::string(VXReportingServiceTypeName(type)) + " ";
  EXPECT_EQ(services,
            "generic ondi telephony haptics alarms standalone soundautoconfig longformaudio "
            "nonlongformaudio audiodeviceusage alerts test apiusage ");
  for (MessageCategory kind = 0; kind < 12; ++kind) kinds += VXReportingCategoryName(kind) + " ";
  EXPECT_EQ(kinds,
            "Undefined Generic Record Playback PlaybackAndRecord Setup ClientRequest RouteChange "
            "Error ChannelReporting Performance Volume ");
  for (MessageType type = 0; type < 7; ++type)
    types += std::string(VXReportingMessageTypeName(type)) + " ";
  EXPECT_EQ(types, "Generic Start Stop Setup Error IssueDetector Undefined ");
  EXPECT_EQ(VXReportingServiceTypeName(13), "telephony");
  EXPECT_EQ(VXReportingServiceTypeName(65534), "telephony");
  EXPECT_EQ(VXReportingServiceTypeName(65535), "unknown");
  EXPECT_EQ(VXReportingMessageTypeName(65534), "Undefined");
  EXPECT_EQ(VXReportingMessageTypeName(65535), "Unknown");
  const std::pair<MessageCategory, const char*> categories[] = {
      {0x08000005, "Session_Setup"},
      {0x40000007, "Routing_RouteChange"},
      {0x10000009, "DSP_ChannelReporting"},
      {0x30000001, "_Generic"},
      {0x80000000, "Toolbox_Undefined"},
      {0xFFFFFFFF, "Undefined"},
      {0x0000FFFF, "Undefined"},
      {0x00010001, "_Generic"},
      {0xFFFF0001, "_Generic"},
      {0x2000000C, "HAL_Undefined"}};
  for (const auto& [code, name] : categories) {
    EXPECT_EQ(VXReportingCategoryName(code), name) << std::hex << code;
    EXPECT_EQ(messageKindName(messageKind(code, 4), '.'), std::string(name) + ".Error");
  }
}

TEST(Vocabulary, HostApplicationIsPassedThroughWhateverItIs) {
  auto stored = [](const std::optional<Payload>& from) {
    PayloadBuilder builder;
    VXReportingHostApplicationDisplayID(from).storeUnder("k", builder);
    return builder.build().text();
  };
  EXPECT_EQ(stored(std::nullopt), "{k=Unknown}");
  EXPECT_EQ(stored(PayloadBuilder().set("other", 1).build()), "{k=Unknown}");
  const Payload odd = PayloadBuilder().set("HostApplicationDisplayID", 7).build();
  PayloadBuilder builder;
  VXReportingHostApplicationDisplayID(odd).storeUnder("k", builder);
  EXPECT_EQ(builder.build().find("k")->kind(), ValueKind::Integer);
}

TEST(Vocabulary, InternalBuildIsAskedOnce) {
  fakes::FakePlatform p;
  const VXReportingProcessState processState;
  p.services.internalBuild = true;
  EXPECT_TRUE(VXReportingIsInternalBuild());
  p.services.internalBuild = false;
  EXPECT_TRUE(VXReportingIsInternalBuild());
  EXPECT_EQ(p.services.internalBuildQuestions, 1);
}

class WaitTest : public ::testing::Test {
 protected:
  bool wait(double seconds) {
    return VXReportingUtilityWait(*condition, done, "waiting", "gave up", nullptr, seconds);
  }
  void signalAt(std::chrono::seconds when, bool sets) {
    p.threading.at(when, [this, sets] {
      done = done || sets;
      condition->signal();
    });
  }
  fakes::FakePlatform p;
  std::unique_ptr<Condition> condition = p.threading.makeCondition();
  bool done = false;
};

TEST_F(WaitTest, SetFlagReturnsAtOnceWithoutAWord) {
  done = true;
  EXPECT_TRUE(wait(9));
  EXPECT_THAT(p.log.lines, IsEmpty());
}

TEST_F(WaitTest, UnrelatedSignalStartsAWholeNewLimit) {
  signalAt(std::chrono::seconds(8), false);
  signalAt(std::chrono::seconds(16), true);
  EXPECT_TRUE(wait(9));
  EXPECT_THAT(p.log.lines, ElementsAre("system default waiting", "system default continuing",
                                       "system default waiting", "system default continuing"));
  EXPECT_EQ(p.log.functions[0], "VXReportingUtilityWait");
}

}  // namespace
}  // namespace vx
