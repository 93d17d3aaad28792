#include <sstream>

#include "Statistics/VXReportingUtility.h"
#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

class VocabularyTest : public PlatformTest {};

TEST_F(VocabularyTest, EveryCodeHasAName) {
  std::ostringstream names;
  for (uint32_t code = 0; code < 65536; code += code < 14 ? 1 : code < 65534 ? 65520 : 1)
    names << code << " " << VXReportingServiceTypeName(static_cast<uint16_t>(code)) << " "
          << VXReportingMessageTypeName(static_cast<uint16_t>(code)) << "\n";
  for (const MessageCategory code :
       {0u, 1u, 2u, 3u, 4u, 0x08000005u, 6u, 0x40000007u, 8u, 0x10000009u, 10u, 11u, 0x2000000Cu,
        0x30000001u, 0x80000000u, 0xFFFFFFFFu, 0x0000FFFFu, 0x00010001u, 0xFFFF0001u}) {
    names << std::hex << code << " " << VXReportingCategoryName(code) << "\n";
    EXPECT_EQ(messageKindName(messageKind(code, 4), '.'), VXReportingCategoryName(code) + ".Error");
  }
  EXPECT_EQ(names.str(), dataFile("names.txt"));
}

TEST_F(VocabularyTest, HostApplicationIsPassedThroughWhateverItIs) {
  auto stored = [](const std::optional<Payload>& from) {
    PayloadBuilder builder;
    VXReportingHostApplicationDisplayID(from).storeUnder("k", builder);
    return builder.build();
  };
  EXPECT_EQ(stored(std::nullopt), dictionary("k", "Unknown"));
  EXPECT_EQ(stored(dictionary("other", 1)), dictionary("k", "Unknown"));
  EXPECT_EQ(stored(dictionary("HostApplicationDisplayID", 7)), dictionary("k", 7));
}

TEST_F(VocabularyTest, UnrelatedSignalStartsAWholeNewLimit) {
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
