// Something another thread does, waited for.
#pragma once

#include <chrono>

#include "base/Mutex.h"

namespace vx::lnx {

class Latch {
 public:
  void open() {
    MutexLock lock(mutex_);
    open_ = true;
    changed_.notifyAll();
  }
  // False when it has taken too long for any machine.
  bool wait() {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    MutexLock lock(mutex_);
    while (!open_ && changed_.waitUntil(mutex_, deadline)) {
    }
    return open_;
  }

 private:
  Mutex mutex_;
  CondVar changed_;
  bool open_ GUARDED_BY(mutex_) = false;
};

}  // namespace vx::lnx
