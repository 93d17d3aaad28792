#include <gtest/gtest.h>

#include "platform/linux/QuietMoments.h"
#include "tests/fakes/FakeExecution.h"

namespace vx::lnx {
namespace {

TEST(QuietMomentsTest, AfterLoadAFewTimesAndNeverWithoutIt) {
  fakes::FakeClock clock;
  uint64_t done = 0;
  int quiet = 0;
  QuietMoments moments(clock, [&] { ++quiet; });
  const auto passes = [&](uint64_t each) {  // the times it wanted to be woken in a minute
    int woken = 0;
    for (int second = 0; second < 60; ++second) {
      clock.advance(std::chrono::seconds(1));
      moments.afterPass(done += each);
      if (!moments.nextDue() || *moments.nextDue() > clock.steady) continue;
      moments.onDue();
      ++woken;
    }
    return woken;
  };
  EXPECT_EQ(passes(16), 0) << "little to do";
  EXPECT_EQ(passes(0), 0);
  EXPECT_GE(passes(100), 8);
  EXPECT_EQ(quiet, 0);
  EXPECT_EQ(passes(1), QuietMoments::kTimes + 1);
  EXPECT_EQ(quiet, QuietMoments::kTimes);
  EXPECT_EQ(passes(0), 0);
}

}  // namespace
}  // namespace vx::lnx
