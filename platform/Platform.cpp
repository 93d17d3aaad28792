#include "platform/Platform.h"

#include <atomic>
#include <cstdlib>

namespace vx {

namespace {
std::atomic<Platform*> installedPlatform{nullptr};
}

Platform& platform() {
  Platform* const installed = installedPlatform.load(std::memory_order_acquire);
  if (installed == nullptr) std::abort();
  return *installed;
}

void installPlatform(Platform* installed) {
  installedPlatform.store(installed, std::memory_order_release);
}

}  // namespace vx
