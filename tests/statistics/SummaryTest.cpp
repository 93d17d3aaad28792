#include <cmath>
#include <ctime>

#include "Statistics/Service/VXReportingSummaryEvent.h"
#include "base/Bytes.h"
#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

class SummaryTest : public SessionTest {
 protected:
  SummaryTest() { p.services.internalBuild = true; }
};

// Sixteen bytes of ASCII each: the standard library's own hash is one for all of them.
std::vector<std::string> collidingKeys(std::size_t count) {
  constexpr uint64_t kFactor = 0xc6a4a7935bd1e995u;
  uint64_t inverse = kFactor;
  for (int i = 0; i < 6; ++i) inverse *= 2 - kFactor * inverse;
  const auto mix = [](uint64_t value) { return value ^ value >> 47; };
  std::vector<std::string> keys;
  for (uint64_t n = 0; keys.size() < count; ++n) {
    uint64_t words[2] = {};
    for (unsigned i = 0; i < 8; ++i) words[0] |= (n >> 7 * i & 127) << 8 * i;
    const uint64_t first =
        (0xc70f6907u ^ 16 * kFactor ^ mix(words[0] * kFactor) * kFactor) * kFactor;
    words[1] = mix((first ^ 1) * inverse) * inverse;
    if ((words[1] & kHighBits) == 0) keys.emplace_back(reinterpret_cast<char*>(words), 16);
  }
  return keys;
}

TEST_F(SummaryTest, KeysThatWereMadeToCollideTakeNoLongerThanOthers) {
  const std::vector<std::string> colliding = collidingKeys(10000);
  const std::hash<std::string_view> hash;
  ASSERT_EQ(hash(colliding.front()), hash(colliding.back()));
  const auto secondsFor = [](const auto& keyAt) {
    PayloadBuilder keys;
    for (std::size_t i = 0; i < 10000; ++i) keys.set(keyAt(i), 1);
    VXReportingRow row;
    row.dictionary = keys.build();
    const std::clock_t began = std::clock();
    VXReportingSummaryEvent event(3);
    event.add(row);
    EXPECT_GT(event.build().encoded().size(), 10000 * 16u);
    return static_cast<double>(std::clock() - began) / CLOCKS_PER_SEC;
  };
  const double usual =
      secondsFor([](std::size_t i) { return std::to_string(1000000000000000 + i); });
  EXPECT_LT(secondsFor([&](std::size_t i) { return colliding[i]; }), 10 * usual + 0.02);
}

TEST_F(SummaryTest, EventThenFileThenFlush) {
  const auto s = startedSession();
  s->setConfiguration(dictionary("HostApplicationDisplayID", "../a b"));
  s->sendMessage(dictionary("a b", 1), 3, 1, nullptr);
  run();
  s->writeSummaryJson();  // the stop writes once more, with one more header
  mark();
  s->stop();
  run();
  std::string seen = told("stop");
  EXPECT_EQ(p.services.files.size(), 1u);
  EXPECT_EQ(p.services.files.begin()->second, dataFile("summary.json"));
  EXPECT_GT(p.threading.freedBytes, 0u);
  s->start();
  run();
  mark();
  s->stop();
  s->stop();
  EXPECT_EQ(seen + told("stop without anything received"), dataFile("stopping.txt"));
}

TEST_F(SummaryTest, FailuresAreLoggedAndTheStopGoesOn) {
  const Payload bad = dictionary("bad", std::nan(""));
  const Payload large = dictionary("a", std::string(70000, 'x'));
  p.services.directoryError = Error{"posix", 13, "denied"};  // the file is tried all the same
  for (const auto& [header, sent, fails] :
       {std::tuple(bad, message, "dataWithJSONObject: "),
        {message, bad, "dataWithJSONObject: "},
        {message, large, "jsonOutput writeToURL: full (posix, code 28)"}}) {
    const auto s = startedSession();
    s->setConfiguration(header);
    s->sendMessage(sent, 3, 1, nullptr);
    p.services.writeError = Error{"posix", 28, "full"};  // of the first piece
    mark();
    s->stop();
    EXPECT_THAT(gained({" error "}),
                UnorderedElementsAre(HasSubstr(fails), HasSubstr("denied (posix, code 13)")));
    EXPECT_FALSE(s->started());
  }
  EXPECT_THAT(p.services.files, IsEmpty());
}

}  // namespace
}  // namespace vx
