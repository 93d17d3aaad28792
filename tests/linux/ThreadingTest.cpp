#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <stdexcept>
#include <thread>
#include <vector>

#include "Statistics/Service/VXReportingBlockThrottle.h"
#include "platform/linux/execution/SystemThreading.h"
#include "tests/fakes/FakePlatform.h"

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
  fakes::FakePlatform p;
  SystemThreading threading{p.queues.background()};
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
  fakes::FakePlatform p;
  SystemThreading threading(p.queues.background());
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

// The process may end while deliveries are pending: they do not happen, and nothing waits for them.
[[noreturn]] void exitWithADeliveryPending() {
  fakes::FakePlatform p;
  SystemThreading threading(p.queues.background());
  SystemClock clock;
  auto& s = p.services;
  Platform real{p.listener, p.queues, clock, threading, s, s, s,     s, s,
                p.vyr,      s,        s,     s,         s, s, p.log, s, s};
  installPlatform(&real);
  const auto throttle = VXReportingBlockThrottle::create();
  std::atomic<bool> ran{false};
  throttle->addMessageBlock([&] { ran = true; }, 1, Payload(), 1, 1);
  throttle->waitForCompletion();
  if (!ran) std::_Exit(2);
  const Payload late = PayloadBuilder().set("_throttle_seconds", 4.9).build();
  throttle->addMessageBlock([] { std::_Exit(3); }, 1, late, 1, 1);
  std::this_thread::sleep_for(150ms);  // long enough for the worker to attach it
  std::exit(0);
}

TEST(ThrottleAtExitDeathTest, PendingDeliveriesDoNotHoldTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(exitWithADeliveryPending(), ::testing::ExitedWithCode(0), "");
}

}  // namespace
}  // namespace vx::lnx
