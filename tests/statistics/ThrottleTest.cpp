#include <cmath>
#include <stdexcept>

#include "Statistics/Service/VXReportingBlockThrottle.h"
#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

using namespace std::chrono_literals;

class ThrottleTest : public ::testing::Test {
 protected:
  ~ThrottleTest() override { p.threading.threadBody = nullptr; }
  static PayloadBuilder payload(int a = 1) { return PayloadBuilder().set("a", a); }
  static PayloadBuilder held(double seconds, int a = 1) {
    return payload(a).set("_throttle_seconds", seconds);
  }
  void add(const std::string& name, const PayloadBuilder& message) {
    throttle->addMessageBlock(
        [this, name] { ran.push_back(name + "@" + std::to_string(elapsed())); }, 1, message.build(),
        1, 1);
  }
  void addAt(std::chrono::milliseconds when, const std::string& name,
             const PayloadBuilder& message) {
    p.threading.at(when, [this, name, message] { add(name, message); });
  }
  int64_t elapsed() const {
    return std::chrono::duration_cast<std::chrono::milliseconds>(p.clock.steady - begin).count();
  }
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

  fakes::FakePlatform p;
  const Monotonic begin = p.clock.steady;
  std::shared_ptr<VXReportingBlockThrottle> throttle = VXReportingBlockThrottle::create();
  std::vector<std::string> ran;
};

TEST_F(ThrottleTest, KeysTellMessagesApart) {
  auto key = [](const PayloadBuilder& message, ReporterID reporter = 42) {
    return VXReportingBlockThrottle::buildMessageKey(message.build(), reporter, 0x08000005, 1);
  };
  EXPECT_EQ(key(PayloadBuilder().set("b", 2).set("a", "x").set("systemuptime_sec", 100)),
            "a|x|b|2|systemuptime_sec|^|reporterID|42|Session_Setup|Start");
  EXPECT_EQ(VXReportingBlockThrottle::buildMessageKey(Payload(), -1, 0xFFFFFFFF, 0xFFFF),
            "reporterID|-1|Undefined|Unknown");
  EXPECT_EQ(key(PayloadBuilder().set("a", 1).set("B", 2), -5),
            "B|2|a|1|reporterID|-5|Session_Setup|Start");
  for (const char* hidden : {"systemuptime_sec", "processuptime_ms", "vxreporting_timestamp",
                             "_throttle_seconds", "_comparison_field_blacklist"})
    EXPECT_EQ(key(PayloadBuilder().set(hidden, 1)), key(PayloadBuilder().set(hidden, 2)));
  for (const char* seen : {"Volume", "VolumeOperationTime", "System_uptime_sec"})
    EXPECT_NE(key(PayloadBuilder().set(seen, 1)), key(PayloadBuilder().set(seen, 2)));
  const auto ignoring = [](int level) {
    return PayloadBuilder()
        .set("_comparison_field_blacklist", ArrayBuilder().add("level"))
        .set("level", level);
  };
  EXPECT_EQ(key(ignoring(1)), key(ignoring(7)));
  EXPECT_NE(key(ignoring(1)),
            key(PayloadBuilder().set("_comparison_field_blacklist", ArrayBuilder().add("level"))));
  EXPECT_NE(key(PayloadBuilder().set("_comparison_field_blacklist", "level").set("level", 1)),
            key(PayloadBuilder().set("_comparison_field_blacklist", "level").set("level", 2)));
  const auto number = [](int level) {
    return PayloadBuilder()
        .set("_comparison_field_blacklist", ArrayBuilder().add(5))
        .set("5", level);
  };
  EXPECT_NE(key(number(1)), key(number(2)));  // a number is no key
  EXPECT_EQ(key(PayloadBuilder().set("Volume", 1).set("VolumeOperationTime", 1)),
            key(PayloadBuilder().set("Volume", 2).set("VolumeOperationTime", 3)));
}

TEST_F(ThrottleTest, DelaysAreReadWithTheirAsymmetries) {
  auto delay = [](const PayloadBuilder& message) {
    return VXReportingBlockThrottle::determineSleepTime(message.build());
  };
  EXPECT_EQ(delay(payload()), 0.5);
  EXPECT_EQ(delay(held(4.99)), static_cast<double>(4.99f));
  EXPECT_EQ(delay(held(-1)), -1.0);
  EXPECT_THAT(p.log.lines, IsEmpty());
  EXPECT_EQ(delay(held(5)), 0.5);
  EXPECT_EQ(delay(payload().set("_throttle_seconds", "2")), 0.5);
  EXPECT_EQ(delay(payload().set("_throttle_seconds", true)), 0.5);
  EXPECT_THAT(p.log.lines,
              ElementsAre("system info Rejecting large throttle time. {time=5, max=5.000000}",
                          "system info Rejecting non KFNumber value of throttle time. {time=2}",
                          "system info Rejecting non KFNumber value of throttle time. {time=1}"));
}

TEST_F(ThrottleTest, OnlyTheLastOfABurstRunsOneDelayAfterIt) {
  add("first", payload());
  addAt(200ms, "second", payload());
  addAt(400ms, "third", payload());
  work(2s);
  EXPECT_THAT(ran, ElementsAre("third@900"));
  EXPECT_EQ(throttle->timersInFlight(), 0u);
}

TEST_F(ThrottleTest, DifferentKeysRunEachAfterItsOwnDelay) {
  add("slow", held(1.5, 1));
  add("fast", held(0.25, 2));
  work(2s);
  EXPECT_THAT(ran, ElementsAre("fast@250", "slow@1500"));
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

TEST_F(ThrottleTest, KeysAddedWhileTheLoopIsBusyWaitForIt) {
  add("long", held(3, 1));
  addAt(100ms, "short", held(0.25, 2));
  work(4s);
  EXPECT_THAT(ran, ElementsAre("long@3000", "short@3100"));  // due long ago: at once when attached
}

TEST_F(ThrottleTest, DuplicateDuringItsOwnBlockIsLost) {
  throttle->addMessageBlock([this] { add("never", payload()); }, 1, payload().build(), 1, 1);
  work(3s);
  EXPECT_THAT(ran, IsEmpty());
  EXPECT_EQ(throttle->timersInFlight(), 0u);
}

TEST_F(ThrottleTest, ThrowingBlockLeavesThroughTheThreadAfterTheCleanUp) {
  throttle->addMessageBlock([] { throw std::runtime_error("block"); }, 1, payload().build(), 1, 1);
  EXPECT_THROW(work(2s), std::runtime_error);
  EXPECT_EQ(throttle->timersInFlight(), 0u);
}

TEST_F(ThrottleTest, WaitingLooksTenTimesAndGivesUp) {
  throttle->waitForCompletion();
  EXPECT_THAT(p.threading.sleeps, IsEmpty());
  add("stuck", payload());  // no worker runs meanwhile
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

TEST_F(ThrottleTest, WaitingEndsAsSoonAsNothingIsLeft) {
  p.log.verbose = true;
  add("soon", payload());
  p.threading.at(700ms, [this] { work(100ms); });
  throttle->waitForCompletion();
  EXPECT_LT(elapsed(), 1600);
  EXPECT_THAT(p.log.lines, Contains("system debug Waiting up to 5 seconds for blockThrottle queue "
                                    "to be empty."));
  EXPECT_THAT(p.log.lines, Not(Contains(HasSubstr("Giving up"))));
  throttle->setShouldKeepRunning(false);
  p.threading.sleeps.clear();
  p.threading.threadBody();
  EXPECT_THAT(p.threading.sleeps, IsEmpty()) << "a thread that is not to run does not begin";
}

TEST_F(ThrottleTest, VerboseLinesOnRequest) {
  p.log.verbose = true;
  add("first", payload());
  add("second", payload());
  work(200ms);
  EXPECT_THAT(
      p.log.lines,
      ElementsAre("system debug Dropping duplicate message for a|1|reporterID|1|Generic|Start",
                  "system debug calling workingRunLoop run from inside thread block",
                  "system debug sleeping in thread"));
}

}  // namespace
}  // namespace vx
