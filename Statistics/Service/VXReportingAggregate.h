// What a session received while it was started.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <utility>
#include <vector>

#include "Statistics/VXReportingUtility.h"
#include "base/Mutex.h"

namespace vx {

// One message under its identifier, as (kind, count): the text is written out when somebody reads
// it.
struct VXReportingNestedEntry {
  Payload payload;
  uint64_t count : 48 = 0;  // a thousand messages a second for some 9000 years
  uint64_t kind : 16 = 0;
};

// An append-only array with its own lock, which may be absent. Grows by chunks that are never
// moved: a session may hold millions of messages, and an array that doubles would need half as much
// memory again just to grow. An empty one allocates nothing. Thread-safe; bounded by what the
// clients send while the session is started.
template <class Entry>
class VXReportingAggregate {
 public:
  bool isPresent() const {
    MutexLock lock(mutex_);
    return present_;
  }
  std::size_t size() const {
    MutexLock lock(mutex_);
    return size_ + front_.size();
  }
  // A new, empty array takes the place of the old one.
  void renew() { (void)exchange(true); }
  // What was there, for whoever has the time to let go of millions of entries.
  using Contents = std::vector<std::vector<Entry>>;
  [[nodiscard]] Contents removeAll() { return exchange(false); }

  // Dropped without a word when the array is absent.
  void append(Entry entry) {
    MutexLock lock(mutex_);
    if (!present_) return;
    if (chunks_.empty() || chunks_.back().size() == chunks_.back().capacity()) {
      const std::size_t capacity =
          chunks_.empty() ? kFirstChunk : std::min(chunks_.back().capacity() * 4, kLargestChunk);
      chunks_.emplace_back().reserve(capacity);
    }
    chunks_.back().push_back(std::move(entry));
    ++size_;
  }
  // Puts `header` before everything that is there.
  void insertAtFront(Payload header) {
    MutexLock lock(mutex_);
    front_.insert(front_.begin(), std::move(header));
  }

  // Visits, with the lock held, the headers and then every entry in order.
  template <class OnHeader, class OnEntry>
  void forEach(const OnHeader& onHeader, const OnEntry& onEntry) const {
    MutexLock lock(mutex_);
    for (const Payload& header : front_) onHeader(header);
    for (const std::vector<Entry>& chunk : chunks_) {
      for (const Entry& entry : chunk) onEntry(entry);
    }
  }
  template <class OnEntry>
  void forEach(const OnEntry& onEntry) const {
    forEach([](const Payload&) {}, onEntry);
  }

 private:
  static constexpr std::size_t kFirstChunk = 16;
  static constexpr std::size_t kLargestChunk = 4096;

  Contents exchange(bool present) {
    Contents old;  // destroyed after the lock is released
    std::vector<Payload> oldFront;
    MutexLock lock(mutex_);
    old.swap(chunks_);
    oldFront.swap(front_);
    size_ = 0;
    present_ = present;
    return old;
  }

  mutable Mutex mutex_;
  std::vector<std::vector<Entry>> chunks_ GUARDED_BY(mutex_);
  std::vector<Payload> front_ GUARDED_BY(mutex_);
  std::size_t size_ GUARDED_BY(mutex_) = 0;
  bool present_ GUARDED_BY(mutex_) = true;
};

}  // namespace vx
