// What the watching of preferences may be told.
#pragma once

#include <chrono>

namespace vx::lnx {

struct PreferencesOptions {
  std::chrono::milliseconds settle{100};         // quiet time after a change before it is announced
  std::chrono::milliseconds pollInterval{3000};  // only while inotify is unavailable
};

}  // namespace vx::lnx
