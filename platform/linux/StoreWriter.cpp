#include "platform/linux/StoreWriter.h"

#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <bit>
#include <exception>

#include "platform/JsonWriter.h"
#include "platform/Log.h"
#include "platform/linux/Threads.h"

namespace vx::lnx {

namespace {

constexpr std::chrono::milliseconds kFirstBackoff{200};
constexpr std::chrono::milliseconds kLastBackoff{5000};
constexpr std::size_t kCommitsPerRetentionCheck = 64;
constexpr std::chrono::minutes kAgeCheckInterval{10};
constexpr int64_t kRowsPerRemoval = 500;
constexpr int kRemovalsPerCheck = 64;
constexpr std::size_t kKeptRecords = 1024;    // capacity that an idle queue keeps
constexpr std::size_t kKeptText = 256 << 10;  // a session's summary may be megabytes
// Of one payload, below what SQLite can hold. One that is larger could never be written, and
// nothing behind it either.
constexpr uint64_t kMostText = 512u << 20;
constexpr int kWriterNiceness = 15;

constexpr double kHoldSeconds = 0.05;  // how far the relay may be behind analytics
constexpr std::size_t kKnownNames = 4096;

bool isUnwrittenRow(const StoreRecord& record) {
  return !std::holds_alternative<FlushRecord>(record.what) &&
         record.sharing != StoreRecord::Sharing::Written;
}

std::size_t slotOf(const void* identity, std::size_t slots) {
  const auto bits = static_cast<uint64_t>(reinterpret_cast<uintptr_t>(identity));
  return static_cast<std::size_t>((bits >> 4) * 0x9E3779B97F4A7C15u >> 32) & (slots - 1);
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

void StoreWriter::pairEventsWithMessages() {
  std::size_t messages = 0;
  for (std::size_t i = 0; i < batch_.size(); ++i)
    messages += std::holds_alternative<RelayMessageRecord>(batch_[i].what) ? 1 : 0;
  if (messages == 0 || messages == batch_.size()) return;
  const std::size_t slots = std::bit_ceil(2 * messages);
  messageSlots_.assign(slots, StoreRecord::kNone);
  auto find = [&](const void* identity) -> uint32_t& {
    std::size_t at = slotOf(identity, slots);
    while (messageSlots_[at] != StoreRecord::kNone &&
           std::get<RelayMessageRecord>(batch_[messageSlots_[at]].what).payload.identity() !=
               identity)
      at = (at + 1) & (slots - 1);
    return messageSlots_[at];
  };
  for (std::size_t i = 0; i < batch_.size(); ++i) {
    const auto* message = std::get_if<RelayMessageRecord>(&batch_[i].what);
    if (message == nullptr || message->payload.identity() == nullptr) continue;
    uint32_t& slot = find(message->payload.identity());
    if (slot == StoreRecord::kNone) slot = static_cast<uint32_t>(i);
  }
  // Backwards, so that the events behind one message keep their order.
  for (std::size_t i = batch_.size(); i-- > 0;) {
    const auto* event = std::get_if<AnalyticsRecord>(&batch_[i].what);
    if (event == nullptr || event->message.identity() == nullptr) continue;
    const uint32_t slot = find(event->message.identity());
    if (slot == StoreRecord::kNone) continue;
    batch_[i].sharing = StoreRecord::Sharing::Shares;
    batch_[i].nextSharer = std::exchange(batch_[slot].nextSharer, static_cast<uint32_t>(i));
  }
}

void StoreWriter::holdUnpairedEvents() {
  const double young = now() - kHoldSeconds;
  for (std::size_t i = 0; i < batch_.size(); ++i) {
    StoreRecord& record = batch_[i];
    const auto* event = std::get_if<AnalyticsRecord>(&record.what);
    if (event == nullptr || event->message.identity() == nullptr ||
        record.sharing != StoreRecord::Sharing::No || record.time < young)
      continue;
    record.sharing = StoreRecord::Sharing::Held;  // once
    // Nothing, for nobody, stays in its place.
    heldEvents_.push_back(std::exchange(record, StoreRecord{record.time, FlushRecord{}}));
  }
  if (!heldEvents_.empty()) heldSince_ = clock_.monotonic();
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

const std::string& StoreWriter::storable(const char* table) {
  if (json_.size() <= mostText_) return json_;
  const std::string bytes = std::to_string(json_.size());
  VX_LOG(nullptr, Error,
         "a payload of %s bytes is left out of %s; a row may hold %zu, a quarter of max_bytes",
         bytes.c_str(), table, mostText_);
  note({"left_out", table, 1, "a payload of " + bytes + " bytes"});
  json_ = "{\"left_out_bytes\":" + bytes + "}";
  return json_;
}

int StoreWriter::writeRelayMessage(const StoreRecord& record, const RelayMessageRecord& message) {
  json_.clear();
  appendJson(json_, message.payload);
  int code = statements_.relayMessage.bind(record.time)
                 .bind(message.row->id)
                 .bind(int64_t{message.category})
                 .bind(int64_t{message.type})
                 .bind(storable("relay_messages"))
                 .run();
  if (record.nextSharer == StoreRecord::kNone) return code;
  const int64_t row = sqlite3_last_insert_rowid(database_.get());
  for (uint32_t i = record.nextSharer; code == SQLITE_OK && i != StoreRecord::kNone;
       i = batch_[i].nextSharer) {
    code = writeEvent(batch_[i].time, std::get<AnalyticsRecord>(batch_[i].what), row,
                      &message.payload);
    ++rowsInTransaction_;
  }
  return code;
}

int StoreWriter::writeEvent(double time, const AnalyticsRecord& event, int64_t messageRow,
                            const Payload* message) {
  json_.clear();
  bool shares = false;
  try {
    const Payload built = event.builder();
    shares = message != nullptr && appendJsonTail(json_, built, *message);
    if (!shares) appendJson(json_, built);
  } catch (const std::exception& failure) {
    VX_LOG(nullptr, Error, "the builder of event %s failed: %s", std::string(event.name).c_str(),
           failure.what());
    ++writeFailures_;
    return SQLITE_OK;
  }
  int64_t name = 0;
  if (const int code = nameRow(event.name, name); code != SQLITE_OK) return code;
  statements_.analytics.bind(time).bind(name);
  if (shares)
    statements_.analytics.bind(messageRow);
  else
    statements_.analytics.bindNull();
  return statements_.analytics.bind(storable("analytics_events")).run();
}

int StoreWriter::nameRow(std::string_view name, int64_t& row) {
  if (const auto known = nameRows_.find(name); known != nameRows_.end()) {
    row = known->second;
    return SQLITE_OK;
  }
  if (const int code = statements_.addName.bind(name).run(); code != SQLITE_OK) return code;
  Statement& find = statements_.findName.bind(name);
  const bool found = find.row();
  row = found ? find.integer(0) : 0;
  find.reset();
  if (!found) return SQLITE_INTERNAL;
  if (nameRows_.size() >= kKnownNames) nameRows_.clear();
  nameRows_.emplace(name, row);
  return SQLITE_OK;
}

int StoreWriter::writeRecord(const StoreRecord& record) {
  if (const auto* message = std::get_if<RelayMessageRecord>(&record.what)) {
    ++rowsInTransaction_;
    return writeRelayMessage(record, *message);
  }
  if (const auto* event = std::get_if<AnalyticsRecord>(&record.what)) {
    if (record.sharing == StoreRecord::Sharing::Shares ||
        record.sharing == StoreRecord::Sharing::Written)
      return SQLITE_OK;  // has its place behind a message
    ++rowsInTransaction_;
    return writeEvent(record.time, *event, 0, nullptr);
  }
  if (std::holds_alternative<FlushRecord>(record.what)) return SQLITE_OK;  // answered afterwards
  ++rowsInTransaction_;
  if (const auto* session = std::get_if<RelayOpenRecord>(&record.what))
    return writeRelaySession(record.time, *session);
  if (const auto* power = std::get_if<PowerRecord>(&record.what)) {
    json_.clear();
    appendJson(json_, power->record);
    return statements_.power.bind(record.time)
        .bind(power->clientIdentifier)
        .bind(power->name)
        .bind(storable("power_records"))
        .run();
  }
  return SQLITE_INTERNAL;  // there is no other kind
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
  const int code = insert.bind(storable("relay_sessions")).run();
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

// ---------------------------------------------------------------------------------------------------------------------
// Retention

// The identifier of the last of the kRowsPerRemoval oldest rows, or of the last there is.
int64_t StoreWriter::lastOfOldest(const std::string& table) {
  Statement query(database_.get(), "SELECT max(id) FROM (SELECT id FROM " + table +
                                       " ORDER BY id LIMIT " + std::to_string(kRowsPerRemoval) +
                                       ")");
  return query.row() ? query.integer(0) : 0;
}

// Removes rows up to an identifier, those before a time if one is given; how many.
int64_t StoreWriter::removeUpTo(const std::string& table, int64_t last,
                                std::optional<double> before) {
  Statement remove(database_.get(), "DELETE FROM " + table + " WHERE id <= ? AND time < ?");
  if (remove.bind(last).bind(before.value_or(1e18)).run() != SQLITE_OK) return 0;
  return sqlite3_changes64(database_.get());
}

// Removes messages, and with them the events that share their text. These lie at the beginning of
// their table: both tables name messages in the same order.
StoreWriter::Removed StoreWriter::removeMessagesUpTo(int64_t last, std::optional<double> before) {
  Removed removed;
  if (execute(database_.get(), "BEGIN IMMEDIATE") != SQLITE_OK) return removed;
  removed.rows = removeUpTo("relay_messages", last, before);
  Statement events(database_.get(),
                   "DELETE FROM analytics_entries AS e WHERE e.message <= ?1"
                   " AND e.id < ifnull((SELECT id FROM analytics_entries WHERE message > ?1"
                   " ORDER BY id LIMIT 1), 9e18)"
                   " AND NOT EXISTS (SELECT 1 FROM relay_messages m WHERE m.id = e.message)");
  int code = events.bind(last).run();
  if (code == SQLITE_OK) removed.sharers = sqlite3_changes64(database_.get());
  if (code == SQLITE_OK) code = execute(database_.get(), "COMMIT");
  if (code == SQLITE_OK) return removed;
  execute(database_.get(), "ROLLBACK");
  return {};
}

void StoreWriter::applyRetention() {
  commitsSinceRetention_ = 0;
  if (database_ == nullptr) return;
  struct Table {
    const char* name;
    const char* shownAs;
  };
  static constexpr Table kTables[] = {{"relay_messages", "relay_messages"},
                                      {"analytics_entries", "analytics_events"},
                                      {"power_records", "power_records"},
                                      {"relay_sessions", "relay_sessions"}};
  constexpr std::size_t kMessages = 0;
  constexpr std::size_t kEvents = 1;
  constexpr std::size_t kSessions = 3;
  auto oldest = [this](std::size_t table) -> std::optional<double> {
    Statement query(database_.get(), std::string("SELECT time FROM ") + kTables[table].name +
                                         " ORDER BY id LIMIT 1");
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
  using Counts = std::array<int64_t, std::size(kTables)>;
  auto removeFrom = [this](std::size_t table, std::optional<double> before, Counts& removed) {
    const int64_t last = lastOfOldest(kTables[table].name);
    const Removed now = table == kMessages
                            ? removeMessagesUpTo(last, before)
                            : Removed{removeUpTo(kTables[table].name, last, before), 0};
    removed[table] += now.rows;
    removed[kEvents] += now.sharers;
    return now.rows > 0;
  };
  auto tell = [this](const char* event, const Counts& removed, const std::string& why) {
    for (std::size_t i = 0; i < removed.size(); ++i) {
      if (removed[i] > 0) note({event, kTables[i].shownAs, removed[i], why});
    }
  };

  int removals = kRemovalsPerCheck;
  if (options_.maxAgeDays != 0 &&
      (lastAgeCheck_ == Monotonic{} || clock_.monotonic() - lastAgeCheck_ >= kAgeCheckInterval)) {
    lastAgeCheck_ = clock_.monotonic();
    const double before = now() - options_.maxAgeDays * 86400.0;
    Counts removed{};
    for (std::size_t table = 0; table < std::size(kTables); ++table) {
      while (removals > 0 && oldest(table).value_or(before) < before) {
        if (!removeFrom(table, before, removed)) break;
        --removals;
      }
    }
    tell("removed_for_age", removed, "older than " + std::to_string(options_.maxAgeDays) + " days");
  }

  Counts removed{};
  while (removals-- > 0 && usedBytes() > options_.maxBytes) {
    std::size_t oldestTable = 0;
    std::optional<double> oldestTime;
    for (std::size_t i = 0; i < kSessions; ++i) {  // sessions go with their messages
      const std::optional<double> time = oldest(i);
      if (time && (!oldestTime || *time < *oldestTime)) {
        oldestTime = time;
        oldestTable = i;
      }
    }
    if (!oldestTime || !removeFrom(oldestTable, std::nullopt, removed)) break;
  }
  if (removed[kMessages] > 0) {
    // Sessions whose every message is gone, and that came before the oldest message left.
    Statement orphans(
        database_.get(),
        "DELETE FROM relay_sessions WHERE id < (SELECT min(relay_session) FROM relay_messages)");
    if (orphans.run() == SQLITE_OK) removed[kSessions] = sqlite3_changes64(database_.get());
  }
  tell("removed_for_size", removed, "above " + std::to_string(options_.maxBytes) + " bytes");
}

}  // namespace vx::lnx
