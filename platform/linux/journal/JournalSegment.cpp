#include "platform/linux/journal/JournalSegment.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>

#include <algorithm>
#include <utility>

#include "base/Mutex.h"

namespace vx::lnx {

namespace {

std::atomic_ref<uint32_t> wordAt(uint32_t& word) { return std::atomic_ref<uint32_t>(word); }

struct CallsDone {
  Mutex mutex;
  void (*handler)(void*) GUARDED_BY(mutex) = nullptr;
  void* with GUARDED_BY(mutex) = nullptr;
};
CallsDone& callsDone() {
  static CallsDone done;
  return done;
}

}  // namespace

void JournalSegment::setCallsDoneHandler(void (*handler)(void*), void* with) {
  CallsDone& done = callsDone();
  MutexLock lock(done.mutex);
  done.handler = handler;
  done.with = with;
}

void JournalSegment::tellCallsDone() {
  CallsDone& done = callsDone();
  MutexLock lock(done.mutex);
  if (done.handler != nullptr) done.handler(done.with);
}

Result<JournalSegment::Pointer> JournalSegment::map(UniqueFd fd, std::string name) {
  struct stat info {};
  if (fstat(fd.get(), &info) != 0) return Status::lastError("cannot look at " + name);
  const bool whole = info.st_blocks * 512 >= off_t{kSegmentBytes};
  // Twice the size holds an aligned part of the size; the rest is given back.
  void* const reserved = mmap(nullptr, 2 * kSegmentBytes, PROT_NONE,
                              MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
  if (reserved == MAP_FAILED) return Status::lastError("cannot reserve memory for the journal");
  auto* const first = static_cast<uint8_t*>(reserved);
  const std::size_t before = -reinterpret_cast<uintptr_t>(reserved) & (kSegmentBytes - 1);
  uint8_t* const base = first + before;
  const int how = MAP_SHARED | MAP_FIXED | (whole ? MAP_POPULATE : 0);
  const bool mapped =
      mmap(base, kSegmentBytes, PROT_READ | PROT_WRITE, how, fd.get(), 0) != MAP_FAILED;
  const Status status = mapped ? Status() : Status::lastError("cannot map " + name);
  if (before > 0) munmap(first, before);
  munmap(base + kSegmentBytes, kSegmentBytes - before);
  if (!mapped) {
    munmap(base, kSegmentBytes);
    return status;
  }
  if (whole) fd.reset();
  return Pointer(
      new JournalSegment(base, std::move(name), std::move(fd), whole ? kSegmentBytes : kStep));
}

JournalSegment::JournalSegment(uint8_t* base, std::string name, UniqueFd fd, std::size_t allocated)
    : base_(base), name_(std::move(name)), fd_(std::move(fd)), allocated_(allocated) {
  header().owner = this;
}

Status JournalSegment::allocateMore(std::size_t end) {
  const std::size_t most = std::min(kSegmentBytes, (end + kStep - 1) / kStep * kStep);
  const std::size_t bytes = most - allocated_;
  const int code =
      posix_fallocate(fd_.get(), static_cast<off_t>(allocated_), static_cast<off_t>(bytes));
  if (code != 0) return Status::posix("cannot allocate " + name_, code);
  (void)madvise(base_ + allocated_, bytes,
                MADV_POPULATE_WRITE);  // a fault costs more, page by page
  allocated_ = most;
  if (allocated_ == kSegmentBytes) fd_.reset();
  return {};
}

JournalSegment::~JournalSegment() { munmap(base_, kSegmentBytes); }

JournalSegment* JournalSegment::of(const void* inside) {
  const auto address = reinterpret_cast<uintptr_t>(inside) & ~uintptr_t{kSegmentBytes - 1};
  // NOLINTNEXTLINE(performance-no-int-to-ptr)
  return static_cast<JournalSegment*>(reinterpret_cast<SegmentHeader*>(address)->owner);
}

void JournalSegment::begin(const JournalEpoch& epoch, uint32_t generation, uint64_t sequence,
                           uint64_t firstCall) {
  markFree();
  uses_.store(kAttached + kWhileOpen, std::memory_order_relaxed);
  SegmentHeader& head = header();
  head.magic = SegmentHeader::kMagic;
  head.version = SegmentHeader::kVersion;
  head.epoch = epoch;
  head.sequence = sequence;
  head.firstCall = firstCall;
  head.generation = generation;
  head.reserved = 0;
  head.checksum = checksumOf(head);
  reinterpret_cast<EntryHeader*>(at(kFirstEntry))->length = 0;
  wordAt(head.state).store(SegmentHeader::kInUse, std::memory_order_release);
}

void JournalSegment::seal(uint32_t calls, uint32_t payloads) {
  drop(kWhileOpen - calls * kOneCall - payloads * kOnePayload);
}

void JournalSegment::markFree() {
  wordAt(header().state).store(SegmentHeader::kFree, std::memory_order_release);
}

}  // namespace vx::lnx
