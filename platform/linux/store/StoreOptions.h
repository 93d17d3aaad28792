// What the local store may be told.
#pragma once

#include <chrono>
#include <cstdint>

namespace vx::lnx {

struct StoreOptions {
  uint64_t maxBytes = 256u << 20;   // of the database file
  uint32_t maxAgeDays = 30;         // 0: no limit
  uint64_t queueBytes = 32u << 20;  // not yet committed; reading from clients pauses above it
  std::chrono::milliseconds commitInterval{200};
};

}  // namespace vx::lnx
