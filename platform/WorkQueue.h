// Serial work queues and the shared background queue.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string_view>
#include <utility>

#include "base/Check.h"
#include "base/Function.h"
#include "base/ThreadAnnotations.h"

namespace vx {

using Work = Function<void()>;

enum class QualityOfService {
  UserInteractive,  // one thread, the one on which ServiceListener resume runs
  Utility,          // relay work of the sessions
  Background,       // standalone sends
};

// Runs submitted work one item at a time in submission order (the background queue: concurrently).
// Thread-safe. Items queued when the process ends may never run.
class CAPABILITY("queue") WorkQueue {
 public:
  virtual ~WorkQueue() = default;
  // Never runs the work before it returns. `holds`: bytes that it keeps alive until it has run,
  // for the account of whoever caused it.
  virtual void async(Work work, std::size_t holds = 0) = 0;
  // The work joins the queue once the delay has passed on the monotonic clock.
  virtual void asyncAfter(std::chrono::nanoseconds delay, Work work) = 0;
  // Work that may be long: runs `step` again and again until it answers false. The first step has
  // its place in the queue; what others ask for may run between any two.
  virtual void asyncInSteps(Function<bool()> step) {
    async([step = std::move(step)] {
      while (step()) {
      }
    });
  }
  virtual bool isCurrent() const = 0;
  virtual std::string_view label() const = 0;
  // Fails the process when the caller is not running on this queue (development builds).
  void assertIsCurrent() const ASSERT_CAPABILITY(this) { VX_DCHECK(isCurrent()); }
};

// A piece of work of a recorded call, by which a later process can name it.
struct WorkOrigin {
  uint64_t call = 0;
  uint32_t place = 0;
  uint8_t depth = 0;
  double time = 0;  // at which the call was accepted, seconds since 1970
};

// The recorded call that a piece of work goes back to, for work that waits elsewhere than on a
// queue. Let go of before run(), the work is found undone after a crash.
class WorkCause {
 public:
  virtual ~WorkCause() = default;
  // Runs the work before it returns, as the call's own. Once.
  virtual void run(const Work& work) { work(); }
};

class WorkQueues {
 public:
  virtual ~WorkQueues() = default;
  // What the caller's work goes back to, as asyncAfter would take it along, for work that keeps
  // `holds` bytes alive. Null where a call is run again after a crash whose work was done before
  // it.
  virtual std::unique_ptr<WorkCause> takeCause(std::size_t /*holds*/) {
    return std::make_unique<WorkCause>();
  }
  // Of the work that the caller runs; none where it goes back to no recorded call.
  virtual std::optional<WorkOrigin> currentOrigin() { return std::nullopt; }
  // Runs `work` before it returns, as work for the service's own sake: what it queues goes back to
  // no call.
  virtual void withoutCause(const Work& work) { work(); }
  // A new serial queue; `label` must outlive it (a literal). Cheap: thousands may exist. Work
  // queued on it keeps it alive until it has run.
  virtual std::shared_ptr<WorkQueue> makeSerial(std::string_view label,
                                                QualityOfService quality) = 0;
  // The shared concurrent queue of background priority.
  virtual WorkQueue& background() = 0;
  // Bracket a wait on a queue's thread, so that the other queues of its lane are served meanwhile.
  // See Blocking.
  virtual void beginBlocking() = 0;
  virtual void endBlocking() = 0;
};

// Held around work that waits for somebody else. No effect off the queues' threads.
class Blocking {
 public:
  explicit Blocking(WorkQueues& queues) : queues_(queues) { queues_.beginBlocking(); }
  ~Blocking() { queues_.endBlocking(); }
  Blocking(const Blocking&) = delete;
  Blocking& operator=(const Blocking&) = delete;

 private:
  WorkQueues& queues_;
};

}  // namespace vx
