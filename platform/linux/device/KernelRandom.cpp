#include "platform/linux/device/KernelRandom.h"

#include <sys/random.h>

namespace vx::lnx {

uint32_t KernelRandom::below(uint32_t bound) {
  if (bound < 2) return 0;
  // At and above it the low values would be likelier.
  const uint32_t limit = UINT32_MAX - UINT32_MAX % bound;
  uint32_t value = 0;
  do {
    if (getrandom(&value, sizeof value, 0) != sizeof value) return 0;
  } while (value >= limit);
  return value % bound;
}

}  // namespace vx::lnx
