#include "platform/Platform.h"

#include <cstdlib>

namespace vx {

namespace {
Platform* installedPlatform = nullptr;
}

Platform& platform() {
  if (installedPlatform == nullptr) std::abort();
  return *installedPlatform;
}

void installPlatform(Platform* installed) { installedPlatform = installed; }

}  // namespace vx
