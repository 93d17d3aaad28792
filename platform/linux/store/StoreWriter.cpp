#include "platform/linux/store/StoreWriter.h"

#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>

#include "platform/Log.h"
#include "platform/linux/execution/Threads.h"

namespace vx::lnx {

namespace {

constexpr std::chrono::milliseconds kFirstBackoff{200};
constexpr std::chrono::milliseconds kLastBackoff{5000};
constexpr std::size_t kCommitsPerRetentionCheck = 64;
constexpr std::size_t kKeptRecords = 1024;    // capacity that an idle queue keeps
constexpr std::size_t kKeptText = 256 << 10;  // a session's summary may be megabytes
// Of one payload, below what SQLite can hold. One that is larger could never be written, and
// nothing behind it either.
constexpr uint64_t kMostText = 512u << 20;
constexpr int kWriterNiceness = 15;

bool isUnwrittenRow(const StoreRecord& record) {
  return !std::holds_alternative<FlushRecord>(record.what) &&
         record.sharing != StoreRecord::Sharing::Written;
}

}  // namespace

StoreWriter::StoreWriter(std::string path, Database database, const StoreOptions& options,
                         Clock& clock)
    : path_(std::move(path)),
      options_(options),
      mostText_(static_cast<std::size_t>(std::min<uint64_t>(options.maxBytes / 4, kMostText))),
      clock_(clock),
      database_(std::move(database)) {}

StoreWriter::~StoreWriter() {
  if (thread_.joinable()) {
    close(clock_.monotonic());
    thread_.join();
  }
}

void StoreWriter::noteAtStart(std::string event, std::string detail) {
  note({std::move(event), "", 0, std::move(detail)});
}

void StoreWriter::start() {
  thread_ = startThread("vx-store", [this] { threadMain(); });
}

LocalStore::Counters StoreWriter::counters() const {
  return {.rowsCommitted = rowsCommitted_.load(),
          .commits = commits_.load(),
          .writeFailures = writeFailures_.load(),
          .rowsLost = rowsLost_.load()};
}

// ---------------------------------------------------------------------------------------------------------------------
// The queue

bool StoreWriter::append(StoreRecord record, std::size_t bytes) {
  const bool flush = std::holds_alternative<FlushRecord>(record.what);
  const std::size_t size = sizeof(StoreRecord) + bytes;
  bool notify = false;
  {
    MutexLock lock(mutex_);
    if (closing_) return false;
    if (pending_.empty()) firstPending_ = clock_.monotonic();
    pending_.push_back(std::move(record));
    pendingBytes_ += size;
    heldBytes_ += size;
    urgent_ = urgent_ || flush;
    if (heldBytes_ > options_.queueBytes) congested_.store(true, std::memory_order_relaxed);
    const bool full = pending_.size() >= kRowsPerCommit || pendingBytes_ >= kBytesPerCommit;
    notify = sleep_ == Sleep::UntilWork || (sleep_ == Sleep::UntilCommit && (urgent_ || full));
    if (notify) sleep_ = Sleep::Awake;  // told once
  }
  if (notify) wake_.notifyOne();
  return true;
}

void StoreWriter::runSoon(Function<void()> job) {
  {
    MutexLock lock(mutex_);
    jobs_.push_back(std::move(job));
  }
  wake_.notifyOne();
}

bool StoreWriter::close(Monotonic deadline) {
  MutexLock lock(mutex_);
  if (!closing_) {
    closing_ = true;
    closeDeadline_ = deadline;
    wake_.notifyOne();
  }
  // A little longer than the writer itself tries.
  const auto limit = std::chrono::time_point_cast<std::chrono::steady_clock::duration>(
      deadline + std::chrono::milliseconds(500));
  while (!finished_ && thread_.joinable()) {
    if (!ended_.waitUntil(mutex_, limit) && !finished_) return false;
  }
  return rowsLost_.load() == 0;
}

bool StoreWriter::waitForBatch() {
  MutexLock lock(mutex_);
  for (;;) {
    if (!jobs_.empty()) return true;
    if (pending_.empty() && heldEvents_.empty()) {
      if (closing_) return false;
      if (messageSlots_.capacity() > kKeptRecords) std::vector<uint32_t>().swap(messageSlots_);
      pending_.shrink(kKeptRecords);
      batch_.shrink(kKeptRecords);
      sleep_ = Sleep::UntilWork;
      wake_.wait(mutex_);
      sleep_ = Sleep::Awake;
      continue;
    }
    const Monotonic due =
        (heldEvents_.empty() ? firstPending_ : heldSince_) + options_.commitInterval;
    if (closing_ || urgent_ || pending_.size() >= kRowsPerCommit ||
        pendingBytes_ >= kBytesPerCommit || clock_.monotonic() >= due) {
      break;
    }
    sleep_ = Sleep::UntilCommit;
    wake_.waitUntil(mutex_, std::chrono::time_point_cast<std::chrono::steady_clock::duration>(due));
    sleep_ = Sleep::Awake;
  }
  batch_.clear();
  batch_.swap(pending_);
  batchBytes_ = pendingBytes_;
  pendingBytes_ = 0;
  mayHold_ = !urgent_ && !closing_;
  urgent_ = false;
  return true;
}

void StoreWriter::runJobs() {
  std::vector<Function<void()>> jobs;
  {
    MutexLock lock(mutex_);
    jobs.swap(jobs_);
  }
  for (const Function<void()>& job : jobs) job();
}

// ---------------------------------------------------------------------------------------------------------------------
// The thread

void StoreWriter::threadMain() {
  setpriority(PRIO_PROCESS, static_cast<id_t>(syscall(SYS_gettid)), kWriterNiceness);
  runJobs();
  checkDatabase();
  prepareStatements();
  applyRetention();
  while (waitForBatch()) {
    runJobs();
    for (StoreRecord& event : heldEvents_) batch_.push_back(std::move(event));
    heldEvents_.clear();
    pairEventsWithMessages();
    if (mayHold_) holdUnpairedEvents();
    writeBatch();
  }
  statements_ = {};
  database_.reset();
  MutexLock lock(mutex_);
  finished_ = true;
  ended_.notifyAll();
}

void StoreWriter::checkDatabase() {
  std::string found;
  if (quickCheck(database_.get(), found)) return;
  database_.reset();
  std::string problem;
  const std::string aside = moveAside(path_, problem);
  if (openStoreDatabase(path_, database_, problem) != OpenOutcome::Ready) {
    VX_LOG(nullptr, Error, "the store failed its check (%s) and cannot be begun afresh: %s",
           found.c_str(), problem.c_str());
    return;
  }
  VX_LOG(nullptr, Error,
         "the store failed its check (%s); it was moved to %s and a fresh one begun", found.c_str(),
         aside.c_str());
  note({"moved_aside", "", 0, "failed its check (" + found + "); now " + aside});
}

void StoreWriter::prepareStatements() {
  sqlite3* database = database_.get();
  statements_.relaySession =
      Statement(database,
                "INSERT INTO relay_sessions(time, session_id, client_type, client_version, "
                "client_name, service_name,"
                " batch_event, contains_realtime_events, user_info) VALUES(?,?,?,?,?,?,?,?,?)");
  statements_.relayMessage = Statement(
      database,
      "INSERT INTO relay_messages(time, relay_session, category, type, payload) VALUES(?,?,?,?,?)");
  statements_.analytics = Statement(
      database, "INSERT INTO analytics_entries(time, name, message, payload) VALUES(?,?,?,?)");
  statements_.addName = Statement(database, "INSERT OR IGNORE INTO event_names(name) VALUES(?)");
  statements_.findName = Statement(database, "SELECT id FROM event_names WHERE name = ?");
  nameRows_.clear();
  statements_.power = Statement(
      database, "INSERT INTO power_records(time, client_identifier, name, record) VALUES(?,?,?,?)");
  statements_.ledger = Statement(
      database,
      "INSERT INTO store_ledger(time, event, table_name, rows, detail) VALUES(?,?,?,?,?)");
}

void StoreWriter::writeBatch() {
  std::size_t first = 0;
  while (first < batch_.size()) {
    const std::size_t last = std::min(batch_.size(), first + kRowsPerCommit);
    const int code = writeTransaction(first, last);
    if (code == SQLITE_OK) {
      committed(first, last);
      first = last;
      runJobs();
      continue;
    }
    if (!waitBeforeRetry(code)) {
      uint64_t lost = 0;
      for (std::size_t i = first; i < batch_.size(); ++i) lost += isUnwrittenRow(batch_[i]) ? 1 : 0;
      rowsLost_ += lost;
      VX_LOG(nullptr, Error,
             "the store could not be written before the end: %llu rows are lost (%s)",
             static_cast<unsigned long long>(lost), sqlite3_errstr(code));
      break;
    }
  }
  batch_.clear();
  if (json_.capacity() > kKeptText) std::string().swap(json_);
  if (++commitsSinceRetention_ >= kCommitsPerRetentionCheck) applyRetention();
}

int StoreWriter::writeTransaction(std::size_t first, std::size_t last) {
  if (database_ == nullptr) return SQLITE_CANTOPEN;
  rowsInTransaction_ = 0;
  const std::size_t notesBefore = notes_.size();
  int code = execute(database_.get(), "BEGIN IMMEDIATE");
  for (std::size_t i = first; code == SQLITE_OK && i < last; ++i) code = writeRecord(batch_[i]);
  for (std::size_t i = 0; code == SQLITE_OK && i < notes_.size(); ++i)
    code = writeLedger(notes_[i]);
  if (code == SQLITE_OK) code = execute(database_.get(), "COMMIT");
  if (code != SQLITE_OK) {
    nameRows_.clear();  // the names that were added are not there
    notes_.resize(std::min(notes_.size(), notesBefore));
    if (sqlite3_get_autocommit(database_.get()) == 0) execute(database_.get(), "ROLLBACK");
  }
  return code;
}

void StoreWriter::committed(std::size_t first, std::size_t last) {
  if (failing_) {
    failing_ = false;
    backoff_ = {};
    VX_LOG(nullptr, Error, "the store can be written again; nothing was lost");
  }
  notes_.clear();
  ++commits_;
  std::vector<Function<void(std::optional<Error>)>> completions;
  for (std::size_t i = first; i < last; ++i) {
    if (auto* flush = std::get_if<FlushRecord>(&batch_[i].what))
      completions.push_back(std::move(flush->completion));
    auto* message = std::get_if<RelayMessageRecord>(&batch_[i].what);
    if (message == nullptr) continue;
    message->payload = Payload();
    for (uint32_t k = batch_[i].nextSharer; k != StoreRecord::kNone; k = batch_[k].nextSharer)
      batch_[k].sharing = StoreRecord::Sharing::Written;
  }
  rowsCommitted_ += rowsInTransaction_;
  bool drained = false;
  {
    MutexLock lock(mutex_);
    const std::size_t share = last == batch_.size()
                                  ? batchBytes_
                                  : batchBytes_ * (last - first) / (batch_.size() - first);
    batchBytes_ -= share;
    heldBytes_ -= share;
    if (congested_.load(std::memory_order_relaxed) && heldBytes_ <= options_.queueBytes / 2) {
      congested_.store(false, std::memory_order_relaxed);
      drained = true;
    }
  }
  if (drained && drained_) drained_();
  for (const auto& completion : completions) {
    if (completion) completion(std::nullopt);
  }
}

bool StoreWriter::waitBeforeRetry(int code) {
  ++writeFailures_;
  if (!failing_) {
    failing_ = true;
    VX_LOG(nullptr, Error, "cannot write %s: %s; what was accepted is kept and tried again",
           path_.c_str(),
           database_ != nullptr ? sqlite3_errmsg(database_.get()) : sqlite3_errstr(code));
  }
  if (database_ == nullptr) {
    std::string problem;
    if (openStoreDatabase(path_, database_, problem) == OpenOutcome::Ready)
      prepareStatements();
    else
      database_.reset();
  }
  backoff_ = std::clamp(backoff_ * 2, kFirstBackoff, kLastBackoff);
  const Monotonic until = clock_.monotonic() + backoff_;
  for (;;) {
    runJobs();
    MutexLock lock(mutex_);
    const Monotonic time = clock_.monotonic();
    if (closing_) {
      if (time >= closeDeadline_) return false;
      backoff_ = kFirstBackoff / 4;
      wake_.waitUntil(mutex_, std::chrono::time_point_cast<std::chrono::steady_clock::duration>(
                                  std::min(closeDeadline_, time + kFirstBackoff / 4)));
      return true;
    }
    if (time >= until) return true;
    if (jobs_.empty()) {
      wake_.waitUntil(mutex_,
                      std::chrono::time_point_cast<std::chrono::steady_clock::duration>(until));
    }
  }
}

}  // namespace vx::lnx
