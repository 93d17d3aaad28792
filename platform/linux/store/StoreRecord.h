// What is on its way to the database.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <variant>

#include "base/ChunkList.h"
#include "base/Function.h"
#include "platform/VyrReporting.h"
#include "propertylist/Payload.h"

namespace vx::lnx {

// The row of a relay session, known to the writer's thread once it has inserted it.
struct RelayRow {
  int64_t id = 0;
};

struct RelayOpenRecord {
  std::shared_ptr<RelayRow> row;
  std::unique_ptr<std::pair<VyrSessionInfo, Payload>> information;  // session and user information
};
struct RelayMessageRecord {
  std::shared_ptr<RelayRow> row;
  Payload payload;
  uint16_t category = 0;
  uint16_t type = 0;
};
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
  using What = std::variant<std::monostate, RelayOpenRecord, RelayMessageRecord, AnalyticsRecord,
                            PowerRecord>;
  // An event whose message is in the same batch as a relay message is written right after that one,
  // and shares its text. A relay message names the first such event, each event the next one.
  enum class Sharing : uint8_t { No, Held, Shares, Written };
  static constexpr uint32_t kNone = UINT32_MAX;

  StoreRecord(double when, What whatever) : time(when), what(std::move(whatever)) {}
  double time;  // seconds since 1970
  uint32_t nextSharer = kNone;
  Sharing sharing = Sharing::No;
  What what;
};
static_assert(sizeof(StoreRecord) <= 128, "a record a message: two cache lines");

using StoreRecords = ChunkList<StoreRecord, 256>;

// A row of the ledger that is still to be written: what is not there (any more), and why.
struct LedgerNote {
  std::string event;
  std::string table;  // empty: none
  int64_t rows = 0;
  std::string detail;
};

}  // namespace vx::lnx
