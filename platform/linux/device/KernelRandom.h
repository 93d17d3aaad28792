// Random numbers from the kernel.
#pragma once

#include <cstdint>

#include "platform/ProcessInfoQuery.h"

namespace vx::lnx {

// Stateless, so thread-safe.
class KernelRandom final : public RandomSource {
 public:
  uint32_t below(uint32_t bound) override;
};

}  // namespace vx::lnx
