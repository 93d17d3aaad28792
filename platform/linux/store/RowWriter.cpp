#include "platform/linux/store/RowWriter.h"

#include <exception>
#include <optional>
#include <utility>

#include "platform/Log.h"
#include "propertylist/JsonWriter.h"

namespace vx::lnx {

namespace {

constexpr std::size_t kKnownNames = 4096;
constexpr std::size_t kKeptText = 256 << 10;  // a session's summary may be megabytes

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

// A client gives its session's identifier with 64 bits, a standalone message with 32.
int64_t sessionIDOf(const VyrSessionInfo& info) {
  constexpr std::string_view kKey = kVyrReportingSessionInfoSessionID;
  if (const auto wide = infoValue<int64_t>(info, kKey)) return *wide;
  return infoValue<int32_t>(info, kKey).value_or(0);
}

std::string textUnder(const Payload& payload, std::string_view key) {
  const std::optional<Value> value = payload.find(key);
  return value ? value->text() : "";
}

}  // namespace

RowWriter::RowWriter(sqlite3* database, std::size_t mostText, Clock& clock)
    : database_(database),
      mostText_(mostText),
      clock_(clock),
      insertRelaySession_(database, kRelaySessions),
      insertRelayMessage_(database, kRelayMessages),
      insertEvent_(database, kAnalyticsEntries),
      insertPower_(database, kPowerRecords),
      insertLedger_(database, kStoreLedger),
      addName_(database, "INSERT OR IGNORE INTO event_names(name) VALUES(?)"),
      findName_(database, "SELECT id FROM event_names WHERE name = ?") {}

Result<RowWriter::Written> RowWriter::write(const StoreRecords& batch, std::size_t first,
                                            std::size_t last,
                                            const std::vector<LedgerNote>& notes) {
  thread_.assertHere();
  written_ = {};
  leftOut_.clear();
  const int code = writeTransaction(batch, first, last, notes);
  if (json_.capacity() > kKeptText) std::string().swap(json_);
  if (code == SQLITE_OK) return written_;
  Status failure = Status::failure(sqlite3_errmsg(database_));
  nameRows_.clear();  // the names that were added are not there
  if (sqlite3_get_autocommit(database_) == 0) execute(database_, "ROLLBACK");
  return failure;
}

int RowWriter::writeTransaction(const StoreRecords& batch, std::size_t first, std::size_t last,
                                const std::vector<LedgerNote>& notes) {
  int code = execute(database_, "BEGIN IMMEDIATE");
  for (std::size_t i = first; code == SQLITE_OK && i < last; ++i)
    code = writeRecord(batch, batch[i]);
  for (const std::vector<LedgerNote>* some : {&notes, &std::as_const(leftOut_)}) {
    for (std::size_t i = 0; code == SQLITE_OK && i < some->size(); ++i)
      code = writeLedger((*some)[i]);
  }
  return code == SQLITE_OK ? execute(database_, "COMMIT") : code;
}

int RowWriter::writeRecord(const StoreRecords& batch, const StoreRecord& record) {
  if (const auto* message = std::get_if<RelayMessageRecord>(&record.what))
    return writeRelayMessage(batch, record, *message);
  if (const auto* event = std::get_if<AnalyticsRecord>(&record.what)) {
    if (record.sharing == StoreRecord::Sharing::Shares ||
        record.sharing == StoreRecord::Sharing::Written)
      return SQLITE_OK;  // has its place after a message
    return writeEvent(record.time, *event, 0, nullptr);
  }
  if (const auto* session = std::get_if<RelayOpenRecord>(&record.what))
    return writeRelaySession(record.time, *session);
  if (const auto* power = std::get_if<PowerRecord>(&record.what))
    return writePower(record.time, *power);
  return SQLITE_OK;  // a place without a row
}

int RowWriter::writeRelaySession(double time, const RelayOpenRecord& record) {
  const auto& [info, userInfo] = *record.information;
  json_.clear();
  appendJson(json_, userInfo);
  const std::string clientName = textUnder(userInfo, kVyrReportingUserInfoClientName);
  const std::string serviceName = textUnder(userInfo, kVyrReportingUserInfoServiceName);
  ++written_.rows;
  const int code = insertRelaySession_.run(
      {.time = time,
       .sessionID = sessionIDOf(info),
       .clientType = infoValue<int32_t>(info, kVyrReportingSessionInfoClientType),
       .clientVersion = infoValue<float>(info, kVyrReportingSessionInfoClientVersion),
       .clientName = clientName,
       .serviceName = serviceName,
       .batchEvent = flag(info, kVyrReportingSessionInfoBatchEvent),
       .containsRealtimeEvents = flag(info, kVyrReportingSessionInfoContainsRealtimeEvents),
       .userInfo = storable("relay_sessions")});
  if (code == SQLITE_OK) record.row->id = sqlite3_last_insert_rowid(database_);
  return code;
}

int RowWriter::writeRelayMessage(const StoreRecords& batch, const StoreRecord& record,
                                 const RelayMessageRecord& message) {
  json_.clear();
  appendJson(json_, message.payload);
  ++written_.rows;
  int code = insertRelayMessage_.run({.time = record.time,
                                      .relaySession = message.row->id,
                                      .category = message.category,
                                      .type = message.type,
                                      .payload = storable("relay_messages")});
  const int64_t row = sqlite3_last_insert_rowid(database_);
  for (uint32_t i = record.nextSharer; code == SQLITE_OK && i != StoreRecord::kNone;
       i = batch[i].nextSharer) {
    code =
        writeEvent(batch[i].time, std::get<AnalyticsRecord>(batch[i].what), row, &message.payload);
  }
  return code;
}

int RowWriter::writePower(double time, const PowerRecord& record) {
  json_.clear();
  appendJson(json_, record.record);
  ++written_.rows;
  return insertPower_.run({.time = time,
                           .clientIdentifier = record.clientIdentifier,
                           .name = record.name,
                           .record = storable("power_records")});
}

int RowWriter::writeEvent(double time, const AnalyticsRecord& event, int64_t messageRow,
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
    ++written_.failedBuilders;
    return SQLITE_OK;
  }
  ++written_.rows;
  int64_t name = 0;
  if (const int code = nameRow(event.name, name); code != SQLITE_OK) return code;
  return insertEvent_.run({.time = time,
                           .name = name,
                           .message = shares ? std::optional<int64_t>(messageRow) : std::nullopt,
                           .payload = storable("analytics_events")});
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

const std::string& RowWriter::storable(const char* table) {
  if (json_.size() <= mostText_) return json_;
  const std::string bytes = std::to_string(json_.size());
  VX_LOG(nullptr, Error,
         "a payload of %s bytes is left out of %s; a row may hold %zu, a quarter of max_bytes",
         bytes.c_str(), table, mostText_);
  leftOut_.push_back({"left_out", table, 1, "a payload of " + bytes + " bytes"});
  json_ = "{\"left_out_bytes\":" + bytes + "}";
  return json_;
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
