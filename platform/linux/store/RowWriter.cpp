#include "platform/linux/store/RowWriter.h"

#include <algorithm>
#include <cmath>
#include <exception>
#include <new>
#include <optional>
#include <tuple>
#include <utility>

#include "platform/Log.h"
#include "propertylist/JsonWriter.h"

namespace vx::lnx {

namespace {

constexpr std::size_t kKnownNames = 4096;
constexpr std::size_t kKeptText = 256 << 10;  // a session's summary may be megabytes
constexpr int kDoesNotFit = -1;               // beside SQLite's codes
constexpr int64_t kRowsPerMark = 4096;
constexpr int64_t kKeptMarks = 1024;

template <class T>
std::optional<T> infoValue(const VyrSessionInfo& info, std::string_view key) {
  for (const auto& [name, value] : info) {
    if (name != key) continue;
    const T* found = std::get_if<T>(&value);
    return found != nullptr ? std::optional<T>(*found) : std::nullopt;
  }
  return std::nullopt;
}

std::optional<int64_t> flag(const VyrSessionInfo& info, std::string_view key) {
  const std::optional<bool> value = infoValue<bool>(info, key);
  return value ? std::optional<int64_t>(*value ? 1 : 0) : std::nullopt;
}

int64_t sessionIDOf(const VyrSessionInfo& info) {
  constexpr std::string_view kKey = kVyrReportingSessionInfoSessionID;
  if (const auto wide = infoValue<int64_t>(info, kKey)) return *wide;
  return infoValue<int32_t>(info, kKey).value_or(0);
}

// A client gives its session's identifier with 64 bits, a standalone message with 32.
bool isStandalone(const RelayRow& session) {
  return session.information != nullptr &&
         infoValue<int32_t>(session.information->first, kVyrReportingSessionInfoSessionID)
             .has_value();
}

std::string textUnder(const Payload& payload, std::string_view key) {
  const std::optional<Value> value = payload.find(key);
  return value ? value->text() : "";
}

}  // namespace

RowWriter::RowWriter(sqlite3* database, std::size_t mostText, EndWord endWord, Clock& clock,
                     uint32_t store)
    : database_(database),
      mostText_(mostText),
      clock_(clock),
      store_(store),
      insertRelaySession_(database, kRelaySessions),
      insertRelayMessage_(database, kRelayMessages),
      insertEvent_(database, kAnalyticsEntries),
      insertPower_(database, kPowerRecords),
      insertLedger_(database, kStoreLedger),
      addName_(database, "INSERT OR IGNORE INTO event_names(name) VALUES(?)"),
      findName_(database, "SELECT id FROM event_names WHERE name = ?"),
      endSession_(database,
                  "UPDATE relay_sessions SET ended_at = ?, ended_how = ? WHERE id = ?"
                  " AND ended_at IS NULL"),
      removeSession_(database, "DELETE FROM relay_sessions WHERE id = ?"),
      addMark_(database, "INSERT INTO store_marks(call, last_row) VALUES(?, ?)"),
      removeMarks_(database,
                   "DELETE FROM store_marks WHERE id <= (SELECT max(id) FROM store_marks) - ?"),
      endWord_(endWord) {}

Status RowWriter::loadKnownRows(const ReplayedCalls& calls) {
  thread_.assertHere();
  Result<KnownRows> known = KnownRows::load(database_, calls);
  if (!known.ok()) return known.status();
  known_ = std::move(*known);
  return {};
}

void RowWriter::keepKnownRowsOfDelayed() {
  thread_.assertHere();
  if (!known_) return;
  known_->keepUnasked();
  if (known_->isEmpty()) known_.reset();
}

Result<RowWriter::Written> RowWriter::write(const StoreRecords& batch, std::size_t first,
                                            std::size_t last, const std::vector<LedgerNote>& notes,
                                            std::size_t allowance) {
  thread_.assertHere();
  written_ = {};
  leftOut_.clear();
  begun_.clear();
  allowance_ = allowance;
  const auto markedBefore = std::pair(lastMarkedRow_, lastMarkedCall_);
  int code = SQLITE_NOMEM;
  try {
    code = writeTransaction(batch, first, last, notes);
  } catch (const std::bad_alloc&) {
    // As where SQLite has none: tried again later.
  }
  for (std::string* text : {&json_, &eventJson_}) {
    if (text->capacity() > kKeptText) std::string().swap(*text);
  }
  written_.leftOut = leftOut_.size();
  if (code == SQLITE_OK) return written_;
  std::tie(lastMarkedRow_, lastMarkedCall_) = markedBefore;
  for (RelayRow* session : begun_) session->id = 0;
  Status failure =
      Status::failure(code == SQLITE_NOMEM ? sqlite3_errstr(code) : sqlite3_errmsg(database_));
  nameRows_.clear();  // the names that were added are not there
  if (sqlite3_get_autocommit(database_) == 0) execute(database_, "ROLLBACK");
  return failure;
}

int RowWriter::writeTransaction(const StoreRecords& batch, std::size_t first, std::size_t last,
                                const std::vector<LedgerNote>& notes) {
  int code = execute(database_, "BEGIN IMMEDIATE");
  if (code == SQLITE_OK) code = prepare();
  written_.last = first;
  while (code == SQLITE_OK && written_.last < last) {
    code = writeRecord(batch, batch[written_.last]);
    if (code == SQLITE_OK) ++written_.last;
  }
  if (code == kDoesNotFit && written_.last == first) {
    for (RelayRow* session : begun_) session->id = 0;
    return execute(database_, "ROLLBACK");
  }
  if (code == kDoesNotFit) code = SQLITE_OK;
  for (const std::vector<LedgerNote>* some : {&notes, &std::as_const(leftOut_)}) {
    for (std::size_t i = 0; code == SQLITE_OK && i < some->size(); ++i)
      code = writeLedger((*some)[i]);
  }
  if (code == SQLITE_OK) code = writeMark();
  return code == SQLITE_OK ? execute(database_, "COMMIT") : code;
}

bool RowWriter::take(std::size_t bytes, uint32_t user) {
  if (bytes > allowance_) {
    written_.wanted = taken_ + bytes;
    return false;
  }
  allowance_ -= bytes;
  taken_ += bytes;
  addTo(written_.bytes, user, static_cast<int64_t>(bytes));
  return true;
}

int RowWriter::prepare() {
  if (prepared_) return SQLITE_OK;
  Statement last(database_,
                 "SELECT max(ifnull((SELECT max(id) FROM relay_messages), 0),"
                 " ifnull((SELECT max(id) FROM analytics_entries), 0),"
                 " ifnull((SELECT max(last_row) FROM store_marks), 0),"
                 " ifnull((SELECT max(after_row) FROM store_epochs), 0)),"
                 " ifnull((SELECT max(last_row) FROM store_marks), 0),"
                 " ifnull((SELECT max(call) FROM store_marks), 0)");
  if (!last.row()) return sqlite3_extended_errcode(database_);
  nextRow_ = last.integer(0) + 1;
  lastMarkedRow_ = last.integer(1);
  highestCall_ = lastMarkedCall_ = static_cast<uint64_t>(last.integer(2));
  for (const char* table : {"relay_messages", "analytics_entries"}) {
    Statement highest(database_, std::string("SELECT ifnull(max(call), 0) FROM ") + table +
                                     " WHERE id > " + std::to_string(lastMarkedRow_));
    if (!highest.row()) return sqlite3_extended_errcode(database_);
    highestCall_ = std::max(highestCall_, static_cast<uint64_t>(highest.integer(0)));
  }
  prepared_ = true;
  return SQLITE_OK;
}

int RowWriter::writeMark() {
  const bool fewCalls = highestCall_ - lastMarkedCall_ < KnownRows::kCallsPerMark;
  if (fewCalls && nextRow_ - 1 - lastMarkedRow_ < kRowsPerMark) return SQLITE_OK;
  lastMarkedRow_ = nextRow_ - 1;
  lastMarkedCall_ = highestCall_;
  const int code = addMark_.bind(static_cast<int64_t>(highestCall_)).bind(lastMarkedRow_).run();
  return code == SQLITE_OK ? removeMarks_.bind(kKeptMarks).run() : code;
}

KeyColumns RowWriter::columnsOf(const RowKey& key, uint32_t user) {
  if (key.call == 0) return {};
  highestCall_ = std::max(highestCall_, key.call);
  return {static_cast<int64_t>(key.call), int64_t{key.place},
          user != kNoUser ? std::optional<int64_t>(user) : std::nullopt};
}

int RowWriter::writeRecord(const StoreRecords& batch, const StoreRecord& record) {
  taken_ = 0;
  if (const auto* message = std::get_if<RelayMessageRecord>(&record.what))
    return writeRelayMessage(batch, record, *message);
  if (std::holds_alternative<AnalyticsRecord>(record.what)) {
    const bool shares = record.sharing == StoreRecord::Sharing::Shares ||
                        record.sharing == StoreRecord::Sharing::Written;
    return shares ? SQLITE_OK : writeEvent(record);
  }
  if (const auto* opening = std::get_if<RelayOpenRecord>(&record.what)) {
    noteFirst(record, *opening->row);
    // A standalone's row is written with its message, or not at all.
    return isStandalone(*opening->row) ? SQLITE_OK : writeRelaySession(*opening->row);
  }
  if (const auto* end = std::get_if<RelayEndRecord>(&record.what))
    return writeRelayEnd(record, *end);
  if (const auto* power = std::get_if<PowerRecord>(&record.what)) return writePower(record, *power);
  return SQLITE_OK;  // a place without a row
}

void RowWriter::noteFirst(const StoreRecord& record, RelayRow& session) {
  session.time = record.time;
  session.key = record.cause.key();
  session.user = record.user();
}

int RowWriter::writeRelaySession(RelayRow& session) {
  if (session.id != 0 && session.store == store_) return SQLITE_OK;
  const bool ofAnotherStore = session.id != 0;
  session.id = 0;
  session.store = store_;
  if (ofAnotherStore) {  // its row may have been taken over
    const auto row = KnownRows::sessionOf(database_, session.key);
    session.id = row.value_or(0);
    if (row) return SQLITE_OK;
  }
  if (known_) {
    if (const auto row = known_->find(session.key)) {
      session.id = *row;
      session.hasItsMessage = known_->isEarlier(session.key) && isStandalone(session);
      return SQLITE_OK;
    }
  }
  if (session.information == nullptr) return SQLITE_OK;
  const auto& [info, userInfo] = *session.information;
  json_.clear();
  appendJson(json_, userInfo);
  const std::string clientName = textUnder(userInfo, kVyrReportingUserInfoClientName);
  const std::string serviceName = textUnder(userInfo, kVyrReportingUserInfoServiceName);
  const std::string_view text = storable(json_, "relay_sessions");
  if (!take(text.size(), session.user)) return kDoesNotFit;
  ++written_.rows;
  const int code = insertRelaySession_.run(
      {.time = session.time,
       .sessionID = sessionIDOf(info),
       .clientType = infoValue<int32_t>(info, kVyrReportingSessionInfoClientType),
       .clientVersion = infoValue<float>(info, kVyrReportingSessionInfoClientVersion),
       .clientName = clientName,
       .serviceName = serviceName,
       .batchEvent = flag(info, kVyrReportingSessionInfoBatchEvent),
       .containsRealtimeEvents = flag(info, kVyrReportingSessionInfoContainsRealtimeEvents),
       .userInfo = text,
       .key = columnsOf(session.key, session.user)});
  if (code != SQLITE_OK) return code;
  session.id = sqlite3_last_insert_rowid(database_);
  begun_.push_back(&session);
  return code;
}

int RowWriter::writeRelayEnd(const StoreRecord& record, const RelayEndRecord& end) {
  if (const int code = writeRelaySession(*end.row); code != SQLITE_OK) return code;
  const std::string_view how = endWord_ != nullptr && record.cause.ticket
                                   ? endWord_(record.cause.ticket)
                                   : std::string_view();
  return endSession_.bind(record.time)
      .bind(how.empty() ? std::nullopt : std::optional<std::string_view>(how))
      .bind(end.row->id)
      .run();
}

int RowWriter::writeRelayMessage(const StoreRecords& batch, const StoreRecord& record,
                                 const RelayMessageRecord& message) {
  const std::size_t begunBefore = begun_.size();
  const int code = writeMessageRow(batch, record, message);
  if (code != kDoesNotFit || begun_.size() == begunBefore) return code;
  RelayRow* const session = begun_.back();
  begun_.pop_back();
  --written_.rows;
  const int removed = removeSession_.bind(std::exchange(session->id, 0)).run();
  return removed == SQLITE_OK ? code : removed;
}

int RowWriter::writeMessageRow(const StoreRecords& batch, const StoreRecord& record,
                               const RelayMessageRecord& message) {
  const StoreRecord* event = record.event == StoreRecord::kNone ? nullptr : &batch[record.event];
  const bool known = isKnown(record);
  if (!known) {
    if (const int code = writeRelaySession(*message.row); code != SQLITE_OK) return code;
  }
  if (known || message.row->hasItsMessage) return event != nullptr ? writeEvent(*event) : SQLITE_OK;
  json_.clear();
  appendJson(json_, message.payload);
  const std::string_view payload = storable(json_, "relay_messages");
  const AnalyticsRecord* built = nullptr;
  EventText text = EventText::None;
  if (event != nullptr && !isKnown(*event)) {
    built = &std::get<AnalyticsRecord>(event->what);
    text = buildEvent(*built, &message.payload);
  }
  if (!take(payload.size() + (built != nullptr ? storedBytes(eventJson_) : 0), record.user()))
    return kDoesNotFit;
  ++written_.rows;
  RelayMessageRow row = {.id = nextRow_++,
                         .time = record.time,
                         .relaySession = message.row->id,
                         .category = message.category,
                         .type = message.type,
                         .payload = payload,
                         .key = keyOf(record),
                         .eventName = {},
                         .eventPlace = {},
                         .eventMicroseconds = {},
                         .eventTail = {}};
  const bool shares = text == EventText::Tail && eventJson_.size() <= mostText_;
  if (shares) {
    int64_t name = 0;
    if (const int code = nameRow(built->name, name); code != SQLITE_OK) return code;
    ++written_.rows;
    row.eventName = name;
    row.eventPlace = keyOf(*event).place;
    row.eventMicroseconds = std::llround((event->time - record.time) * 1e6);
    row.eventTail = eventJson_;
  }
  const int code = insertRelayMessage_.run(row);
  if (code != SQLITE_OK || shares || text == EventText::None) return code;
  return writeEventRow(*event, built->name, message.row->id);
}

int RowWriter::writePower(const StoreRecord& record, const PowerRecord& power) {
  if (isKnown(record)) return SQLITE_OK;
  json_.clear();
  appendJson(json_, power.record);
  const std::string_view text = storable(json_, "power_records");
  if (!take(text.size(), record.user())) return kDoesNotFit;
  ++written_.rows;
  return insertPower_.run({.time = record.time,
                           .clientIdentifier = power.clientIdentifier,
                           .name = power.name,
                           .record = text,
                           .key = keyOf(record)});
}

int RowWriter::writeEvent(const StoreRecord& record) {
  const auto& event = std::get<AnalyticsRecord>(record.what);
  if (isKnown(record) || buildEvent(event, nullptr) == EventText::None) return SQLITE_OK;
  if (!take(storedBytes(eventJson_), record.user())) return kDoesNotFit;
  return writeEventRow(record, event.name);
}

RowWriter::EventText RowWriter::buildEvent(const AnalyticsRecord& event, const Payload* message) {
  eventJson_.clear();
  try {
    const Payload built = event.builder();
    if (message != nullptr && appendJsonTail(eventJson_, built, *message)) return EventText::Tail;
    appendJson(eventJson_, built);
    return EventText::Whole;
  } catch (const std::exception& failure) {
    VX_LOG(nullptr, Error, "the builder of event %s failed: %s", std::string(event.name).c_str(),
           failure.what());
    ++written_.failedBuilders;
    return EventText::None;
  }
}

int RowWriter::writeEventRow(const StoreRecord& record, std::string_view eventName,
                             std::optional<int64_t> relaySession) {
  int64_t name = 0;
  if (const int code = nameRow(eventName, name); code != SQLITE_OK) return code;
  ++written_.rows;
  return insertEvent_.run({.id = nextRow_++,
                           .time = record.time,
                           .name = name,
                           .payload = storable(eventJson_, "analytics_events"),
                           .key = keyOf(record),
                           .relaySession = relaySession});
}

int RowWriter::writeLedger(const LedgerNote& note) {
  const double now = std::chrono::duration<double>(clock_.now().time_since_epoch()).count();
  return insertLedger_.run(
      {.time = now,
       .event = note.event,
       .table = note.table.empty() ? std::nullopt : std::optional<std::string_view>(note.table),
       .rows = note.rows,
       .detail = note.detail});
}

const std::string& RowWriter::storable(std::string& json, const char* table) {
  if (json.size() <= mostText_) return json;
  const std::string bytes = std::to_string(json.size());
  VX_LOG(nullptr, Error,
         "a payload of %s bytes is left out of %s; a row may hold %zu, a quarter of max_bytes",
         bytes.c_str(), table, mostText_);
  leftOut_.push_back({"left_out", table, 1, "a payload of " + bytes + " bytes"});
  json = "{\"left_out_bytes\":" + bytes + "}";
  return json;
}

int RowWriter::nameRow(std::string_view name, int64_t& row) {
  if (const auto known = nameRows_.find(name); known != nameRows_.end()) {
    row = known->second;
    return SQLITE_OK;
  }
  if (const int code = addName_.bind(name).run(); code != SQLITE_OK) return code;
  findName_.bind(name);
  const bool found = findName_.row();
  row = found ? findName_.integer(0) : 0;
  findName_.reset();
  if (!found) return SQLITE_INTERNAL;
  if (nameRows_.size() >= kKnownNames) nameRows_.clear();
  nameRows_.emplace(name, row);
  return SQLITE_OK;
}

}  // namespace vx::lnx
