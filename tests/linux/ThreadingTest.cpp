#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <thread>

#include "Statistics/Service/VXReportingBlockThrottle.h"
#include "platform/linux/execution/SystemThreading.h"
#include "tests/fakes/FakePlatform.h"
#include "tests/linux/Latch.h"

namespace vx::lnx {
namespace {

using namespace std::chrono_literals;

TEST(RunLoopTest, TimersMoveAndGoFromOtherThreads) {
  fakes::FakePlatform p;
  SystemThreading threading(p.queues.background());
  SystemClock clock;
  const auto loop = threading.makeRunLoop();
  bool fired = false;
  Latch running;
  const auto far = threading.makeTimer(1h, [&] { fired = true; });
  const auto gone = threading.makeTimer(1h, [] { FAIL(); });
  const auto first = threading.makeTimer(0ns, [&] { running.open(); });
  for (const auto& timer : {far, gone, first}) loop->attach(timer);
  std::thread other([&] {
    running.wait();
    gone->invalidate();
    far->setFireTime(clock.monotonic());
  });
  loop->runUntilEmpty();
  other.join();
  EXPECT_TRUE(fired);
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
  Platform real{p.listener,
                p.queues,
                clock,
                threading,
                s,
                s,
                s,
                s,
                s,
                p.vyr,
                s,
                s,
                fakes::FakePlatform::noChannels(),
                s,
                s,
                p.log,
                s,
                s};
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
