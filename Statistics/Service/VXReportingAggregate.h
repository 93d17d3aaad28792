// What a session received while it was started.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <utility>
#include <vector>

#include "Statistics/Service/VXReportingRowReader.h"
#include "Statistics/Service/VXReportingRows.h"
#include "base/Mutex.h"
#include "base/Status.h"

namespace vx {

// The two aggregates of a session, which may be absent, as views of the same rows: the flat one is
// all of them, the nested one what was put before the messages, and the messages under their
// identifiers. Thread-safe, with one lock. Bounded by what the clients send while the session is
// started; an empty one has no rows.
class VXReportingAggregate {
 public:
  bool isPresent() const;
  std::size_t flatSize() const;
  std::size_t nestedSize() const;
  // A new, empty one takes the place of the old one.
  void renew();
  // From here on it is absent. What was there, for whoever has the time to let go of it.
  using Contents = std::unique_ptr<VXReportingRows>;
  [[nodiscard]] Contents removeAll();

  // All of them are dropped without a word where the aggregate is absent. None keeps the payload
  // alive, but appendReference: for one that is too large for a copy and is let go of soon. False:
  // it is left out, because whoever sent it has enough kept already.
  bool appendMessage(MessageKind kind, uint64_t count, const Payload& payload);
  void appendReference(MessageKind kind, uint64_t count, const Payload& payload);
  void appendToFlat(const Payload& payload);
  // Puts `header` before everything in the nested one.
  void insertHeader(Payload header);

  // Visits, with the lock held, every row in order: onRow(const VXReportingRow&).
  template <class OnRow>
  void forEach(const OnRow& onRow) const {
    forEach([](const Payload&) {}, onRow);
  }
  // The headers first.
  template <class OnHeader, class OnRow>
  void forEach(const OnHeader& onHeader, const OnRow& onRow) const {
    MutexLock lock(mutex_);
    for (const Payload& header : headers_) onHeader(header);
    if (rows_ == nullptr) return;
    VXReportingRowReader reader(*rows_);
    while (const VXReportingRow* row = reader.next()) onRow(*row);
  }
  template <class OnHeader>
  void forEachHeader(const OnHeader& onHeader) const {
    MutexLock lock(mutex_);
    for (const Payload& header : headers_) onHeader(header);
  }
  // A number in a row may not be finite.
  bool mayHoldNonFinite() const;

  // What a snapshot of the service holds of it; the rows lie in AggregateMemory and survive the
  // process by themselves. What is appended later, and headers, are no part of it.
  struct State {
    bool present = true;
    uint64_t aggregate = 0;  // 0: without rows
    uint64_t bytes = 0;
  };
  State state() const;
  // The aggregate as it was, for a process that came after. An error where that is not there any
  // more, and then a new, empty one. Each state can be restored once.
  Status restore(const State& state);
  // Bytes that a state of this moment would miss, since they lie where they do not survive.
  uint64_t unrecordedBytes() const;

 private:
  Contents exchange(Contents rows, bool present);
  VXReportingRows& rows() REQUIRES(mutex_);
  void append(std::optional<MessageKind> kind, uint64_t count, const Payload& payload,
              AggregateMemory::Payer payer) REQUIRES(mutex_);

  mutable Mutex mutex_;
  Contents rows_ GUARDED_BY(mutex_);  // none yet
  std::vector<Payload> headers_ GUARDED_BY(mutex_);
  bool present_ GUARDED_BY(mutex_) = true;
};

}  // namespace vx
