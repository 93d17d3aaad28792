// From records to rows. The writer's thread.
#include <algorithm>
#include <bit>
#include <exception>
#include <utility>

#include "platform/Log.h"
#include "platform/linux/store/StoreWriter.h"
#include "propertylist/JsonWriter.h"

namespace vx::lnx {

namespace {

constexpr double kHoldSeconds = 0.05;  // how far the relay may be behind analytics
constexpr std::size_t kKnownNames = 4096;

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

}  // namespace vx::lnx
