#include "platform/linux/StoreWriter.h"

#include <pthread.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <exception>

#include "platform/JsonWriter.h"
#include "platform/Log.h"

namespace vx::lnx {

namespace {

constexpr std::chrono::milliseconds kFirstBackoff{200};
constexpr std::chrono::milliseconds kLastBackoff{5000};
constexpr std::size_t kCommitsPerRetentionCheck = 64;
constexpr std::chrono::minutes kAgeCheckInterval{10};
constexpr int64_t kRowsPerRemoval = 500;
constexpr int kRemovalsPerCheck = 64;
constexpr std::size_t kKeptRecords = 4096;  // capacity that an idle queue keeps
constexpr int kWriterNiceness = 15;

bool countsAsRow(const StoreRecord& record) {
  return !std::holds_alternative<FlushRecord>(record.what);
}

template <class T>
const T* infoValue(const VyrSessionInfo& info, std::string_view key) {
  for (const auto& [name, value] : info) {
    if (name == key) return std::get_if<T>(&value);
  }
  return nullptr;
}

std::string textUnder(const Payload& payload, std::string_view key) {
  const std::optional<Value> value = payload.find(key);
  return value ? value->text() : "";
}

}  // namespace

StoreWriter::StoreWriter(std::string path, Database database,
                         const PlatformConfiguration::Store& options, Clock& clock)
    : path_(std::move(path)), options_(options), clock_(clock), database_(std::move(database)) {}

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
  sigset_t all;
  sigset_t before;
  sigfillset(&all);
  pthread_sigmask(SIG_SETMASK, &all, &before);  // signals belong to the event loop
  thread_ = std::thread([this] { threadMain(); });
  pthread_sigmask(SIG_SETMASK, &before, nullptr);
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
    if (pending_.empty()) {
      if (closing_) return false;
      if (pending_.capacity() > kKeptRecords) std::vector<StoreRecord>().swap(pending_);
      if (batch_.capacity() > kKeptRecords) std::vector<StoreRecord>().swap(batch_);
      sleep_ = Sleep::UntilWork;
      wake_.wait(mutex_);
      sleep_ = Sleep::Awake;
      continue;
    }
    const Monotonic due = firstPending_ + options_.commitInterval;
    if (closing_ || urgent_ || pending_.size() >= kRowsPerCommit ||
        pendingBytes_ >= kBytesPerCommit || clock_.monotonic() >= due) {
      break;
    }
    sleep_ = Sleep::UntilCommit;
    wake_.waitUntil(mutex_, std::chrono::time_point_cast<std::chrono::steady_clock::duration>(due));
    sleep_ = Sleep::Awake;
  }
  batch_.clear();
  if (batch_.capacity() > kKeptRecords && pending_.size() < kRowsPerCommit) {
    std::vector<StoreRecord>().swap(batch_);
  }
  batch_.swap(pending_);
  batchBytes_ = pendingBytes_;
  pendingBytes_ = 0;
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
  pthread_setname_np(pthread_self(), "vx-store");
  setpriority(PRIO_PROCESS, static_cast<id_t>(syscall(SYS_gettid)), kWriterNiceness);
  runJobs();
  checkDatabase();
  prepareStatements();
  applyRetention();
  while (waitForBatch()) {
    runJobs();
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
  statements_.analytics =
      Statement(database, "INSERT INTO analytics_events(time, name, payload) VALUES(?,?,?)");
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
      const auto lost = static_cast<uint64_t>(std::count_if(
          batch_.begin() + static_cast<std::ptrdiff_t>(first), batch_.end(), countsAsRow));
      rowsLost_ += lost;
      VX_LOG(nullptr, Error,
             "the store could not be written before the end: %llu rows are lost (%s)",
             static_cast<unsigned long long>(lost), sqlite3_errstr(code));
      break;
    }
  }
  batch_.clear();
  if (++commitsSinceRetention_ >= kCommitsPerRetentionCheck) applyRetention();
}

int StoreWriter::writeTransaction(std::size_t first, std::size_t last) {
  if (database_ == nullptr) return SQLITE_CANTOPEN;
  int code = execute(database_.get(), "BEGIN IMMEDIATE");
  for (std::size_t i = first; code == SQLITE_OK && i < last; ++i) code = writeRecord(batch_[i]);
  for (std::size_t i = 0; code == SQLITE_OK && i < notes_.size(); ++i)
    code = writeLedger(notes_[i]);
  if (code == SQLITE_OK) code = execute(database_.get(), "COMMIT");
  if (code != SQLITE_OK && sqlite3_get_autocommit(database_.get()) == 0)
    execute(database_.get(), "ROLLBACK");
  return code;
}

int StoreWriter::writeRecord(const StoreRecord& record) {
  if (const auto* message = std::get_if<RelayMessageRecord>(&record.what)) {
    json_.clear();
    appendJson(json_, message->payload);
    return statements_.relayMessage.bind(record.time)
        .bind(message->row->id)
        .bind(int64_t{message->category})
        .bind(int64_t{message->type})
        .bind(json_)
        .run();
  }
  if (const auto* event = std::get_if<AnalyticsRecord>(&record.what)) {
    json_.clear();
    try {
      appendJson(json_, event->builder());
    } catch (const std::exception& failure) {
      VX_LOG(nullptr, Error, "the builder of event %s failed: %s", event->name.c_str(),
             failure.what());
      ++writeFailures_;
      return SQLITE_OK;
    }
    return statements_.analytics.bind(record.time).bind(event->name).bind(json_).run();
  }
  if (const auto* session = std::get_if<RelayOpenRecord>(&record.what))
    return writeRelaySession(record.time, *session);
  if (const auto* power = std::get_if<PowerRecord>(&record.what)) {
    json_.clear();
    appendJson(json_, power->record);
    return statements_.power.bind(record.time)
        .bind(power->clientIdentifier)
        .bind(power->name)
        .bind(json_)
        .run();
  }
  return SQLITE_OK;  // a flush is answered after the commit
}

int StoreWriter::writeRelaySession(double time, const RelayOpenRecord& record) {
  const auto& [info, userInfo] = *record.information;
  json_.clear();
  appendJson(json_, userInfo);
  const std::string clientName = textUnder(userInfo, kVyrReportingUserInfoClientName);
  const std::string serviceName = textUnder(userInfo, kVyrReportingUserInfoServiceName);
  Statement& insert = statements_.relaySession;
  insert.bind(time);
  if (const auto* wide = infoValue<int64_t>(info, kVyrReportingSessionInfoSessionID)) {
    insert.bind(*wide);
  } else {
    const auto* narrow = infoValue<int32_t>(info, kVyrReportingSessionInfoSessionID);
    insert.bind(int64_t{narrow != nullptr ? *narrow : 0});
  }
  if (const auto* type = infoValue<int32_t>(info, kVyrReportingSessionInfoClientType))
    insert.bind(int64_t{*type});
  else
    insert.bindNull();
  if (const auto* version = infoValue<float>(info, kVyrReportingSessionInfoClientVersion))
    insert.bind(double{*version});
  else
    insert.bindNull();
  insert.bind(clientName).bind(serviceName);
  for (const std::string_view key :
       {kVyrReportingSessionInfoBatchEvent, kVyrReportingSessionInfoContainsRealtimeEvents}) {
    if (const auto* flag = infoValue<bool>(info, key))
      insert.bind(int64_t{*flag});
    else
      insert.bindNull();
  }
  const int code = insert.bind(json_).run();
  if (code == SQLITE_OK) record.row->id = sqlite3_last_insert_rowid(database_.get());
  return code;
}

int StoreWriter::writeLedger(const LedgerNote& entry) {
  statements_.ledger.bind(now()).bind(entry.event);
  if (entry.table.empty())
    statements_.ledger.bindNull();
  else
    statements_.ledger.bind(entry.table);
  return statements_.ledger.bind(entry.rows).bind(entry.detail).run();
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
  uint64_t rows = 0;
  for (std::size_t i = first; i < last; ++i) {
    if (auto* flush = std::get_if<FlushRecord>(&batch_[i].what))
      completions.push_back(std::move(flush->completion));
    else
      ++rows;
    if (auto* message = std::get_if<RelayMessageRecord>(&batch_[i].what))
      message->payload = Payload();
  }
  rowsCommitted_ += rows;
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

// ---------------------------------------------------------------------------------------------------------------------
// Retention

// Removes up to kRowsPerRemoval of the oldest rows, those before a time if one is given; how many.
int64_t StoreWriter::removeOldest(const char* table, std::optional<double> before) {
  const std::string name = table;
  Statement remove(database_.get(), "DELETE FROM " + name + " WHERE id IN (SELECT id FROM " + name +
                                        " ORDER BY id LIMIT ?) AND time < ?");
  remove.bind(kRowsPerRemoval).bind(before.value_or(1e18));
  if (remove.run() != SQLITE_OK) return 0;
  return sqlite3_changes64(database_.get());
}

void StoreWriter::applyRetention() {
  commitsSinceRetention_ = 0;
  if (database_ == nullptr) return;
  static constexpr const char* kTables[] = {"relay_messages", "analytics_events", "power_records",
                                            "relay_sessions"};
  auto oldest = [this](const char* table) -> std::optional<double> {
    Statement query(database_.get(),
                    std::string("SELECT time FROM ") + table + " ORDER BY id LIMIT 1");
    if (!query.row()) return std::nullopt;
    return query.real(0);
  };
  auto usedBytes = [this] {
    auto pragma = [this](const char* sql) {
      Statement query(database_.get(), sql);
      return query.row() ? query.integer(0) : 0;
    };
    return static_cast<uint64_t>((pragma("PRAGMA page_count") - pragma("PRAGMA freelist_count")) *
                                 pragma("PRAGMA page_size"));
  };

  int removals = kRemovalsPerCheck;
  if (options_.maxAgeDays != 0 &&
      (lastAgeCheck_ == Monotonic{} || clock_.monotonic() - lastAgeCheck_ >= kAgeCheckInterval)) {
    lastAgeCheck_ = clock_.monotonic();
    const double before = now() - options_.maxAgeDays * 86400.0;
    for (const char* table : kTables) {
      int64_t removed = 0;
      while (removals > 0 && oldest(table).value_or(before) < before) {
        const int64_t rows = removeOldest(table, before);
        if (rows == 0) break;
        removed += rows;
        --removals;
      }
      if (removed > 0) {
        note({"removed_for_age", table, removed,
              "older than " + std::to_string(options_.maxAgeDays) + " days"});
      }
    }
  }

  int64_t removed[std::size(kTables)] = {};
  while (removals-- > 0 && usedBytes() > options_.maxBytes) {
    std::size_t oldestTable = 0;
    std::optional<double> oldestTime;
    for (std::size_t i = 0; i < 3; ++i) {  // sessions go with their messages
      const std::optional<double> time = oldest(kTables[i]);
      if (time && (!oldestTime || *time < *oldestTime)) {
        oldestTime = time;
        oldestTable = i;
      }
    }
    if (!oldestTime) break;
    const int64_t rows = removeOldest(kTables[oldestTable], std::nullopt);
    if (rows == 0) break;
    removed[oldestTable] += rows;
  }
  if (removed[0] >
      0) {  // sessions whose every message is gone, and that came before the oldest message left
    Statement orphans(
        database_.get(),
        "DELETE FROM relay_sessions WHERE id < (SELECT min(relay_session) FROM relay_messages)");
    if (orphans.run() == SQLITE_OK) removed[3] = sqlite3_changes64(database_.get());
  }
  for (std::size_t i = 0; i < std::size(kTables); ++i) {
    if (removed[i] > 0) {
      note({"removed_for_size", kTables[i], removed[i],
            "above " + std::to_string(options_.maxBytes) + " bytes"});
    }
  }
}

}  // namespace vx::lnx
