// What the local store may be told.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>

namespace vx::lnx {

// When what has been accepted is committed: at whichever comes first.
struct CommitWindow {
  std::size_t rows = 1000;
  std::size_t bytes = 1 << 20;
  std::chrono::milliseconds interval{200};

  bool isFull(std::size_t waitingRows, std::size_t waitingBytes) const {
    return waitingRows >= rows || waitingBytes >= bytes;
  }
};

struct StoreOptions {
  uint64_t maxBytes = 256u << 20;   // of the database file
  uint32_t maxAgeDays = 30;         // 0: no limit
  uint64_t queueBytes = 32u << 20;  // not yet committed; reading from clients pauses above it
  CommitWindow commit;
};

}  // namespace vx::lnx
