#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <latch>
#include <stdexcept>
#include <thread>
#include <vector>

#include "platform/linux/device/KernelRandom.h"
#include "platform/linux/execution/Executor.h"
#include "platform/linux/execution/SystemThreading.h"
#include "tests/fakes/FakePlatform.h"

namespace vx::lnx {
namespace {

using namespace std::chrono_literals;
using Queue = std::shared_ptr<WorkQueue>;

Monotonic soon() { return std::chrono::steady_clock::now() + 30s; }

class ExecutorTest : public ::testing::Test {
 protected:
  ~ExecutorTest() override { executor.stop(soon()); }
  Queue interactive() { return executor.makeSerial("i", QualityOfService::UserInteractive); }
  Queue utility() { return executor.makeSerial("u", QualityOfService::Utility); }
  fakes::FakePlatform p;
  UserAccounts accounts;
  Executor executor{accounts};
};

TEST_F(ExecutorTest, SleepingLoopIsWokenOncePerSleepAndRunsInOrder) {
  std::atomic<int> wakes{0};
  executor.setInteractiveWaker([&] { ++wakes; });
  executor.adoptInteractiveThread();
  const std::vector<Queue> queues{interactive(), interactive(), interactive()};
  EXPECT_TRUE(executor.prepareToSleep());
  std::vector<int> ran;
  std::thread([&] {
    for (int i = 0; i < 3; ++i) queues[i]->async([&, i] { ran.push_back(i); });
  }).join();
  EXPECT_EQ(wakes, 1);
  queues[0]->async([&] {  // from the thread itself: it is awake
    EXPECT_TRUE(queues[0]->isCurrent());
    queues[2]->async([&] { ran.push_back(3); });
  });
  EXPECT_EQ(wakes, 1);
  EXPECT_TRUE(ran.empty());
  EXPECT_FALSE(executor.prepareToSleep());
  EXPECT_FALSE(executor.runInteractive(100));
  EXPECT_EQ(ran, (std::vector<int>{0, 1, 2, 3}));
  EXPECT_TRUE(executor.prepareToSleep());
}

TEST_F(ExecutorTest, DelayedWorkJoinsInOrderOfItsTimeAndKeepsItsQueue) {
  const Monotonic start = std::chrono::steady_clock::now();
  std::vector<int> ran;
  std::latch done(2);
  Queue queue = utility();
  const WorkQueue& q = *queue;
  queue->asyncAfter(1h, [] { FAIL(); });
  queue->asyncAfter(30ms, [&] {
    EXPECT_GE(std::chrono::steady_clock::now() - start, 30ms);
    EXPECT_TRUE(q.isCurrent());
    EXPECT_FALSE(executor.background().isCurrent());
    ran.push_back(1);
    done.count_down();
  });
  queue->async([&] { ran.push_back(0); });
  EXPECT_FALSE(queue->isCurrent());
  queue.reset();
  executor.background().asyncAfter(1ms, [&] {
    EXPECT_TRUE(executor.background().isCurrent());
    done.count_down();
  });
  done.wait();
  EXPECT_EQ(ran, (std::vector<int>{0, 1}));
}

TEST_F(ExecutorTest, ManyQueuesKeepTheirOrderAcrossThreads) {
  constexpr int kItems = 40;
  std::vector<Queue> queues(500);
  for (Queue& queue : queues) queue = utility();
  std::vector<std::vector<int>> seen(queues.size());
  auto produce = [&](std::size_t parity) {
    for (int i = 0; i < kItems; ++i) {
      for (std::size_t q = parity; q < queues.size(); q += 2)
        queues[q]->async([&seen, q, i] { seen[q].push_back(i); });
    }
  };
  std::thread other(produce, 0);
  produce(1);
  other.join();
  ASSERT_TRUE(executor.drain(soon()));
  EXPECT_EQ(executor.utilityBacklog(), 0u);
  for (const auto& order : seen) {
    ASSERT_EQ(order.size(), static_cast<std::size_t>(kItems));
    EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
  }
}

TEST_F(ExecutorTest, BlockedQueuesDelayNobodyAndTheirWorkIsOnTheAccountOfWhoCausedIt) {
  const Cause cause{.user = accounts.enter(501).value()};
  const auto waiting = [&] { return accounts.bytes(cause.user, MemoryKind::Waiting); };
  std::latch release(1);
  std::atomic<int> done{0};
  std::vector<Queue> queues(200);
  for (Queue& queue : queues) {
    queue = utility();
    const CauseScope scope(cause);
    queue->async(
        [&] {
          Blocking blocking(executor);
          release.wait();
          ++done;
          executor.background().async([&] { ++done; });
        },
        1000);
  }
  std::latch served(1);
  const Queue other = utility();
  other->async([&] { served.count_down(); });
  served.wait();
  for (int i = 0; i < 2; ++i) executor.background().async([&] { release.wait(); });
  std::latch prompt(1);
  executor.runPromptly([&] { prompt.count_down(); });
  prompt.wait();  // with every other thread held up
  EXPECT_GE(executor.utilityBacklog(), 200u);
  EXPECT_EQ(done, 0);
  EXPECT_EQ(waiting(), 200 * (1000 + int64_t{sizeof(WorkItem)}));
  release.count_down();
  EXPECT_TRUE(executor.drain(soon()));
  EXPECT_EQ(done, 400);
  EXPECT_EQ(waiting(), 0);
  const auto held = std::make_shared<int>();
  queues[0]->async([held] { throw std::bad_alloc(); }, 1000);
  queues[0]->async([held] { throw std::length_error("too long"); });
  executor.background().async([held] { throw std::bad_alloc(); });
  std::atomic<bool> ran{false};
  executor.background().async([&] { std::this_thread::sleep_for(20ms), ran = true; });
  EXPECT_TRUE(executor.drain(soon()));
  EXPECT_TRUE(ran);
  EXPECT_EQ(executor.itemsGivenUp(), 3u);
  EXPECT_EQ(held.use_count(), 1);
  EXPECT_EQ(waiting(), 0);
}

TEST_F(ExecutorTest, UndueWorkIsDroppedAtTheEndAndLateWorkAtOnce) {
  const auto witness = std::make_shared<int>();
  const auto work = [witness] { FAIL(); };
  executor.background().asyncAfter(1h, work);
  executor.stop(soon());
  executor.background().async(work);
  executor.background().asyncAfter(1h, work);
  EXPECT_EQ(witness.use_count(), 2);
}

TEST_F(ExecutorTest, OneBusyQueueLetsTheOthersHaveTheirTurn) {
  executor.adoptInteractiveThread();
  const Queue busy = interactive();
  const Queue other = interactive();
  std::vector<int> ran;
  for (int i = 0; i < 1000; ++i) {
    busy->async([&, i] {
      ran.push_back(i);
      if (i == 0) busy->async([&] { ran.push_back(1000); });  // joins the end
    });
  }
  bool otherRan = false;
  other->async([&] { otherRan = true; });
  EXPECT_TRUE(executor.runInteractive(10));
  EXPECT_EQ(ran.size(), 10u);
  EXPECT_FALSE(otherRan);
  executor.runInteractive(64 + 1);
  EXPECT_TRUE(otherRan);
  EXPECT_FALSE(executor.runInteractive(2000));
  EXPECT_EQ(ran.size(), 1001u);
  EXPECT_TRUE(std::is_sorted(ran.begin(), ran.end()));
}

TEST(RunLoopTest, TimersFireInOrderOfTimeAndMoveAndGoFromOtherThreads) {
  fakes::FakePlatform p;
  SystemThreading threading(p.queues.background());
  SystemClock clock;
  const auto loop = threading.makeRunLoop();
  std::vector<int> fired;
  std::latch running(1);
  const auto far = threading.makeTimer(1h, [&] { fired.push_back(3); });
  const auto gone = threading.makeTimer(1h, [] { FAIL(); });
  const auto first = threading.makeTimer(1ms, [&] { fired.push_back(1); });
  const auto second = threading.makeTimer(2ms, [&] {
    fired.push_back(2);
    running.count_down();
    throw std::runtime_error("leaves the loop");
  });
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

TEST(KernelRandomTest, DrawsNumbersBelowTheirBound) {
  KernelRandom random;
  uint32_t most = random.below(0) + random.below(1);
  for (int i = 0; i < 5000; ++i) most = std::max(most, random.below(60));
  EXPECT_EQ(most, 59u);
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
  threading.memoryWasFreed(1 << 20);
  p.queues.advance(2s);
  EXPECT_EQ(trims, 3);
  EXPECT_FALSE(p.queues.nextDue());
}

}  // namespace
}  // namespace vx::lnx
