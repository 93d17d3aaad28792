// Says which thread something belongs to, and checks it.
#pragma once

#include <atomic>
#include <thread>

#include "base/Check.h"
#include "base/ThreadAnnotations.h"

namespace vx {

// The thread that asks first. A capability: what belongs to the
// thread is GUARDED_BY it, and a function that asserts it may use that.
class CAPABILITY("thread") ThreadChecker {
 public:
  // Fails the process when the caller is another thread (development builds).
  void assertHere() const ASSERT_CAPABILITY(this) { VX_DCHECK(isHere()); }
  // The next one that asks is the one: for what is handed over.
  void unbind() { owner_ = std::thread::id(); }

 private:
  bool isHere() const {
    std::thread::id owner;  // nobody
    return owner_.compare_exchange_strong(owner, std::this_thread::get_id()) ||
           owner == std::this_thread::get_id();
  }
  mutable std::atomic<std::thread::id> owner_{};
};

}  // namespace vx
