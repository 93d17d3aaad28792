// Time, queues and threads that move only when a test says so.
#pragma once

#include <algorithm>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Platform.h"

namespace vx::fakes {

class FakeClock final : public Clock {
 public:
  Date now() override { return wall; }
  Monotonic monotonic() override { return steady; }
  std::string formatLocal(Date, const char*) override { return "20261116-061530+0000"; }
  void advance(std::chrono::nanoseconds by) {
    wall += by;
    steady += by;
  }
  Date wall{std::chrono::hours(24 * 365 * 50)};
  Monotonic steady{std::chrono::hours(1)};
};

// Queues of one thread: the test's. Work runs in order of submission, over all queues.
class FakeWorkQueues final : public WorkQueues {
 public:
  explicit FakeWorkQueues(FakeClock& clock) : clock_(clock) {}
  std::shared_ptr<WorkQueue> makeSerial(std::string_view label, QualityOfService quality) override {
    made.emplace_back(label, quality);
    return std::make_shared<Queue>(*this, label);
  }
  WorkQueue& background() override { return background_; }
  void beginBlocking() override { ++blockingScopes; }
  void endBlocking() override {}

  // Runs what is due, and what that queues. `skip`: a label whose work stays where it is.
  void runAll(std::string_view skip = "") {
    for (;;) {
      const auto due = std::find_if(items_.begin(), items_.end(), [&](const Item& item) {
        return item.due <= clock_.steady && item.label != skip;
      });
      if (due == items_.end()) return;
      Item item = std::move(*due);
      items_.erase(due);
      const WorkQueue* outer = std::exchange(current, item.queue);
      item.work();
      current = outer;
    }
  }
  // Moves time, running what falls due on the way.
  void advance(std::chrono::nanoseconds by) {
    const Monotonic end = clock_.steady + by;
    runAll();
    for (auto next = nextDue(); next && *next <= end; next = nextDue()) {
      clock_.advance(*next - clock_.steady);
      runAll();
    }
    clock_.advance(end - clock_.steady);
  }
  std::optional<Monotonic> nextDue() const {
    const auto first = std::ranges::min_element(items_, {}, &Item::due);
    return first != items_.end() ? std::optional(first->due) : std::nullopt;
  }

  std::size_t waiting() const { return items_.size(); }

  int blockingScopes = 0;
  std::vector<std::pair<std::string, QualityOfService>> made;
  const WorkQueue* current = nullptr;

 private:
  class Queue final : public WorkQueue {
   public:
    Queue(FakeWorkQueues& owner, std::string_view label) : owner_(owner), label_(label) {}
    void async(Work work, std::size_t) override { asyncAfter({}, std::move(work)); }
    void asyncAfter(std::chrono::nanoseconds delay, Work work) override {
      owner_.items_.push_back({owner_.clock_.steady + delay, label_, this, std::move(work)});
    }
    bool isCurrent() const override { return owner_.current == this; }
    std::string_view label() const override { return label_; }

   private:
    FakeWorkQueues& owner_;
    const std::string label_;
  };
  struct Item {
    Monotonic due;
    std::string label;
    const WorkQueue* queue;
    Work work;
  };
  FakeClock& clock_;
  std::deque<Item> items_;
  Queue background_{*this, "background"};
};

// Waits, sleeps and run loops move the clock from event to event. A thread is a body that the test
// calls.
class FakeThreading final : public Threading {
 public:
  explicit FakeThreading(FakeClock& clock) : clock_(clock) {}
  std::unique_ptr<Condition> makeCondition() override { return std::make_unique<Waiting>(*this); }
  std::shared_ptr<OneShotTimer> makeTimer(std::chrono::nanoseconds delay,
                                          Function<void()> action) override {
    if (const auto meanwhile = std::exchange(onMakeTimer, nullptr)) meanwhile();
    return std::make_shared<Timer>(clock_.steady + delay, std::move(action));
  }
  std::unique_ptr<RunLoop> makeRunLoop() override { return std::make_unique<Loop>(*this); }
  std::unique_ptr<Thread> startThread(std::string_view, Function<void()> body) override {
    class Started final : public Thread {};
    threadBody = std::move(body);
    return std::make_unique<Started>();
  }
  void sleepFor(std::chrono::nanoseconds duration) override {
    sleeps.push_back(duration);
    if (onSleep) onSleep();
    passTimeUntil(clock_.steady + duration);
  }
  void memoryWasFreed(std::size_t approximateBytes) override { freedBytes += approximateBytes; }

  // Something that happens at a time, seen by sleeps, run loops and waits as they pass it.
  void at(std::chrono::nanoseconds fromNow, Function<void()> event) {
    events_.emplace(clock_.steady + fromNow, std::move(event));
  }
  // Moves time, running events on the way.
  void passTimeUntil(Monotonic when) {
    while (passEventBefore(when)) continue;
  }
  Function<void()> threadBody;        // of the last thread started
  std::function<void()> onSleep;      // before each sleep of a thread
  std::function<void()> onMakeTimer;  // what another thread does while a timer is made, once
  std::vector<std::chrono::nanoseconds> sleeps;
  std::size_t freedBytes = 0;

 private:
  class Waiting final : public Condition {
   public:
    explicit Waiting(FakeThreading& owner) : owner_(owner) {}
    void lock() override {}
    void unlock() override {}
    void signal() override { ++signals_; }
    bool waitUntil(Monotonic deadline) override {
      const int before = signals_;
      while (owner_.passEventBefore(deadline)) {
        if (signals_ != before) return true;
      }
      return false;
    }

   private:
    FakeThreading& owner_;
    int signals_ = 0;
  };
  struct Timer final : OneShotTimer {
    Timer(Monotonic when, Function<void()> toDo) : due(when), action(std::move(toDo)) {}
    void setFireTime(Monotonic when) override { due = when; }
    void invalidate() override { valid = false; }
    Monotonic due;
    Function<void()> action;
    bool valid = true;
  };
  class Loop final : public RunLoop {
   public:
    explicit Loop(FakeThreading& owner) : owner_(owner) {}
    void attach(std::shared_ptr<OneShotTimer> timer) override {
      timers_.push_back(std::static_pointer_cast<Timer>(std::move(timer)));
    }
    void runUntilEmpty() override {
      for (;;) {
        std::erase_if(timers_, [](const auto& timer) { return !timer->valid; });
        if (timers_.empty()) return;
        const auto first = *std::ranges::min_element(timers_, {}, &Timer::due);
        if (first->due > owner_.clock_.steady) {
          owner_.passEventBefore(first->due);  // which may move timers
          continue;
        }
        first->valid = false;
        first->action();
      }
    }

   private:
    FakeThreading& owner_;
    std::vector<std::shared_ptr<Timer>> timers_;
  };
  // Moves time to the next event and runs it; to `end`, and false, when there is none until then.
  bool passEventBefore(Monotonic end) {
    const auto first = events_.begin();
    const bool any = first != events_.end() && first->first <= end;
    const Monotonic until = any ? first->first : end;
    if (until > clock_.steady) clock_.advance(until - clock_.steady);
    if (any) events_.extract(first).mapped()();
    return any;
  }
  FakeClock& clock_;
  std::multimap<Monotonic, Function<void()>> events_;
};

}  // namespace vx::fakes
