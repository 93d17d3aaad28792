// From records to rows.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "base/Clock.h"
#include "base/Status.h"
#include "base/ThreadChecker.h"
#include "platform/linux/store/Database.h"
#include "platform/linux/store/KnownRows.h"
#include "platform/linux/store/StoreRecord.h"
#include "platform/linux/store/StoreTables.h"
#include "platform/linux/store/UserBytes.h"

namespace vx::lnx {

// The word for how a session ended, of the call whose work ended it; empty: not known.
using EndWord = std::string_view (*)(const JournalTicket& call);

// Owned by the store's writer and confined to its thread. Refers to a database that outlives it.
// Keeps at most kKnownNames event names; one row's text at a time, which `mostText` bounds.
class RowWriter {
 public:
  struct Written {
    uint64_t rows = 0;            // the ledger's not counted
    uint64_t leftOut = 0;         // payloads that are too large for a row
    uint64_t failedBuilders = 0;  // events that are left out, because their builder failed
    std::size_t last = 0;         // records before this one are written
    std::size_t wanted = 0;       // bytes of the row at `last`, which did not fit
    UserBytes bytes;              // of text
  };

  // `mostText`: of one payload, in bytes; a larger one is left out and the ledger says so. `store`:
  // a relay session that has its row in another one gets one in this.
  RowWriter(sqlite3* database, std::size_t mostText, EndWord endWord, Clock& clock,
            uint32_t store = 1);
  RowWriter(const RowWriter&) = delete;
  RowWriter& operator=(const RowWriter&) = delete;

  // Rows that are there already will not be written again.
  Status loadKnownRows(const ReplayedCalls& calls);
  bool knowsRows() const { return known_.has_value(); }
  // The replay is over: what it has not come to may still come.
  void keepKnownRowsOfDelayed();

  // Writes records [first, last) of a batch, the events that share their text, and the notes, in
  // one transaction of at most `allowance` bytes of text; what goes beyond it is left for the next
  // one. Nothing is written when the first row does not fit. On a failure none of them is there.
  Result<Written> write(const StoreRecords& batch, std::size_t first, std::size_t last,
                        const std::vector<LedgerNote>& notes, std::size_t allowance = SIZE_MAX);

 private:
  // Takes so many bytes of the allowance, for a user's row; false, and the row is left for later,
  // if they are not there.
  bool take(std::size_t bytes, uint32_t user);
  int writeTransaction(const StoreRecords& batch, std::size_t first, std::size_t last,
                       const std::vector<LedgerNote>& notes);
  // What there is to know of the database before the first row is written.
  int prepare();
  int writeMark();
  int writeRecord(const StoreRecords& batch, const StoreRecord& record);
  // The row of a session, unless it has one.
  int writeRelaySession(RelayRow& session);
  static void noteFirst(const StoreRecord& record, RelayRow& session);
  int writeRelayEnd(const StoreRecord& record, const RelayEndRecord& end);
  // With the session's row, where that waited for its first message: both or none.
  int writeRelayMessage(const StoreRecords& batch, const StoreRecord& record,
                        const RelayMessageRecord& message);
  int writeMessageRow(const StoreRecords& batch, const StoreRecord& record,
                      const RelayMessageRecord& message);
  int writePower(const StoreRecord& record, const PowerRecord& power);
  int writeEvent(const StoreRecord& record);
  // The row of an event whose text is in eventJson_.
  int writeEventRow(const StoreRecord& record, std::string_view name,
                    std::optional<int64_t> relaySession = {});
  enum class EventText : uint8_t { None, Whole, Tail };
  // Builds the text of an event in eventJson_; of its tail only, when the rest of it is `message`.
  EventText buildEvent(const AnalyticsRecord& event, const Payload* message);
  int writeLedger(const LedgerNote& note);
  bool isKnown(const StoreRecord& record) {
    return known_ && known_->find(record.cause.key()).has_value();
  }
  KeyColumns columnsOf(const RowKey& key, uint32_t user);
  KeyColumns keyOf(const StoreRecord& record) {
    return columnsOf(record.cause.key(), record.user());
  }
  // One that is too large is left out.
  std::size_t storedBytes(const std::string& json) const {
    return json.size() <= mostText_ ? json.size() : 0;
  }
  // The text as it may be stored in a table: one larger than mostText_ is left out and noted.
  const std::string& storable(std::string& json, const char* table);
  // The identifier of an event name. SQLITE_OK or an error.
  int nameRow(std::string_view name, int64_t& row);

  sqlite3* const database_;
  const std::size_t mostText_;
  Clock& clock_;
  const uint32_t store_;
  ThreadChecker thread_;
  Insertion<RelaySessionRow> insertRelaySession_;
  Insertion<RelayMessageRow> insertRelayMessage_;
  Insertion<EventRow> insertEvent_;
  Insertion<PowerRow> insertPower_;
  Insertion<LedgerRow> insertLedger_;
  Statement addName_;
  Statement findName_;
  Statement endSession_;
  Statement removeSession_;
  Statement addMark_;
  Statement removeMarks_;
  const EndWord endWord_;
  std::unordered_map<std::string_view, int64_t> nameRows_;
  Written written_;                  // of the running transaction
  std::vector<LedgerNote> leftOut_;  // of the running transaction
  std::vector<RelayRow*> begun_;     // by the running transaction
  std::size_t allowance_ = 0;        // what is left of it
  std::size_t taken_ = 0;            // of it, by the record that is being written
  std::string json_;
  std::string eventJson_;
  std::optional<KnownRows> known_;
  bool prepared_ = false;
  int64_t nextRow_ = 1;       // of messages and events, which share their numbers
  uint64_t highestCall_ = 0;  // of every row so far
  int64_t lastMarkedRow_ = 0;
  uint64_t lastMarkedCall_ = 0;
};

}  // namespace vx::lnx
