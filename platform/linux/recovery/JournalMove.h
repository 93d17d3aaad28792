// Moves a journal into another folder, of a disk that may not answer.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "base/Clock.h"
#include "base/Mutex.h"
#include "base/Status.h"

namespace vx::lnx {

// At the end of a process that may not wait for the disk for ever: a thread of its own does it,
// which is left behind with the object when it hangs. Used by one thread.
class JournalMove {
 public:
  // Nothing is moved when it is more than `mostBytes`.
  JournalMove(const std::string& from, const std::string& to, uint64_t mostBytes);

  // How it went; none when that is not known by then.
  std::optional<Status> waitUntil(Monotonic until);
  // Segments so far.
  uint64_t progress() const { return shared_->segments.load(); }

 private:
  struct Shared {
    Mutex mutex;
    CondVar changed;
    std::optional<Status> outcome GUARDED_BY(mutex);
    std::atomic<uint64_t> segments{0};
  };
  const std::shared_ptr<Shared> shared_ = std::make_shared<Shared>();
};

}  // namespace vx::lnx
