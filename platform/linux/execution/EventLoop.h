// The interactive thread's loop: file descriptors, deadlines, and the interactive work queues, in
// passes.
//
// One pass waits for descriptors, lets their sources queue work, runs the interactive queues until
// they are empty, then a round of what takes turns, and then calls the pass-end hooks (all replies
// of a pass leave in one write per connection). Plain epoll rather than sd-event: a lone call costs
// one epoll_wait, and nothing here needs more than descriptors and a few deadlines.
#pragma once

#include <sys/epoll.h>

#include <array>
#include <atomic>
#include <cstdint>
#include <optional>
#include <vector>

#include "base/Clock.h"
#include "base/Function.h"
#include "base/Status.h"
#include "base/UniqueFd.h"
#include "platform/linux/execution/Executor.h"

namespace vx::lnx {

// Owned by LinuxPlatform. Everything but wake() and stop() belongs to the interactive thread:
// the one that calls run(), and before that the one that makes it.
class EventLoop {
 public:
  class Source {
   public:
    virtual ~Source() = default;
    virtual void onReady(uint32_t events) = 0;
  };

  EventLoop(Executor& executor, Clock& clock);
  ~EventLoop() = default;
  EventLoop(const EventLoop&) = delete;
  EventLoop& operator=(const EventLoop&) = delete;

  // Level-triggered. `source` must stay valid until remove(). Fails when the kernel refuses.
  Status add(int fd, uint32_t events, Source& source);
  void modify(int fd, uint32_t events, Source& source);
  // No call of `source` follows, not even for events of the running pass.
  void remove(int fd, Source& source);

  // Something that wants to run at a time of its own: `next` is asked before each sleep, `due`
  // called once it passed.
  void addDeadline(Function<std::optional<Monotonic>()> next, Function<void()> due);
  // Run once in each pass; true: there is more for the next one, which then does not wait.
  void addRound(Function<bool()> round);
  void addPassEndHook(Function<void()> hook);

  // Runs until stop(); may be called again afterwards.
  void run();
  // One pass that waits no longer than `deadline`.
  void runOnce(std::optional<Monotonic> deadline);
  void stop() { stopped_.store(true, std::memory_order_release), wake(); }
  // From any thread: ends the sleep of the pass.
  void wake();

 private:
  struct Deadline {
    Function<std::optional<Monotonic>()> next;
    Function<void()> due;
  };
  static constexpr std::size_t kEventsPerPass = 128;
  static constexpr std::size_t kItemsPerPass = 4096;

  std::optional<Monotonic> earliestDeadline() const;
  void runDueDeadlines();
  int timeoutMs(std::optional<Monotonic> deadline) const;

  Executor& executor_;
  Clock& clock_;
  const UniqueFd epollFd_;
  const UniqueFd wakeFd_;
  std::atomic<bool> stopped_{false};
  std::vector<Deadline> deadlines_;
  std::optional<Monotonic> earliest_;  // what is due next, as the last pass left it
  std::vector<Function<bool()>> rounds_;
  std::vector<Function<void()>> passEndHooks_;
  std::array<epoll_event, kEventsPerPass> events_{};
  std::size_t eventCount_ = 0;
};

}  // namespace vx::lnx
