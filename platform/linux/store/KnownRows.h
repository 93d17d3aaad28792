// The rows that a replay of recorded calls would write a second time.
#pragma once

#include <sqlite3.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <unordered_map>
#include <vector>

#include "base/Status.h"
#include "platform/linux/execution/CauseScope.h"

namespace vx::lnx {

// What a replay may write: rows of the calls from the first one up to the end; and what it goes
// back to: relay sessions of later calls than `sessionsFrom`, and of single earlier ones.
struct ReplayedCalls {
  uint64_t first = 0;
  uint64_t end = INT64_MAX;  // beyond the last one
  uint64_t sessionsFrom = 0;
  std::vector<uint64_t> earlierSessions = {};
};

// Confined to the store's writer. Bounded by what was written since the first call of a journal was
// accepted.
class KnownRows {
 public:
  static constexpr uint64_t kCallsPerMark = uint64_t{1} << 20;

  // A failure when the database cannot be read.
  static Result<KnownRows> load(sqlite3* database, const ReplayedCalls& calls);
  // The highest number of a call among the newest rows and the marks, 0 when there is none; a
  // failure when they cannot be read. No row ever had one that was kCallsPerMark higher.
  static Result<uint64_t> lastCall(sqlite3* database);
  // The identifier of the row with this key.
  std::optional<int64_t> find(const RowKey& key);
  // What was never asked for is what the replay has not come to: a message that still has its delay
  // before it may be there all the same. The rest goes.
  void keepUnasked();
  bool isEmpty() const { return rows_.empty(); }
  bool isEarlier(const RowKey& key) const { return key.call != 0 && key.call < firstCall_; }
  // Reads the sessions one by one.
  static std::optional<int64_t> sessionOf(sqlite3* database, const RowKey& key);

 private:
  struct Hash {
    std::size_t operator()(const RowKey& key) const {
      return static_cast<std::size_t>((key.call << 32 ^ key.place) * 0x9E3779B97F4A7C15u >> 16);
    }
  };
  struct Known {
    int64_t id = 0;
    bool asked = false;
  };
  int read(sqlite3* database, const char* sql, int64_t after);
  int readSessions(sqlite3* database, const ReplayedCalls& calls);

  uint64_t firstCall_ = 0;
  uint64_t endCall_ = 0;
  std::unordered_map<RowKey, Known, Hash> rows_;
};

}  // namespace vx::lnx
