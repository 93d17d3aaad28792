#include <gtest/gtest.h>

#include <stdexcept>
#include <thread>
#include <vector>

#include "platform/linux/execution/SystemThreading.h"
#include "tests/fakes/FakePlatform.h"
#include "tests/linux/Latch.h"

namespace vx::lnx {
namespace {

using namespace std::chrono_literals;

TEST(RunLoopTest, TimersFireInOrderOfTimeAndMoveAndGoFromOtherThreads) {
  fakes::FakePlatform p;
  SystemThreading threading(p.queues.background());
  SystemClock clock;
  const auto loop = threading.makeRunLoop();
  std::vector<int> fired;
  Latch running;
  const auto far = threading.makeTimer(1h, [&] { fired.push_back(3); });
  const auto gone = threading.makeTimer(1h, [] { FAIL(); });
  const auto second = threading.makeTimer(2ms, [&] {
    fired.push_back(2);
    running.open();
    throw std::runtime_error("leaves the loop");
  });
  const auto first = threading.makeTimer(1ms, [&] { fired.push_back(1); });
  for (const auto& timer : {far, gone, second, first}) loop->attach(timer);
  std::thread other([&] {
    running.wait();
    gone->invalidate();
    far->setFireTime(clock.monotonic());
  });
  EXPECT_THROW(loop->runUntilEmpty(), std::runtime_error);
  loop->runUntilEmpty();
  other.join();
  EXPECT_EQ(fired, (std::vector<int>{1, 2, 3}));
}

TEST(FreedMemory, GoesBackInOneStepTwoSecondsAfterAMegabyteWasFreed) {
  fakes::FakePlatform p;
  int trims = 0;
  SystemThreading threading(p.queues.background(), [&] { ++trims; });
  threading.memoryWasFreed((1 << 20) - 1);
  EXPECT_FALSE(p.queues.nextDue());
  for (int i = 0; i < 100; ++i) threading.memoryWasFreed(1 << 20);
  p.queues.advance(1999ms);
  EXPECT_EQ(trims, 0);
  p.queues.advance(1ms);
  EXPECT_EQ(trims, 1);
  p.queues.advance(2s);  // for those that came while one was pending
  EXPECT_EQ(trims, 2);
  EXPECT_FALSE(p.queues.nextDue());
  threading.memoryWasFreed(1 << 20);
  p.queues.advance(2s);
  EXPECT_EQ(trims, 3);
  EXPECT_FALSE(p.queues.nextDue());
}

}  // namespace
}  // namespace vx::lnx
