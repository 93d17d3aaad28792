#include "platform/linux/store/StoreQueue.h"

#include <algorithm>
#include <utility>

namespace vx::lnx {

namespace {

constexpr std::size_t kKeptRecords = 1024;  // capacity that an idle queue keeps
constexpr std::chrono::milliseconds kRetryWhileClosing{50};

std::chrono::steady_clock::time_point steady(Monotonic time) {
  return std::chrono::time_point_cast<std::chrono::steady_clock::duration>(time);
}

}  // namespace

void StoreBatch::charge(UserIndex user, std::size_t more) {
  bytes += more;
  // Few users cause what is written together, and mostly one at a time.
  auto found = charges.rbegin();
  while (found != charges.rend() && found->user != user) ++found;
  if (found == charges.rend())
    charges.push_back({user, more});
  else
    found->bytes += more;
}

void StoreBatch::clear() {
  records.clear();
  flushes.clear();
  charges.clear();
  bytes = 0;
  urgent = false;
}

// Told once: whoever was woken looks at everything.
bool StoreQueue::mustWake(bool urgent) {
  const bool wake = sleep_ == Sleep::UntilWork || (sleep_ == Sleep::UntilCommit && urgent);
  if (wake) sleep_ = Sleep::Awake;
  return wake;
}

double StoreQueue::timeOf(const Cause& cause) const {
  if (cause.ticket && replaying_.load(std::memory_order_relaxed)) return cause.ticket.time();
  return std::chrono::duration<double>(clock_.now().time_since_epoch()).count();
}

void StoreQueue::abandonAll() {
  MutexLock lock(mutex_);
  for (std::size_t i = 0; i < pending_.records.size(); ++i)
    pending_.records[i].cause.ticket.abandon();
}

bool StoreQueue::append(StoreRecord::What what, std::size_t bytes) {
  const std::size_t size = sizeof(StoreRecord) + bytes;
  Cause cause = Cause::take();
  const double time = timeOf(cause);
  const UserIndex user = cause.user;
  bool wake = false;
  {
    MutexLock lock(mutex_);
    const bool unrecorded = !cause.ticket && !StoreRecord::makesNoRow(what);
    if (closing_) {
      if (unrecorded) ++lost_;
      cause.ticket.abandon();
      return false;
    }
    // Before the taking thread can take it off again.
    if (accounts_ != nullptr) accounts_->add(user, MemoryKind::Waiting, size);
    if (pending_.records.empty()) firstPending_ = clock_.monotonic();
    if (unrecorded) [[unlikely]]
      ++unrecorded_;
    pending_.records.emplace_back(time, std::move(what), std::move(cause));
    pending_.charge(user, size);
    wake = mustWake(options_.commit.isFull(pending_.records.size(), pending_.bytes));
  }
  if (wake) wake_.notifyOne();
  return true;
}

bool StoreQueue::appendFlush(FlushHandler& handler, std::shared_ptr<RelayRow> session) {
  bool wake = false;
  {
    MutexLock lock(mutex_);
    if (closing_) return false;
    pending_.flushes.push_back({pending_.records.size(), std::move(handler), std::move(session)});
    pending_.urgent = true;
    wake = mustWake(true);
  }
  if (wake) wake_.notifyOne();
  return true;
}

void StoreQueue::runSoon(Function<void()> job) {
  {
    MutexLock lock(mutex_);
    jobs_.push_back(std::move(job));
  }
  wake_.notifyOne();
}

StoreQueue::Waiting StoreQueue::waiting() const {
  MutexLock lock(mutex_);
  if (pending_.records.empty()) return {};
  return {pending_.records.size(), pending_.bytes, firstPending_};
}

void StoreQueue::close(Monotonic deadline) {
  {
    MutexLock lock(mutex_);
    if (closing_) return;
    closing_ = true;
    closeDeadline_ = deadline;
  }
  wake_.notifyOne();
}

void StoreQueue::giveUp() {
  gaveUp_ = true;
  {
    MutexLock lock(mutex_);
    closeDeadline_ = std::min(closeDeadline_, clock_.monotonic());
  }
  wake_.notifyOne();
}

// None: nothing waits.
std::optional<Monotonic> StoreQueue::dueTime(std::optional<Monotonic> heldSince) const {
  if (heldSince) return *heldSince + options_.commit.interval;
  if (pending_.records.empty() && pending_.flushes.empty()) return std::nullopt;
  return firstPending_ + options_.commit.interval;
}

bool StoreQueue::isDue(std::optional<Monotonic> heldSince) const {
  const std::optional<Monotonic> due = dueTime(heldSince);
  return due && (closing_ || pending_.urgent ||
                 options_.commit.isFull(pending_.records.size(), pending_.bytes) ||
                 clock_.monotonic() >= *due);
}

StoreQueue::Turn StoreQueue::takeLocked(StoreBatch& batch, std::optional<Monotonic> heldSince) {
  if (!jobs_.empty()) return Turn::Jobs;
  if (!isDue(heldSince)) return closing_ ? Turn::End : Turn::Nothing;
  batch.clear();
  batch.records.swap(pending_.records);
  batch.flushes.swap(pending_.flushes);
  batch.charges.swap(pending_.charges);
  batch.bytes = std::exchange(pending_.bytes, 0);
  batch.since = firstPending_;
  batch.urgent = std::exchange(pending_.urgent, false) || closing_;
  return Turn::Batch;
}

StoreQueue::Turn StoreQueue::tryTake(StoreBatch& batch, std::optional<Monotonic> heldSince) {
  MutexLock lock(mutex_);
  return takeLocked(batch, heldSince);
}

StoreQueue::Turn StoreQueue::take(StoreBatch& batch, std::optional<Monotonic> heldSince) {
  MutexLock lock(mutex_);
  for (;;) {
    const Turn turn = takeLocked(batch, heldSince);
    if (turn != Turn::Nothing) return turn;
    if (const std::optional<Monotonic> due = dueTime(heldSince)) {
      sleep_ = Sleep::UntilCommit;
      wake_.waitUntil(mutex_, steady(*due));
    } else {
      pending_.records.shrink(kKeptRecords);
      batch.records.shrink(kKeptRecords);
      sleep_ = Sleep::UntilWork;
      wake_.wait(mutex_);
    }
    sleep_ = Sleep::Awake;
  }
}

std::vector<Function<void()>> StoreQueue::takeJobs() {
  MutexLock lock(mutex_);
  return std::exchange(jobs_, {});
}

void StoreQueue::release(StoreBatch& batch, std::size_t done, std::size_t left) {
  for (StoreBatch::Charge& charge : batch.charges) {
    const std::size_t part = done == left ? charge.bytes : charge.bytes * done / left;
    charge.bytes -= part;
    if (accounts_ != nullptr && part > 0) accounts_->remove(charge.user, MemoryKind::Waiting, part);
  }
}

bool StoreQueue::waitBeforeRetry(Monotonic until) {
  MutexLock lock(mutex_);
  for (;;) {
    const Monotonic time = clock_.monotonic();
    if (closing_) {
      if (time >= closeDeadline_) return false;
      wake_.waitUntil(mutex_, steady(std::min(closeDeadline_, time + kRetryWhileClosing)));
      return true;
    }
    if (time >= until) return true;
    wake_.waitUntil(mutex_, steady(until));
  }
}

}  // namespace vx::lnx
