#include <gtest/gtest.h>

#include <vector>

#include "platform/linux/StopDeadline.h"
#include "tests/fakes/FakeExecution.h"

namespace vx::lnx {
namespace {

using namespace std::chrono_literals;

// Seconds after which a stop is over whose work moves on every `step` until `until`.
TEST(StopDeadlineTest, ASlowDiskGetsMoreTimeWhileSomethingIsDone) {
  struct Case {
    std::chrono::seconds step, until, ends;
    std::size_t questions;
  };
  for (const Case& c : {Case{60s, 0s, 5s, 0},
                        {1s, 2s, 5s, 0},
                        {1s, 3s, 6s, 1},
                        {2s, 30s, 33s, 28},
                        {4s, 30s, 7s, 2},
                        {1s, 90s, 40s, 35}}) {
    SCOPED_TRACE(c.ends.count());
    fakes::FakeClock clock;
    const Monotonic began = clock.steady;
    std::vector<std::chrono::milliseconds> asked;
    StopDeadline deadline(clock, began, {.first = 5s, .pause = 3s, .most = 40s},
                          [&](std::chrono::milliseconds time) { asked.push_back(time); });
    const auto passed = [&] { return clock.steady - began; };
    while (deadline.goOn(static_cast<uint64_t>(std::min(passed(), {c.until}) / c.step))) {
      ASSERT_LE(deadline.nextLook() - clock.steady, 100ms);
      clock.advance(100ms);
    }
    EXPECT_EQ(passed(), c.ends);
    EXPECT_EQ(asked, std::vector<std::chrono::milliseconds>(c.questions, 3s));
  }
}

}  // namespace
}  // namespace vx::lnx
