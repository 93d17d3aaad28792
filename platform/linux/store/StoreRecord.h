// What is on its way to the database.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <variant>

#include "base/ChunkList.h"
#include "base/Function.h"
#include "platform/VyrReporting.h"
#include "platform/linux/execution/CauseScope.h"
#include "propertylist/Payload.h"

namespace vx::lnx {

// A relay session and its row. The information is there before the first record that names it; the
// rest belongs to the writer's thread.
struct RelayRow {
  std::unique_ptr<const std::pair<VyrSessionInfo, Payload>> information;  // of session and user
  double time = 0;                                                        // of its first record
  RowKey key;
  uint32_t user = kNoUser;
  int64_t id = 0;      // 0: not written
  uint32_t store = 0;  // in which store it has this id (see StoreBeginning)
  // Something that was sent to it was given up.
  bool hasLost = false;
  bool hasItsMessage = false;                  // it was written together with its only one
  std::atomic<uint64_t> messagesCommitted{0};  // read from any thread
};

struct RelayOpenRecord {
  std::shared_ptr<RelayRow> row;
};
struct RelayMessageRecord {
  std::shared_ptr<RelayRow> row;
  Payload payload;
  uint16_t category = 0;
  uint16_t type = 0;
};
// A relay session ends; makes no row of its own.
struct RelayEndRecord {
  std::shared_ptr<RelayRow> row;
};
// Whatever comes before was replayed; makes no row.
struct ReplayEndRecord {};
struct AnalyticsRecord {
  std::string_view name;  // of unlimited life
  Payload message;        // what the built dictionary is expected to begin with; may be empty
  Function<Payload()> builder;
};
struct PowerRecord {
  int64_t clientIdentifier = 0;
  std::string name;
  Payload record;
};

struct StoreRecord {
  // std::monostate: the place of a record that has gone elsewhere; no row.
  using What = std::variant<std::monostate, RelayOpenRecord, RelayMessageRecord, RelayEndRecord,
                            ReplayEndRecord, AnalyticsRecord, PowerRecord>;
  // An event whose message is in the same batch as a relay message is written with that one, and
  // shares its text.
  enum class Sharing : uint8_t { No, Held, Shares, Written };
  static constexpr uint32_t kNone = UINT32_MAX;

  // A place of another record, or something that happened.
  bool makesNoRow() const { return makesNoRow(what); }
  static bool makesNoRow(const What& what) {
    return std::holds_alternative<std::monostate>(what) ||
           std::holds_alternative<RelayEndRecord>(what) ||
           std::holds_alternative<ReplayEndRecord>(what);
  }
  StoreRecord(double when, What&& whatever, Cause because = {})
      : time(when), cause(std::move(because)), what(std::move(whatever)) {}
  uint32_t user() const { return cause.ticket.user(); }  // who caused it, or kNoUser
  double time;                                           // seconds since 1970
  // The call whose row it is; done when the row is committed.
  Cause cause;
  uint32_t event = kNone;         // of a relay message: the place of the event that shares its text
  Sharing sharing = Sharing::No;  // of an event
  What what;
};
static_assert(sizeof(StoreRecord) <= 144, "a record a message");

using StoreRecords = ChunkList<StoreRecord, 256>;

// A row of the ledger that is still to be written: what is not there (any more), and why.
struct LedgerNote {
  std::string event;
  std::string table;  // empty: none
  int64_t rows = 0;
  std::string detail;
};

}  // namespace vx::lnx
