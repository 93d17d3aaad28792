// From records to rows.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "base/Clock.h"
#include "base/Status.h"
#include "base/ThreadChecker.h"
#include "platform/linux/store/Database.h"
#include "platform/linux/store/StoreRecord.h"
#include "platform/linux/store/StoreTables.h"

namespace vx::lnx {

// Owned by the store's writer and confined to its thread. Refers to a database that outlives it.
// Keeps at most kKnownNames event names; one row's text at a time, which `mostText` bounds.
class RowWriter {
 public:
  struct Written {
    uint64_t rows = 0;            // the ledger's not counted
    uint64_t failedBuilders = 0;  // events that are left out, because their builder failed
  };

  // `mostText`: of one payload, in bytes; a larger one is left out and the ledger says so.
  RowWriter(sqlite3* database, std::size_t mostText, Clock& clock);
  RowWriter(const RowWriter&) = delete;
  RowWriter& operator=(const RowWriter&) = delete;

  // Writes records [first, last) of a batch, the events that have their place after them, and the
  // notes, in one transaction. On a failure none of them is there.
  Result<Written> write(const StoreRecords& batch, std::size_t first, std::size_t last,
                        const std::vector<LedgerNote>& notes);

 private:
  int writeTransaction(const StoreRecords& batch, std::size_t first, std::size_t last,
                       const std::vector<LedgerNote>& notes);
  int writeRecord(const StoreRecords& batch, const StoreRecord& record);
  int writeRelaySession(double time, const RelayOpenRecord& record);
  int writeRelayMessage(const StoreRecords& batch, const StoreRecord& record,
                        const RelayMessageRecord& message);
  int writePower(double time, const PowerRecord& record);
  // After `message` in row `messageRow`, whose text it shares; or by itself, when there is none.
  int writeEvent(double time, const AnalyticsRecord& event, int64_t messageRow,
                 const Payload* message);
  int writeLedger(const LedgerNote& note);
  // json_ as it may be stored in a table: a text larger than mostText_ is left out and noted.
  const std::string& storable(const char* table);
  // The identifier of an event name. SQLITE_OK or an error.
  int nameRow(std::string_view name, int64_t& row);

  sqlite3* const database_;
  const std::size_t mostText_;
  Clock& clock_;
  ThreadChecker thread_;
  Insertion<RelaySessionRow> insertRelaySession_;
  Insertion<RelayMessageRow> insertRelayMessage_;
  Insertion<EventRow> insertEvent_;
  Insertion<PowerRow> insertPower_;
  Insertion<LedgerRow> insertLedger_;
  Statement addName_;
  Statement findName_;
  std::unordered_map<std::string_view, int64_t> nameRows_;
  Written written_;                  // of the running transaction
  std::vector<LedgerNote> leftOut_;  // of the running transaction
  std::string json_;
};

}  // namespace vx::lnx
