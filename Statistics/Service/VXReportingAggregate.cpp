#include "Statistics/Service/VXReportingAggregate.h"

#include "platform/Platform.h"

namespace vx {

bool VXReportingAggregate::isPresent() const {
  MutexLock lock(mutex_);
  return present_;
}

std::size_t VXReportingAggregate::flatSize() const {
  MutexLock lock(mutex_);
  return rows_ == nullptr ? 0 : rows_->rows();
}

std::size_t VXReportingAggregate::nestedSize() const {
  MutexLock lock(mutex_);
  return headers_.size() + (rows_ == nullptr ? 0 : rows_->messages());
}

void VXReportingAggregate::renew() { (void)exchange(nullptr, true); }

VXReportingAggregate::Contents VXReportingAggregate::removeAll() {
  return exchange(nullptr, false);
}

VXReportingAggregate::Contents VXReportingAggregate::exchange(Contents rows, bool present) {
  std::vector<Payload> headers;  // destroyed after the lock is released
  MutexLock lock(mutex_);
  headers_.swap(headers);
  rows_.swap(rows);
  present_ = present;
  return rows;
}

VXReportingRows& VXReportingAggregate::rows() {
  if (rows_ == nullptr) rows_ = std::make_unique<VXReportingRows>(platform().aggregates);
  return *rows_;
}

void VXReportingAggregate::append(std::optional<MessageKind> kind, uint64_t count,
                                  const Payload& payload, AggregateMemory::Payer payer) {
  rows().append(kind, count, payload);
  rows().chargeTo(payer);
}

// A call that is run again leaves out what it left out before, however much is kept now.
bool VXReportingAggregate::appendMessage(MessageKind kind, uint64_t count, const Payload& payload) {
  const AggregateMemory::Account account = platform().aggregates.account();
  MutexLock lock(mutex_);
  if (!present_) return true;
  if (platform().inputs.decide("left out", account.isFull)) return false;
  append(kind, count, payload, account.payer);
  return true;
}

void VXReportingAggregate::appendReference(MessageKind kind, uint64_t count,
                                           const Payload& payload) {
  MutexLock lock(mutex_);
  if (present_) rows().appendReference(kind, count, payload);
}

void VXReportingAggregate::appendToFlat(const Payload& payload) {
  MutexLock lock(mutex_);
  if (present_) append(std::nullopt, 0, payload, platform().aggregates.account().payer);
}

void VXReportingAggregate::insertHeader(Payload header) {
  MutexLock lock(mutex_);
  headers_.insert(headers_.begin(), std::move(header));
}

bool VXReportingAggregate::mayHoldNonFinite() const {
  MutexLock lock(mutex_);
  return rows_ != nullptr && rows_->mayHoldNonFinite();
}

VXReportingAggregate::State VXReportingAggregate::state() const {
  MutexLock lock(mutex_);
  if (rows_ == nullptr) return {.present = present_};
  return {.present = present_, .aggregate = rows_->aggregate(), .bytes = rows_->bytes()};
}

Status VXReportingAggregate::restore(const State& state) {
  if (!state.present || state.aggregate == 0) {
    (void)exchange(nullptr, state.present);
    return {};
  }
  Result<Contents> rows =
      VXReportingRows::restore(platform().aggregates, state.aggregate, state.bytes);
  if (!rows.ok()) {
    (void)exchange(nullptr, true);
    return rows.status();
  }
  (void)exchange(std::move(rows).value(), true);
  return {};
}

uint64_t VXReportingAggregate::unrecordedBytes() const {
  MutexLock lock(mutex_);
  return rows_ == nullptr ? 0 : rows_->offset() - rows_->bytes();
}

}  // namespace vx
