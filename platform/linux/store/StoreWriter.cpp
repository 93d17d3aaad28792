#include "platform/linux/store/StoreWriter.h"

#include <sqlite3.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <iterator>
#include <utility>

#include "platform/Log.h"
#include "platform/linux/execution/Threads.h"
#include "platform/linux/store/LogReaders.h"
#include "platform/linux/store/StoreSchema.h"

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
// Of text, in one transaction; and of the log, before which it must have been checkpointed.
constexpr std::size_t kTransactionBytes = 2u << 20;
constexpr off_t kLogBytes = 8 << 20;

std::size_t mostTextOf(const StoreOptions& options) {
  return static_cast<std::size_t>(std::min<uint64_t>(options.maxBytes / 4, kMostText));
}

}  // namespace

StoreWriter::Open::Open(Database opened, const StoreBeginning& beginning,
                        const StoreOptions& options, EndWord endWord, Clock& clock)
    : database(std::move(opened)),
      identity(beginning.path(), database.get()),
      rows(database.get(), mostTextOf(options), endWord, clock, beginning.stores()),
      retention(database.get(), options, clock) {}

StoreWriter::StoreWriter(std::unique_ptr<StoreBeginning> beginning, const StoreOptions& options,
                         Clock& clock)
    : options_(options), clock_(clock), queue_(options, clock), beginning_(std::move(beginning)) {
  unchecked_ = beginning_->open(found_);
  epoch_ = beginning_->epoch();
  lastCall_ = beginning_->lastCall();
}

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
          .rowsLeft = rowsLeft_.load(),
          .rowsLost = rowsLost_.load() + queue_.lostRows(),
          .unrecordedWaiting = queue_.unrecordedRows() - unrecordedDone_.load()};
}

StoreAccount StoreWriter::account() const {
  StoreAccount account;
  account.counters = counters();
  account.path = beginning_->path();
  account.maxBytes = options_.maxBytes;
  account.fileBytes = fileBytes_.load();
  account.logBytes = logBytes_.load();
  if (const double oldest = oldest_.load(); oldest != 0) account.oldest = oldest;
  account.failing = failingNow_.load();
  const StoreQueue::Waiting waiting = queue_.waiting();
  account.waitingRecords = waiting.records + batchRecords_.load();
  account.waitingBytes = waiting.bytes + batchBytes_.load();
  const bool isWriting = batchRecords_.load() > 0;
  if (isWriting || waiting.since)
    account.lag = clock_.monotonic() - (isWriting ? batchSince_.load() : *waiting.since);
  MutexLock lock(ledgerMutex_);
  account.ledgerRows = ledgerRows_;
  return account;
}

bool StoreWriter::close(Monotonic deadline) {
  queue_.close(deadline);
  return waitUntilEnded(deadline + kCloseMargin) && rowsLost_.load() == 0;
}

bool StoreWriter::waitUntilEnded(Monotonic until) {
  const auto limit = std::chrono::time_point_cast<std::chrono::steady_clock::duration>(until);
  MutexLock lock(mutex_);
  while (!finished_ && thread_.joinable()) {
    if (!ended_.waitUntil(mutex_, limit) && !finished_) return false;
  }
  return true;
}

uint64_t StoreWriter::bytesLeft() const {
  uint64_t left = options_.maxBytes + StoreOptions::kSlackBytes;
  for (const char* suffix : {"", "-wal"}) {
    struct stat file {};
    if (stat((beginning_->path() + suffix).c_str(), &file) == 0)
      left -= std::min(left, static_cast<uint64_t>(file.st_size));
  }
  return left;
}

void StoreWriter::note(LedgerNote note) {
  queue_.runSoon([this, note = std::move(note)] { notes_.push_back(note); });
}

void StoreWriter::giveBackMemory() {
  queue_.runSoon([this] {
    if (open_) sqlite3_db_release_memory(open_->database.get());
  });
}

void StoreWriter::erase(ErasureSelection which, std::string summaries, ErasureHandler done) {
  FlushHandler committed = [this, which = std::move(which), summaries = std::move(summaries),
                            done = std::move(done)](const std::optional<Error>& error) mutable {
    if (error) return;
    // In a turn of its own: this one is in the middle of a batch.
    queue_.runSoon([this, which = std::move(which), summaries = std::move(summaries),
                    done = std::move(done)] { done(eraseNow(which, summaries)); });
  };
  (void)queue_.appendFlush(committed);
}

Result<Erased> StoreWriter::eraseNow(const ErasureSelection& which, const std::string& summaries) {
  if (Status begun = begin(); !begun.ok()) return begun;
  const double now = std::chrono::duration<double>(clock_.now().time_since_epoch()).count();
  Result<Erased> erased = eraseFromStore(open_->database.get(), which, summaries, now, [this] {
    ++progress_;
    return checkpoint() == SQLITE_OK;
  });
  open_->retention.forgetUsers();
  rememberFiles();
  oldest_ = 0;
  measure();
  return erased;
}

void StoreWriter::measure() {
  if (!open_) return;
  fileBytes_ = open_->identity.fileBytes();
  logBytes_ = open_->identity.logBytes();
  if (oldest_.load() == 0) oldest_ = open_->retention.oldest().value_or(0);
}

void StoreWriter::yieldToOthers() {
  queue_.runSoon(
      [] { setpriority(PRIO_PROCESS, static_cast<id_t>(syscall(SYS_gettid)), kWriterNiceness); });
}

void StoreWriter::threadMain() {
  runJobs();
  report(std::move(found_));
  (void)begin();  // tried again when there is something to write
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

Status StoreWriter::begin() {
  if (open_) return {};
  if (queue_.gaveUp()) return Status::failure("the store was not begun in time");
  std::vector<LedgerNote> notes;
  if (lost_ != StoreLoss::None) {
    if (Status settled = beginning_->settle(lost_, notes); !settled.ok()) return settled;
    lost_ = StoreLoss::None;
  }
  if (unchecked_.database == nullptr) unchecked_ = beginning_->open(notes);
  if (unchecked_.status.ok()) {
    // It may take long: the writer lets others go first meanwhile, and a stop need not wait.
    unchecked_ = beginning_->check(std::move(unchecked_), notes, [this] {
      ++progress_;
      runJobs();
      return !queue_.gaveUp();
    });
  }
  report(std::move(notes));
  if (unchecked_.database == nullptr) return unchecked_.status;
  if (unchecked_.epoch != epoch_) {
    Status adopted = adoptEpoch(unchecked_.database.get(), epoch_);
    if (!adopted.ok()) return adopted;
  }
  StoreOptions options = options_;
  options.maxBytes -= std::min(beginning_->journalBytes(), options.maxBytes / 2);
  maxBytes_ = options.maxBytes;
  open_.emplace(std::move(unchecked_.database), *beginning_, options, endWord_, clock_);
  add(open_->retention.apply());
  // The pages that the check has read are of no use to whoever appends.
  sqlite3_db_release_memory(open_->database.get());
  rememberFiles();
  measure();
  return {};
}

void StoreWriter::rememberFiles() {
  using Shrunk = StoreIdentity::Shrunk;
  if (open_) open_->identity.remember(open_->retention.takeShrunk() ? Shrunk::Yes : Shrunk::No);
}

bool StoreWriter::keepOpen(StoreLoss loss) {
  if (loss == StoreLoss::None) return true;
  if (loss == StoreLoss::LogGone && checkpoint() != SQLITE_OK) return true;
  open_.reset();
  lost_ = loss;
  return false;
}

void StoreWriter::report(std::vector<LedgerNote> found) {
  for (const LedgerNote& note : found)
    VX_LOG(nullptr, Error, "the store: %s: %s", note.event.c_str(), note.detail.c_str());
  add(std::move(found));
}

void StoreWriter::writeBatch(StoreBatch& batch) {
  pairing_.join(batch.records);
  pairing_.pair(batch.records);
  if (!batch.urgent && !replayFrom_) {
    const double now = std::chrono::duration<double>(clock_.now().time_since_epoch()).count();
    pairing_.hold(batch.records, now - kHoldSeconds, clock_.monotonic());
  }
  batchSince_ = batch.since;
  batchBytes_ = batch.bytes;
  batchRecords_ = batch.records.size();
  std::size_t first = 0;
  // A batch without records may still have flushes.
  do {
    const std::size_t last = std::min(batch.records.size(), first + options_.commit.rows);
    const Result<RowWriter::Written> written = write(batch, first, last);
    if (written.ok()) {
      onCommitted(batch, first, written->last);
      first = written->last;
    } else if (!waitBeforeRetry(written.status())) {
      onLost(batch, first, written.status());
      break;
    }
  } while (first < batch.records.size() || !batch.flushes.empty());
  batch.clear();
  batchRecords_ = 0;
  batchBytes_ = 0;
  if (open_) {
    std::vector<LedgerNote> removed = open_->retention.onBatchWritten();
    if (!removed.empty()) oldest_ = 0;  // another one
    add(std::move(removed));
  }
  rememberFiles();
  measure();
}

Result<RowWriter::Written> StoreWriter::write(const StoreBatch& batch, std::size_t first,
                                              std::size_t last) {
  if (open_) keepOpen(open_->identity.look());
  if (Status begun = begin(); !begun.ok()) return begun;
  if (replayFrom_ && !open_->rows.knowsRows()) {
    if (Status read = open_->rows.loadKnownRows(*replayFrom_); !read.ok()) return read;
  }
  if (Status held = boundLog(); !held.ok()) return held;
  const std::size_t allowance =
      std::min<std::size_t>(kTransactionBytes, static_cast<std::size_t>(options_.maxBytes / 16));
  makeRoomFor(allowance);
  rememberFiles();
  Result<RowWriter::Written> written =
      open_->rows.write(batch.records, first, last, notes_, allowance);
  if (written.ok() && written->last == first && written->wanted > 0) {  // a large one, by itself
    makeRoomFor(written->wanted);
    written = open_->rows.write(batch.records, first, first + 1, notes_, written->wanted);
  }
  if (!written.ok()) return written;
  // What was committed to a file that nobody can find is to be written again.
  if (!keepOpen(open_->identity.lookForOthers()) && lost_ != StoreLoss::LogGone)
    return Status::failure(textOf(lost_));
  rememberFiles();
  notes_.clear();
  ++commits_;
  rowsCommitted_ += written->rows;
  writeFailures_ += written->failedBuilders;
  if (written->leftOut > 0) {
    MutexLock lock(ledgerMutex_);
    ledgerRows_["left_out"] += written->leftOut;
  }
  if (open_) open_->retention.noteWritten(written->bytes);
  return written;
}

int StoreWriter::checkpoint() {
  return sqlite3_wal_checkpoint_v2(open_->database.get(), nullptr, SQLITE_CHECKPOINT_TRUNCATE,
                                   nullptr, nullptr);
}

Status StoreWriter::boundLog() {
  struct stat log {};
  if (stat((beginning_->path() + "-wal").c_str(), &log) != 0 || log.st_size < kLogBytes) {
    logHeld_ = false;
    return {};
  }
  const int code = checkpoint();
  if (code == SQLITE_OK) {
    logHeld_ = false;
    return {};
  }
  if ((code & 0xFF) != SQLITE_BUSY) return Status::failure(sqlite3_errmsg(open_->database.get()));
  const std::string who = readersOf(beginning_->path());
  const std::string why = "a reader keeps a transaction open and the log may not grow further: " +
                          (who.empty() ? "nobody that can be seen" : who);
  if (!logHeld_) notes_.push_back({"log_held", "", 0, why});
  logHeld_ = true;
  return Status::failure(why);
}

// A transaction of so many bytes may grow the file and its log by that and a little more.
void StoreWriter::makeRoomFor(std::size_t bytes) {
  const uint64_t growth = bytes + bytes / 4;
  add(open_->retention.makeRoom(growth));
  if (bytes <= kTransactionBytes) return;
  checkpoint();
  const uint64_t both = 2 * growth;
  if (both <= StoreOptions::kSlackBytes) return;
  const uint64_t beyond = both - StoreOptions::kSlackBytes;
  add(open_->retention.makeRoom(beyond));
  open_->retention.shrinkFile(maxBytes_ - std::min(beyond, maxBytes_));
}

void StoreWriter::onCommitted(StoreBatch& batch, std::size_t first, std::size_t last) {
  if (failing_) {
    failing_ = false;
    failingNow_ = false;
    backoff_ = {};
    VX_LOG(nullptr, Error, "the store can be written again; nothing was lost");
  }
  unrecordedDone_ += EventPairing::markWritten(batch.records, first, last);
  for (std::size_t i = first; replayFrom_ && i < last; ++i) {
    if (!std::holds_alternative<ReplayEndRecord>(batch.records[i].what)) continue;
    replayFrom_.reset();
    open_->rows.keepKnownRowsOfDelayed();
  }
  const std::size_t left = batch.records.size() - first;
  queue_.release(batch, last - first, left);
  const auto unanswered =
      std::find_if(batch.flushes.begin(), batch.flushes.end(),
                   [last](const StoreFlush& flush) { return flush.records > last; });
  for (auto flush = batch.flushes.begin(); flush != unanswered; ++flush) {
    const bool whole = flush->session == nullptr || !flush->session->hasLost;
    flush->handler(whole ? std::nullopt : lossError_);
  }
  batch.flushes.erase(batch.flushes.begin(), unanswered);
}

void StoreWriter::onLost(StoreBatch& batch, std::size_t first, const Status& why) {
  const EventPairing::Unwritten unwritten = EventPairing::unwrittenRows(batch.records, first);
  rowsLeft_ += unwritten.recorded;
  rowsLost_ += unwritten.lost;
  unrecordedDone_ += unwritten.lost;
  EventPairing::abandon(batch.records, first);
  lossError_ = why.error();
  for (std::size_t i = first; i < batch.records.size(); ++i) {
    if (auto* message = std::get_if<RelayMessageRecord>(&batch.records[i].what))
      message->row->hasLost = true;
    else if (auto* opening = std::get_if<RelayOpenRecord>(&batch.records[i].what))
      opening->row->hasLost = true;
  }
  VX_LOG(nullptr, Error,
         "the store could not be written before the end (%s): %llu rows wait in the journal, %llu "
         "are lost",
         why.text().c_str(), static_cast<unsigned long long>(unwritten.recorded),
         static_cast<unsigned long long>(unwritten.lost));
  queue_.release(batch, 1, 1);
  for (const StoreFlush& flush : batch.flushes) flush.handler(why.error());
}

bool StoreWriter::waitBeforeRetry(const Status& failure) {
  ++writeFailures_;
  if (!failing_) {
    failing_ = true;
    failingNow_ = true;
    VX_LOG(nullptr, Error, "cannot write %s: %s; what was accepted is kept and tried again",
           beginning_->path().c_str(), failure.text().c_str());
  }
  backoff_ = std::clamp(backoff_ * 2, kFirstBackoff, kLastBackoff);
  return queue_.waitBeforeRetry(clock_.monotonic() + backoff_);
}

void StoreWriter::add(std::vector<LedgerNote> notes) {
  {
    MutexLock lock(ledgerMutex_);
    for (const LedgerNote& note : notes)
      ledgerRows_[note.event] += static_cast<uint64_t>(std::max<int64_t>(note.rows, 1));
  }
  std::move(notes.begin(), notes.end(), std::back_inserter(notes_));
}

}  // namespace vx::lnx
