#include <cmath>
#include <cstdlib>
#include <exception>
#include <stdexcept>
#include <thread>

#include "Statistics/Service/VXReportingBlockThrottle.h"
#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

class ThrottleTest : public PlatformTest {
 protected:
  ~ThrottleTest() override { p.threading.threadBody = nullptr; }
  static Payload held(double seconds, int a = 1) {
    return dictionary("a", a, "_throttle_seconds", seconds);
  }
  void add(const std::string& name, const Payload& message = dictionary("a", 1)) {
    addBlock([this, name] { ran.push_back(name + "@" + std::to_string(elapsed())); }, message);
  }
  void addBlock(std::function<void()> block, const Payload& message = dictionary("a", 1)) {
    throttle->addMessageBlock(std::move(block), 1, message, 1, 1);
  }
  int64_t elapsed() const { return (p.clock.steady - begin) / 1ms; }
  // Lets the worker's thread run for a while.
  void work(std::chrono::milliseconds time) {
    const Monotonic end = p.clock.steady + time;
    throttle->setShouldKeepRunning(true);
    p.threading.onSleep = [this, end] {
      throttle->setShouldKeepRunning(p.clock.steady + 100ms < end);
    };
    p.threading.threadBody();
    p.threading.onSleep = nullptr;
  }

  const Monotonic begin = p.clock.steady;
  std::shared_ptr<VXReportingBlockThrottle> throttle = VXReportingBlockThrottle::create();
  std::vector<std::string> ran;
};

TEST_F(ThrottleTest, KeysTellMessagesApart) {
  auto key = [](const Payload& message, ReporterID reporter = 42) {
    return VXReportingBlockThrottle::buildMessageKey(message, reporter, 0x08000005, 1);
  };
  EXPECT_EQ(key(dictionary("b", 2, "a", "x", "systemuptime_sec", 100)),
            "a|x|b|2|systemuptime_sec|^|reporterID|42|Session_Setup|Start");
  for (const char* hidden : {"systemuptime_sec", "processuptime_ms", "vxreporting_timestamp",
                             "_throttle_seconds", "_comparison_field_blacklist"})
    EXPECT_EQ(key(dictionary(hidden, 1)), key(dictionary(hidden, 2)));
  EXPECT_NE(key(dictionary("Volume", 1)), key(dictionary("Volume", 2)));
  EXPECT_EQ(key(dictionary("Volume", 1, "VolumeOperationTime", 1)),
            key(dictionary("Volume", 2, "VolumeOperationTime", 3)));
  const auto ignoring = [&](const auto& list, int level) {
    return key(dictionary("_comparison_field_blacklist", list, "level", level, "5", level));
  };
  const auto levels = ArrayBuilder().add("level").add("5"), numbers = ArrayBuilder().add(5);
  EXPECT_EQ(ignoring(levels, 1), ignoring(levels, 7));
  EXPECT_NE(ignoring(levels, 1), key(dictionary("_comparison_field_blacklist", levels)));
  EXPECT_NE(ignoring("level", 1), ignoring("level", 2));
  EXPECT_THAT(ignoring(numbers, 1), HasSubstr("5|1")) << "a number is no key";
  const auto nested = [&](const Payload& inner) {
    return key(dictionary("d", dictionary("a", ArrayBuilder().add(inner).add("x"))));
  };
  EXPECT_EQ(nested(dictionary("p", 1, "q", 2)), nested(dictionary("q", 2, "p", 1)));
  EXPECT_THAT(nested(dictionary("q", 2, "p", 1)), HasSubstr("d|{a=({p=1,q=2},x)}|"));
}

TEST_F(ThrottleTest, DelaysAreReadWithTheirAsymmetries) {
  const auto delay = VXReportingBlockThrottle::determineSleepTime;
  EXPECT_EQ(delay(dictionary("a", 1)), 0.5);
  EXPECT_EQ(delay(held(4.99)), static_cast<double>(4.99f));
  EXPECT_EQ(delay(held(-1)), -1.0);
  EXPECT_EQ(delay(held(5)), 0.5);
  EXPECT_EQ(delay(dictionary("_throttle_seconds", "2")), 0.5);
  EXPECT_THAT(p.log.lines,
              ElementsAre("system info Rejecting large throttle time. {time=5, max=5.000000}",
                          "system info Rejecting non KFNumber value of throttle time. {time=2}"));
}

TEST_F(ThrottleTest, OnlyTheLastOfABurstRunsEachKeyAfterItsOwnDelay) {
  add("first");
  p.threading.at(200ms, [&] { add("second"); });
  p.threading.at(400ms, [&] { add("third"); });
  add("slow", held(1.5, 2));
  add("fast", held(0.25, 3));
  p.threading.at(100ms, [&] { add("late", held(0.25, 4)); });  // waits for the loop, long due
  work(2s);
  EXPECT_THAT(ran, ElementsAre("fast@250", "third@900", "slow@1500", "late@1600"));
}

TEST_F(ThrottleTest, OfTwoThatAddOneKeyAtOnceTheLaterRunsOnceAndNothingIsLeft) {
  const auto held = std::make_shared<int>();
  p.threading.onMakeTimer = [&] { addBlock([this, held] { ran.push_back("first"); }); };
  addBlock([this, held] { ran.push_back("later"); });
  EXPECT_EQ(throttle->unscheduledTimerKeys(), 1u);
  work(2s);
  EXPECT_THAT(ran, ElementsAre("later"));
  EXPECT_EQ(held.use_count(), 1);
}

TEST_F(ThrottleTest, ZeroAndLessRunOnTheNextPassAndKeysMayComeAgain) {
  work(200ms);  // asleep between passes
  add("now", held(-1));
  work(200ms);
  add("again", held(0));
  work(200ms);
  int a = 0;
  for (const double absurd : {-1e300, -HUGE_VAL, std::nan("")}) add("absurd", held(absurd, ++a));
  work(200ms);
  EXPECT_THAT(ran, ElementsAre("now@200", "again@400", "absurd@600", "absurd@600", "absurd@600"));
}

TEST_F(ThrottleTest, DuplicateDuringItsOwnBlockIsLostAndWhatItThrowsLeavesThroughTheThread) {
  addBlock([this] {
    add("never");
    throw std::runtime_error("block");
  });
  static VXReportingBlockThrottle* ending;
  ending = throttle.get();
  const auto onThread = [this] {
    std::set_terminate([] { std::_Exit(static_cast<int>(ending->timersInFlight())); });
    std::thread([this] { work(2s); }).join();
  };
  EXPECT_EXIT(onThread(), testing::ExitedWithCode(0), "") << "the key goes before the process";
  EXPECT_THROW(work(2s), std::runtime_error);
  EXPECT_EQ(throttle->timersInFlight(), 0u);
  work(2s);
  EXPECT_THAT(ran, IsEmpty());
}

TEST_F(ThrottleTest, WaitingEndsWhenNothingIsLeftOrAfterTenLooks) {
  add("soon");
  p.threading.at(700ms, [this] { work(100ms); });
  throttle->waitForCompletion();
  EXPECT_LT(elapsed(), 1600);
  p.threading.sleeps.clear();
  p.log.lines.clear();
  throttle->waitForCompletion();
  EXPECT_THAT(p.threading.sleeps, IsEmpty());
  add("stuck");  // no worker runs meanwhile
  throttle->waitForCompletion();
  EXPECT_EQ(p.threading.sleeps, std::vector<std::chrono::nanoseconds>(10, 500ms));
  EXPECT_THAT(
      p.log.lines,
      ElementsAre(
          "system info waitForCompletion. timersInFlight=0 unscheduledTimerKeys=0",
          "system info waitForCompletion. timersInFlight=1 unscheduledTimerKeys=1",
          "system default Giving up on waiting for completion after 5 seconds. timersInFlight=1"));
  work(1s);  // what is pending holds the throttle
}

}  // namespace
}  // namespace vx
