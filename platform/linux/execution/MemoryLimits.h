// How much the service may be made to hold.
#pragma once

#include <cstdint>

namespace vx::lnx {

struct MemoryLimits {
  // Of everything that is counted but what waits: of one user, and of all.
  uint64_t maxUserBytes = 64u << 20;
  uint64_t maxBytes = 192u << 20;
  // Accepted and not yet committed, on whatever queue: of one user, and of all.
  uint64_t maxUserWaitingBytes = 24u << 20;
  uint64_t maxWaitingBytes = 32u << 20;
};

}  // namespace vx::lnx
