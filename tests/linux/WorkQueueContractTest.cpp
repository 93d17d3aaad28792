// What every implementation of the queues and run loops promises, asked of the real ones and of the
// fakes that other tests rely on.
#include <gtest/gtest.h>

#include <stdexcept>
#include <vector>

#include "platform/linux/execution/Executor.h"
#include "platform/linux/execution/SystemThreading.h"
#include "tests/fakes/FakePlatform.h"
#include "tests/linux/Latch.h"

namespace vx::lnx {
namespace {

using namespace std::chrono_literals;
using Order = std::vector<int>;

struct RealImplementation {
  ~RealImplementation() { executor.stop(std::chrono::steady_clock::now() + 30s); }
  WorkQueues& queues() { return executor; }
  void runUntil(Latch& done) { EXPECT_TRUE(done.wait()); }
  Monotonic now() { return clock.monotonic(); }
  Executor executor;
  SystemThreading threading{executor.background()};
  SystemClock clock;
};

struct FakeImplementation {
  WorkQueues& queues() { return p.queues; }
  void runUntil(Latch& done) {
    p.queues.advance(1s);
    EXPECT_TRUE(done.isOpen());
  }
  Monotonic now() { return p.clock.monotonic(); }
  fakes::FakePlatform p;
  fakes::FakeThreading& threading = p.threading;
};

template <class T>
class PlatformContract : public ::testing::Test {
 protected:
  T i;
};
using Implementations = ::testing::Types<RealImplementation, FakeImplementation>;
TYPED_TEST_SUITE(PlatformContract, Implementations);

TYPED_TEST(PlatformContract, SerialWorkRunsInOrderOnItsQueueAndNeverBeforeThePostReturned) {
  for (const auto quality : {QualityOfService::Utility, QualityOfService::Background}) {
    Latch done;
    Order ran;
    bool returned = false;
    auto queue = this->i.queues().makeSerial("label", quality);
    const WorkQueue& q = *queue;
    queue->async([&, queue] {
      EXPECT_TRUE(q.isCurrent());
      EXPECT_FALSE(this->i.queues().background().isCurrent());
      queue->async([&] {
        EXPECT_TRUE(returned);
        ran.push_back(3);
        done.open();
      });
      ran.push_back(1);
      returned = true;
    });
    queue->asyncAfter(0ns, [&] { ran.push_back(2); });
    EXPECT_FALSE(queue->isCurrent());
    EXPECT_EQ(queue->label(), "label");
    queue.reset();  // the work keeps it
    this->i.runUntil(done);
    EXPECT_EQ(ran, (Order{1, 2, 3}));
  }
}

TYPED_TEST(PlatformContract, DelayedWorkJoinsInOrderOfItsTime) {
  Latch done;
  Order ran;
  const Monotonic start = this->i.now();
  const auto queue = this->i.queues().makeSerial("q", QualityOfService::Utility);
  queue->asyncAfter(30ms, [&] {
    ran.push_back(3);
    EXPECT_GE(this->i.now() - start, 30ms);
    done.open();
  });
  queue->asyncAfter(10ms, [&] { ran.push_back(1); });
  queue->asyncAfter(20ms, [&] { ran.push_back(2); });
  queue->async([&] { ran.push_back(0); });
  this->i.runUntil(done);
  EXPECT_EQ(ran, (Order{0, 1, 2, 3}));
}

TYPED_TEST(PlatformContract, BackgroundWorkKnowsItsQueue) {
  WorkQueue& background = this->i.queues().background();
  EXPECT_FALSE(background.isCurrent());
  Latch done;
  background.async([&] { EXPECT_TRUE(background.isCurrent()); });
  background.asyncAfter(1ms, [&] {
    background.assertIsCurrent();
    done.open();
  });
  this->i.runUntil(done);
}

TYPED_TEST(PlatformContract, RunLoopFiresInOrderOfTimeAndEnds) {
  const auto loop = this->i.threading.makeRunLoop();
  Order fired;
  std::vector<std::shared_ptr<OneShotTimer>> timers;
  auto attach = [&](std::chrono::nanoseconds delay, Function<void()> action) {
    timers.push_back(this->i.threading.makeTimer(delay, std::move(action)));
    loop->attach(timers.back());
  };
  attach(1h, [&] { fired.push_back(3); });  // moved
  attach(1h, [&] { fired.push_back(9); });  // taken away
  attach(10ms, [&] {
    fired.push_back(2);
    timers[1]->invalidate();
    timers[0]->setFireTime(this->i.now());
    throw std::runtime_error("leaves the loop");
  });
  attach(5ms, [&] {
    fired.push_back(1);
    timers[3]->setFireTime(this->i.now() + 1ms);  // itself: changes nothing
  });
  EXPECT_THROW(loop->runUntilEmpty(), std::runtime_error);
  EXPECT_EQ(fired, (Order{1, 2}));
  loop->runUntilEmpty();
  EXPECT_EQ(fired, (Order{1, 2, 3}));
  loop->runUntilEmpty();
}

}  // namespace
}  // namespace vx::lnx
