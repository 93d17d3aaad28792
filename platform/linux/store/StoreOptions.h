// What the local store may be told.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>

namespace vx::lnx {

// When what has been accepted is committed: at whichever comes first. What is accepted survives the
// process: the interval is what a power cut may cost.
struct CommitWindow {
  std::size_t rows = 1000;
  std::size_t bytes = 1 << 20;
  std::chrono::milliseconds interval{5000};

  bool isFull(std::size_t waitingRows, std::size_t waitingBytes) const {
    return waitingRows >= rows || waitingBytes >= bytes;
  }
};

struct StoreOptions {
  static constexpr uint64_t kSlackBytes = 16u << 20;
  // Of the database file and of a journal that was moved beside it; with the log never more than
  // kSlackBytes beyond it.
  uint64_t maxBytes = 256u << 20;
  uint32_t maxAgeDays = 30;  // 0: no limit
  CommitWindow commit;
};

}  // namespace vx::lnx
