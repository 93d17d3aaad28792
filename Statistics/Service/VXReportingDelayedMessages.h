// Standalone messages whose random delay is not over.
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <utility>

#include "Statistics/VXReportingUtility.h"
#include "base/Clock.h"
#include "base/Error.h"
#include "base/Function.h"
#include "base/Mutex.h"
#include "platform/WorkQueue.h"

namespace vx {

struct VXReportingDelayedMessage {
  Payload message;
  MessageCategory category = 0;
  MessageType type = 0;
  ServiceType serviceType = 0;
  Date due;  // on the wall clock, whatever happens to this process meanwhile
  Function<void(const std::optional<Error>&)> reply;
};

// The one list of them. Owned by the process state. Thread-safe; the messages go out on the
// background queue, or on the thread of whoever is in a hurry. Bounds: kMostMessages and
// kMostBytes; beyond them those that are due first go out early.
class VXReportingDelayedMessages : public std::enable_shared_from_this<VXReportingDelayedMessages> {
 public:
  static constexpr std::size_t kMostMessages = 16384;
  static constexpr std::size_t kMostBytes = std::size_t{8} << 20;

  // For what the calling thread works for. Keeps a copy of the message, which may lie where it must
  // not stay for long.
  void add(VXReportingDelayedMessage message);
  // For what a message was kept for by an earlier process.
  void add(VXReportingDelayedMessage message, std::unique_ptr<WorkCause> cause);
  // Sends all, in the order in which they are due, before it returns; waits for nothing. Those that
  // come later, of work that is still queued, do not wait any more: the process is about to end.
  void sendAllFromNow();

  // Has all of them recorded anew, as RecordedInputs::keepDelayed does.
  void keepAgain();
  std::size_t size() const;
  // All but the message itself and the reply, and back; none when it is not that.
  static Payload facts(const VXReportingDelayedMessage& message);
  static std::optional<VXReportingDelayedMessage> fromFacts(const Payload& facts, Payload message);

 private:
  struct Waiting {
    VXReportingDelayedMessage message;
    std::unique_ptr<WorkCause> cause;
  };
  using Key = std::pair<Monotonic, uint64_t>;  // when it is due, and its number

  void sendDue(Monotonic until);
  void wakeBy(Monotonic due);
  bool isTooMuch() const REQUIRES(mutex_) {
    return waiting_.size() > kMostMessages || bytes_ > kMostBytes;
  }

  mutable Mutex mutex_;
  std::map<Key, Waiting> waiting_ GUARDED_BY(mutex_);
  std::size_t bytes_ GUARDED_BY(mutex_) = 0;  // of their encodings
  uint64_t next_ GUARDED_BY(mutex_) = 0;
  std::optional<Monotonic> wake_ GUARDED_BY(mutex_);  // the earliest that is queued
  bool atOnce_ GUARDED_BY(mutex_) = false;
};

}  // namespace vx
