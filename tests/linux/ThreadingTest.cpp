#include <gtest/gtest.h>

#include <stdexcept>
#include <thread>
#include <vector>

#include "platform/linux/SystemThreading.h"

namespace vx::lnx {
namespace {

using namespace std::chrono_literals;

class RunLoopTest : public ::testing::Test {
 protected:
  std::shared_ptr<OneShotTimer> attach(std::chrono::milliseconds delay, int name) {
    auto timer = threading.makeTimer(delay, [this, name] { fired.push_back(name); });
    loop->attach(timer);
    return timer;
  }
  SystemThreading threading;
  SystemClock clock;
  std::unique_ptr<RunLoop> loop = threading.makeRunLoop();
  std::vector<int> fired;
};

TEST_F(RunLoopTest, FiresInOrderOfTimeAndEnds) {
  attach(20ms, 2);
  attach(5ms, 1);
  loop->runUntilEmpty();
  EXPECT_EQ(fired, (std::vector<int>{1, 2}));
  loop->runUntilEmpty();
}

TEST_F(RunLoopTest, TimersMoveAndGoFromOtherThreads) {
  const auto far = attach(1h, 1);
  const auto gone = attach(1h, 2);
  std::thread other([&] {
    std::this_thread::sleep_for(5ms);
    gone->invalidate();
    far->setFireTime(clock.monotonic());
  });
  loop->runUntilEmpty();
  other.join();
  EXPECT_EQ(fired, (std::vector<int>{1}));
}

TEST_F(RunLoopTest, MovingWhileFiringChangesNothingAndExceptionsLeave) {
  std::shared_ptr<OneShotTimer> self;
  self = threading.makeTimer(0ms, [&] {
    self->setFireTime(clock.monotonic());
    throw std::runtime_error("action");
  });
  loop->attach(self);
  attach(1ms, 2);
  EXPECT_THROW(loop->runUntilEmpty(), std::runtime_error);
  loop->runUntilEmpty();
  EXPECT_EQ(fired, (std::vector<int>{2}));
}

TEST(SystemConditionTest, SignalEndsAWaitAndTheDeadlineDoesToo) {
  SystemThreading threading;
  SystemClock clock;
  const std::shared_ptr<Condition> condition = threading.makeCondition();
  condition->lock();
  EXPECT_FALSE(condition->waitUntil(clock.monotonic() + 5ms));
  const auto thread = threading.startThread("signaller", [condition] {
    condition->lock();
    condition->signal();
    condition->unlock();
  });
  EXPECT_TRUE(condition->waitUntil(clock.monotonic() + 30s));
  condition->unlock();
}

}  // namespace
}  // namespace vx::lnx
