// What a session received while it was started.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <utility>
#include <vector>

#include "Statistics/VXReportingUtility.h"
#include "base/ChunkList.h"
#include "base/Mutex.h"

namespace vx {

// One message under its identifier, as (kind, count): the text is written out when somebody reads
// it.
struct VXReportingNestedEntry {
  Payload payload;
  uint64_t count : 48 = 0;  // a thousand messages a second for some 9000 years
  uint64_t kind : 16 = 0;
};

// An append-only array with its own lock, which may be absent. Grows by chunks: a session may hold
// millions of messages, and an array that doubles would need half as much memory again just to
// grow. An empty one allocates nothing. Thread-safe; bounded by what the clients send while the
// session is started.
template <class Entry>
class VXReportingAggregate {
 public:
  bool isPresent() const {
    MutexLock lock(mutex_);
    return present_;
  }
  std::size_t size() const {
    MutexLock lock(mutex_);
    return entries_.size() + front_.size();
  }
  // A new, empty array takes the place of the old one.
  void renew() { (void)exchange(true); }
  // What was there, for whoever has the time to destroy millions of entries.
  using Contents = ChunkList<Entry, 4096, 16, 4>;
  [[nodiscard]] Contents removeAll() { return exchange(false); }

  // Dropped without a word when the array is absent.
  void append(Entry entry) {
    MutexLock lock(mutex_);
    if (!present_) return;
    entries_.push_back(std::move(entry));
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
    entries_.forEachChunk([&](std::span<const Entry> chunk) {
      for (const Entry& entry : chunk) onEntry(entry);
    });
  }
  template <class OnEntry>
  void forEach(const OnEntry& onEntry) const {
    forEach([](const Payload&) {}, onEntry);
  }

 private:
  Contents exchange(bool present) {
    Contents old;
    std::vector<Payload> oldFront;  // both are destroyed after the lock is released
    MutexLock lock(mutex_);
    old.swap(entries_);
    oldFront.swap(front_);
    present_ = present;
    return old;
  }

  mutable Mutex mutex_;
  Contents entries_ GUARDED_BY(mutex_);
  std::vector<Payload> front_ GUARDED_BY(mutex_);
  bool present_ GUARDED_BY(mutex_) = true;
};

}  // namespace vx
