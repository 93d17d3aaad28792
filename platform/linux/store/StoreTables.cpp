#include "platform/linux/store/StoreTables.h"

namespace vx::lnx {

namespace {

// clang-format off
constexpr Column<RelaySessionRow> kRelaySessionColumns[] = {
    {"time", "REAL NOT NULL", [](Statement& s, const RelaySessionRow& r) { s.bind(r.time); }},
    {"session_id", "INTEGER NOT NULL", [](Statement& s, const RelaySessionRow& r) { s.bind(r.sessionID); }},
    {"client_type", "INTEGER", [](Statement& s, const RelaySessionRow& r) { s.bind(r.clientType); }},
    {"client_version", "REAL", [](Statement& s, const RelaySessionRow& r) { s.bind(r.clientVersion); }},
    {"client_name", "TEXT", [](Statement& s, const RelaySessionRow& r) { s.bind(r.clientName); }},
    {"service_name", "TEXT", [](Statement& s, const RelaySessionRow& r) { s.bind(r.serviceName); }},
    {"batch_event", "INTEGER", [](Statement& s, const RelaySessionRow& r) { s.bind(r.batchEvent); }},
    {"contains_realtime_events", "INTEGER",
     [](Statement& s, const RelaySessionRow& r) { s.bind(r.containsRealtimeEvents); }},
    {"user_info", "TEXT NOT NULL", [](Statement& s, const RelaySessionRow& r) { s.bind(r.userInfo); }},
    {"call", "INTEGER", [](Statement& s, const RelaySessionRow& r) { s.bind(r.key.call); }},
    {"place", "INTEGER", [](Statement& s, const RelaySessionRow& r) { s.bind(r.key.place); }},
    {"uid", "INTEGER", [](Statement& s, const RelaySessionRow& r) { s.bind(r.key.user); }},
    // Known when it ends.
    {"ended_at", "REAL", [](Statement& s, const RelaySessionRow&) { s.bindNull(); }},
    {"ended_how", "TEXT", [](Statement& s, const RelaySessionRow&) { s.bindNull(); }},
};
constexpr Column<RelayMessageRow> kRelayMessageColumns[] = {
    {"id", "INTEGER PRIMARY KEY", [](Statement& s, const RelayMessageRow& r) { s.bind(r.id); }},
    {"time", "REAL NOT NULL", [](Statement& s, const RelayMessageRow& r) { s.bind(r.time); }},
    {"relay_session", "INTEGER NOT NULL", [](Statement& s, const RelayMessageRow& r) { s.bind(r.relaySession); }},
    {"category", "INTEGER NOT NULL", [](Statement& s, const RelayMessageRow& r) { s.bind(int64_t{r.category}); }},
    {"type", "INTEGER NOT NULL", [](Statement& s, const RelayMessageRow& r) { s.bind(int64_t{r.type}); }},
    {"payload", "TEXT NOT NULL", [](Statement& s, const RelayMessageRow& r) { s.bind(r.payload); }},
    {"call", "INTEGER", [](Statement& s, const RelayMessageRow& r) { s.bind(r.key.call); }},
    {"place", "INTEGER", [](Statement& s, const RelayMessageRow& r) { s.bind(r.key.place); }},
    {"uid", "INTEGER", [](Statement& s, const RelayMessageRow& r) { s.bind(r.key.user); }},
    {"event_name", "INTEGER", [](Statement& s, const RelayMessageRow& r) { s.bind(r.eventName); }},
    {"event_place", "INTEGER", [](Statement& s, const RelayMessageRow& r) { s.bind(r.eventPlace); }},
    {"event_microseconds", "INTEGER", [](Statement& s, const RelayMessageRow& r) { s.bind(r.eventMicroseconds); }},
    {"event_tail", "TEXT", [](Statement& s, const RelayMessageRow& r) { s.bind(r.eventTail); }},
};
constexpr Column<EventRow> kEventColumns[] = {
    {"id", "INTEGER PRIMARY KEY", [](Statement& s, const EventRow& r) { s.bind(r.id); }},
    {"time", "REAL NOT NULL", [](Statement& s, const EventRow& r) { s.bind(r.time); }},
    {"name", "INTEGER NOT NULL", [](Statement& s, const EventRow& r) { s.bind(r.name); }},
    // Of rows of the second schema only: the message whose text comes before `payload`.
    {"message", "INTEGER", [](Statement& s, const EventRow&) { s.bindNull(); }},
    {"payload", "TEXT NOT NULL", [](Statement& s, const EventRow& r) { s.bind(r.payload); }},
    {"call", "INTEGER", [](Statement& s, const EventRow& r) { s.bind(r.key.call); }},
    {"place", "INTEGER", [](Statement& s, const EventRow& r) { s.bind(r.key.place); }},
    {"uid", "INTEGER", [](Statement& s, const EventRow& r) { s.bind(r.key.user); }},
    {"relay_session", "INTEGER", [](Statement& s, const EventRow& r) { s.bind(r.relaySession); }},
};
constexpr Column<PowerRow> kPowerColumns[] = {
    {"time", "REAL NOT NULL", [](Statement& s, const PowerRow& r) { s.bind(r.time); }},
    {"client_identifier", "INTEGER NOT NULL", [](Statement& s, const PowerRow& r) { s.bind(r.clientIdentifier); }},
    {"name", "TEXT NOT NULL", [](Statement& s, const PowerRow& r) { s.bind(r.name); }},
    {"record", "TEXT NOT NULL", [](Statement& s, const PowerRow& r) { s.bind(r.record); }},
    {"call", "INTEGER", [](Statement& s, const PowerRow& r) { s.bind(r.key.call); }},
    {"place", "INTEGER", [](Statement& s, const PowerRow& r) { s.bind(r.key.place); }},
    {"uid", "INTEGER", [](Statement& s, const PowerRow& r) { s.bind(r.key.user); }},
};
constexpr Column<LedgerRow> kLedgerColumns[] = {
    {"time", "REAL NOT NULL", [](Statement& s, const LedgerRow& r) { s.bind(r.time); }},
    {"event", "TEXT NOT NULL", [](Statement& s, const LedgerRow& r) { s.bind(r.event); }},
    {"table_name", "TEXT", [](Statement& s, const LedgerRow& r) { s.bind(r.table); }},
    {"rows", "INTEGER", [](Statement& s, const LedgerRow& r) { s.bind(r.rows); }},
    {"detail", "TEXT", [](Statement& s, const LedgerRow& r) { s.bind(r.detail); }},
};
// clang-format on

}  // namespace

constinit const Table<RelaySessionRow> kRelaySessions{"relay_sessions", kRelaySessionColumns};
constinit const Table<RelayMessageRow> kRelayMessages{"relay_messages", kRelayMessageColumns};
constinit const Table<EventRow> kAnalyticsEntries{"analytics_entries", kEventColumns};
constinit const Table<PowerRow> kPowerRecords{"power_records", kPowerColumns};
constinit const Table<LedgerRow> kStoreLedger{"store_ledger", kLedgerColumns};

}  // namespace vx::lnx
