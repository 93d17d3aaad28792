// The store as somebody else reads it: never written, never held up.
#pragma once

#include <optional>
#include <string>

#include "platform/linux/store/Database.h"
#include "tools/report/Command.h"

namespace vx::report {

using lnx::Statement;

// The option that names the store, and those that choose from it.
#define VX_STORE_HELP                                                       \
  "  --store FILE   $STATE_DIRECTORY/telemetry.db when there is none, or\n" \
  "                 /var/lib/vxreporting/telemetry.db\n"
#define VX_SINCE_HELP                                                                \
  "  --since TIME   a date and time in UTC (2026-11-22, 2026-11-22T10:30), or how\n" \
  "                 long ago (90m, 24h, 7d)\n"

// Seconds since 1970, of what VX_SINCE_HELP names, or UsageError.
double timeOf(const std::string& text);

// Owned by a command, for as long as it runs. All of its queries see the store of one moment.
class StoreReader {
 public:
  // Failure when there is no store that can be read, with one sentence that says why.
  explicit StoreReader(const Options& options);
  const std::string& path() const { return path_; }
  // Whatever is wrong with it is found by the end of its rows: see check.
  Statement query(const std::string& sql);
  // The rows have ended because there are no more; Failure otherwise.
  void check(const Statement& ended) const;
  // Of the option --since: seconds since 1970, or the beginning of time. UsageError.
  double since() const { return since_; }
  // The row of relay_sessions that a word names: a client's identifier, the last session of that;
  // or @N, the relay session N itself.
  int64_t sessionOf(const std::string& word);

 private:
  [[noreturn]] void fail(int code) const;
  void open();

  const std::string path_;
  lnx::Database database_;
  double since_;
};

}  // namespace vx::report
