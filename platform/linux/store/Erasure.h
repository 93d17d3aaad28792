// Removes what a person asks to have removed, from the store and from the summary files.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <optional>
#include <string>

#include "base/Function.h"
#include "base/Status.h"

namespace vx::lnx {

// One of them is given.
struct ErasureSelection {
  std::optional<std::string> application;  // HostApplicationDisplayID
  std::optional<uint32_t> user;            // whose client made it
  std::optional<double> before;            // seconds since 1970

  std::string text() const;  // for the ledger
};

struct Erased {
  int64_t messages = 0;  // with the events that share their text
  int64_t events = 0;
  int64_t powerRecords = 0;
  int64_t sessions = 0;
  int64_t files = 0;
};

// Removes in steps, so that the log stays short; `betweenSteps` runs between them, outside of a
// transaction, and may end it. What was removed is overwritten with zeros, and a row of the ledger
// says how much went, not what it was. Sessions that have not ended keep their row, because more of
// their messages may come.
//
// `summaries`: the folder of the summary files; those of a user are told by the sessions that the
// store has of him. A failure leaves some removed: ask again.
Result<Erased> eraseFromStore(sqlite3* database, const ErasureSelection& which,
                              const std::string& summaries, double now,
                              const Function<bool()>& betweenSteps = nullptr);

}  // namespace vx::lnx
