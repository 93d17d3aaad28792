// A page for a browser: one file, with what it shows as JSON in it.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "tools/report/StoreReader.h"

namespace vx::report {

struct PageChoice {
  double since = 0;                        // seconds since 1970
  std::optional<std::string> application;  // of sessions
  std::optional<int64_t> session;          // relay_session
  std::string asGiven;                     // how it was chosen, for people
};

// Bounded, whatever the store holds: by the newest sessions, messages and bytes, and by the length
// of each text. The page says what it leaves out; its counts and sums are of everything.
std::string pageOf(StoreReader& store, const PageChoice& choice);

}  // namespace vx::report
