// The check behind "belongs to one thread".
#pragma once

#include <thread>

#include "base/Check.h"
#include "base/ThreadAnnotations.h"

namespace vx::lnx {

// Owned by an object that any one thread may use, and then no other: the first to ask owns it.
class CAPABILITY("thread") ThreadConfinement {
 public:
  void assertIsCurrent() ASSERT_CAPABILITY(this) {
    if (owner_ == std::thread::id()) owner_ = std::this_thread::get_id();
    VX_DCHECK(owner_ == std::this_thread::get_id());
  }

 private:
  std::thread::id owner_;
};

}  // namespace vx::lnx
