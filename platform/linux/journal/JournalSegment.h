// One mapped segment of a journal.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>

#include "base/Status.h"
#include "base/UniqueFd.h"
#include "platform/linux/journal/JournalFormat.h"

namespace vx::lnx {

// A file of kSegmentBytes, mapped at a multiple of its size, so that whoever has an address inside
// finds the segment. Owned by the Journal; once let go of it lives on until its last ticket and its
// last payload have gone. Counting is thread-safe; the rest is under the journal's lock.
class JournalSegment {
 public:
  // Lets go of a segment, which need not end at once.
  struct LetGo {
    void operator()(JournalSegment* segment) const { segment->drop(kAttached); }
  };
  using Pointer = std::unique_ptr<JournalSegment, LetGo>;

  static constexpr std::size_t kStep = std::size_t{256} << 10;
  // A file whose first kStep bytes are allocated, or all of it.
  static Result<Pointer> map(UniqueFd fd, std::string name);
  // What lies before `end` may be written: what was not allocated would be a SIGBUS on a full
  // tmpfs.
  Status allocate(std::size_t end) { return end <= allocated_ ? Status() : allocateMore(end); }
  static JournalSegment* of(const void* inside);

  // From here on the file counts; what it held before does not. Nobody may wait for it any more.
  void begin(const JournalEpoch& epoch, uint32_t generation, uint64_t sequence, uint64_t firstCall);
  // An earlier process filled it; its calls count once they are resumed.
  void resumeCall() { uses_.fetch_add(kOneCall, std::memory_order_relaxed); }
  // Nothing more will be appended to it than this.
  void seal(uint32_t calls, uint32_t payloads);
  void markFree();  // a reader has nothing to look for in it

  // Of a sealed segment.
  bool hasUndoneCalls() const { return (uses_.load(std::memory_order_acquire) & kCalls) != 0; }
  // Of one that is not sealed, and to which so many calls have been appended.
  bool hasUndoneCallsOf(uint32_t appended) const {
    const uint64_t counted = (uses_.load(std::memory_order_acquire) & kCalls) / kOneCall;
    return counted + appended != kMaxEntriesPerSegment;
  }
  bool hasPayloads() const { return (uses_.load(std::memory_order_acquire) & kPayloads) != 0; }

  void callDone() {
    const uint64_t before = uses_.fetch_sub(kOneCall, std::memory_order_acq_rel);
    if (before == kOneCall) delete this;
    if ((before & kCalls) == kOneCall) [[unlikely]]
      tellCallsDone();
  }
  // See Journal.
  static void setCallsDoneHandler(void (*handler)(void*), void* with);
  void payloadReleased() { drop(kOnePayload); }

  const std::string& name() const { return name_; }
  uint64_t sequence() const { return header().sequence; }
  uint32_t generation() const { return header().generation; }
  uint8_t* at(std::size_t offset) { return base_ + offset; }

 private:
  static constexpr uint64_t kOnePayload = 1;
  static constexpr uint64_t kPayloads = 0xFFFFFFFFu;
  static constexpr uint64_t kOneCall = kPayloads + 1;
  static constexpr uint64_t kCalls = uint64_t{0x7FFFFFFF} << 32;
  static constexpr uint64_t kAttached = uint64_t{1} << 63;
  // Until it is sealed, a segment counts as full of calls and payloads, so that an append need not
  // touch what other threads count down.
  static constexpr uint64_t kWhileOpen = kMaxEntriesPerSegment * (kOneCall + kOnePayload);

  JournalSegment(uint8_t* base, std::string name, UniqueFd fd, std::size_t allocated);
  Status allocateMore(std::size_t end);
  ~JournalSegment();
  static void tellCallsDone();
  SegmentHeader& header() const { return *reinterpret_cast<SegmentHeader*>(base_); }
  void drop(uint64_t uses) {
    if (uses_.fetch_sub(uses, std::memory_order_acq_rel) == uses) delete this;
  }

  uint8_t* const base_;
  const std::string name_;
  UniqueFd fd_;  // until it is allocated whole
  std::size_t allocated_;
  std::atomic<uint64_t> uses_{kAttached};
};

}  // namespace vx::lnx
