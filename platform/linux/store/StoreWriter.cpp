#include "platform/linux/store/StoreWriter.h"

#include <sqlite3.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <iterator>
#include <utility>

#include "platform/Log.h"
#include "platform/linux/execution/Threads.h"
#include "platform/linux/store/StoreFile.h"

namespace vx::lnx {

namespace {

constexpr std::chrono::milliseconds kFirstBackoff{200};
constexpr std::chrono::milliseconds kLastBackoff{5000};
constexpr std::chrono::milliseconds kCloseMargin{500};  // beyond what the thread itself tries
constexpr double kHoldSeconds = 0.05;                   // how far the relay may be behind analytics
// Of one payload, below what SQLite can hold. One that is larger could never be written, and
// nothing behind it either.
constexpr uint64_t kMostText = 512u << 20;
constexpr int kWriterNiceness = 15;

std::size_t mostTextOf(const StoreOptions& options) {
  return static_cast<std::size_t>(std::min<uint64_t>(options.maxBytes / 4, kMostText));
}

}  // namespace

StoreWriter::Open::Open(Database opened, const StoreOptions& options, Clock& clock)
    : database(std::move(opened)),
      rows(database.get(), mostTextOf(options), clock),
      retention(database.get(), options, clock) {}

StoreWriter::StoreWriter(std::string path, Database database, const StoreOptions& options,
                         Clock& clock)
    : path_(std::move(path)),
      options_(options),
      clock_(clock),
      queue_(options, clock),
      unchecked_(std::move(database)) {}

StoreWriter::~StoreWriter() {
  if (!thread_.joinable()) return;
  close(clock_.monotonic());
  thread_.join();
}

void StoreWriter::start() {
  thread_ = startThread("vx-store", [this] { threadMain(); });
}

StoreCounters StoreWriter::counters() const {
  return {.rowsCommitted = rowsCommitted_.load(),
          .commits = commits_.load(),
          .writeFailures = writeFailures_.load(),
          .rowsLost = rowsLost_.load()};
}

bool StoreWriter::close(Monotonic deadline) {
  queue_.close(deadline);
  const auto limit =
      std::chrono::time_point_cast<std::chrono::steady_clock::duration>(deadline + kCloseMargin);
  MutexLock lock(mutex_);
  while (!finished_ && thread_.joinable()) {
    if (!ended_.waitUntil(mutex_, limit) && !finished_) return false;
  }
  return rowsLost_.load() == 0;
}

void StoreWriter::threadMain() {
  setpriority(PRIO_PROCESS, static_cast<id_t>(syscall(SYS_gettid)), kWriterNiceness);
  runJobs();
  checkDatabase();
  if (open_) {
    add(open_->retention.apply());
    // The pages that the check has read are of no use to whoever appends.
    sqlite3_db_release_memory(open_->database.get());
  }
  StoreBatch batch;
  for (;;) {
    const StoreQueue::Turn turn = queue_.take(batch, pairing_.heldSince());
    if (turn == StoreQueue::Turn::End) break;
    runJobs();
    if (turn == StoreQueue::Turn::Batch) writeBatch(batch);
  }
  if (!notes_.empty()) (void)write(batch, 0, 0);  // what the last pass removed
  open_.reset();
  MutexLock lock(mutex_);
  finished_ = true;
  ended_.notifyAll();
}

void StoreWriter::runJobs() {
  for (const Function<void()>& job : queue_.takeJobs()) job();
}

void StoreWriter::checkDatabase() {
  const Status check = quickCheck(unchecked_.get());
  if (check.ok()) {
    open_.emplace(std::move(unchecked_), options_, clock_);
    return;
  }
  unchecked_.reset();
  const Result<std::string> aside = moveAside(path_);
  OpenedStore fresh = openStoreDatabase(path_);
  if (!fresh.status.ok()) {
    VX_LOG(nullptr, Error, "the store failed its check (%s) and cannot be begun afresh: %s",
           check.text().c_str(), fresh.status.text().c_str());
    return;
  }
  open_.emplace(std::move(fresh.database), options_, clock_);
  const std::string where = aside.ok() ? *aside : "";
  VX_LOG(nullptr, Error,
         "the store failed its check (%s); it was moved to %s and a fresh one begun",
         check.text().c_str(), where.c_str());
  notes_.push_back({"moved_aside", "", 0, "failed its check (" + check.text() + "); now " + where});
}

void StoreWriter::writeBatch(StoreBatch& batch) {
  pairing_.join(batch.records);
  pairing_.pair(batch.records);
  if (!batch.urgent) {
    const double now = std::chrono::duration<double>(clock_.now().time_since_epoch()).count();
    pairing_.hold(batch.records, now - kHoldSeconds, clock_.monotonic());
  }
  std::size_t first = 0;
  // A batch without records may still have flushes.
  do {
    const std::size_t last = std::min(batch.records.size(), first + options_.commit.rows);
    const Result<RowWriter::Written> written = write(batch, first, last);
    if (written.ok()) {
      onCommitted(batch, first, last);
      first = last;
      runJobs();
    } else if (!waitBeforeRetry(written.status())) {
      onLost(batch, first, written.status());
      break;
    }
  } while (first < batch.records.size() || !batch.flushes.empty());
  batch.clear();
  if (open_) add(open_->retention.onBatchWritten());
}

Result<RowWriter::Written> StoreWriter::write(const StoreBatch& batch, std::size_t first,
                                              std::size_t last) {
  if (!open_) return Status::failure("the database cannot be opened");
  Result<RowWriter::Written> written = open_->rows.write(batch.records, first, last, notes_);
  if (!written.ok()) return written;
  notes_.clear();
  ++commits_;
  rowsCommitted_ += written->rows;
  writeFailures_ += written->failedBuilders;
  return written;
}

void StoreWriter::onCommitted(StoreBatch& batch, std::size_t first, std::size_t last) {
  if (failing_) {
    failing_ = false;
    backoff_ = {};
    VX_LOG(nullptr, Error, "the store can be written again; nothing was lost");
  }
  EventPairing::markWritten(batch.records, first, last);
  const std::size_t left = batch.records.size() - first;
  release(batch, last - first == left ? batch.bytes : batch.bytes * (last - first) / left);
  const auto unanswered =
      std::find_if(batch.flushes.begin(), batch.flushes.end(),
                   [last](const StoreFlush& flush) { return flush.records > last; });
  for (auto flush = batch.flushes.begin(); flush != unanswered; ++flush)
    flush->handler(std::nullopt);
  batch.flushes.erase(batch.flushes.begin(), unanswered);
}

void StoreWriter::onLost(StoreBatch& batch, std::size_t first, const Status& why) {
  const uint64_t lost = EventPairing::unwrittenRows(batch.records, first);
  rowsLost_ += lost;
  VX_LOG(nullptr, Error, "the store could not be written before the end: %llu rows are lost (%s)",
         static_cast<unsigned long long>(lost), why.text().c_str());
  release(batch, batch.bytes);
  for (const StoreFlush& flush : batch.flushes) flush.handler(why.error());
}

void StoreWriter::release(StoreBatch& batch, std::size_t bytes) {
  batch.bytes -= bytes;
  if (queue_.release(bytes) && drained_) drained_();
}

bool StoreWriter::waitBeforeRetry(const Status& failure) {
  ++writeFailures_;
  if (!failing_) {
    failing_ = true;
    VX_LOG(nullptr, Error, "cannot write %s: %s; what was accepted is kept and tried again",
           path_.c_str(), failure.text().c_str());
  }
  if (!open_) {
    OpenedStore again = openStoreDatabase(path_);
    if (again.status.ok()) open_.emplace(std::move(again.database), options_, clock_);
  }
  backoff_ = std::clamp(backoff_ * 2, kFirstBackoff, kLastBackoff);
  const Monotonic until = clock_.monotonic() + backoff_;
  for (;;) {
    runJobs();
    switch (queue_.waitBeforeRetry(until)) {
      case StoreQueue::Retry::Now:
        return true;
      case StoreQueue::Retry::NoMore:
        return false;
      case StoreQueue::Retry::JobsFirst:
        break;
    }
  }
}

void StoreWriter::add(std::vector<LedgerNote> notes) {
  std::move(notes.begin(), notes.end(), std::back_inserter(notes_));
}

}  // namespace vx::lnx
