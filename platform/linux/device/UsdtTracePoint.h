// Trace points as USDT probes.
#pragma once

#include "platform/TracePoint.h"

namespace vx::lnx {

// The probe vxreporting:trace(code, a, b, c, d): a no-op instruction while nobody looks.
// Thread-safe.
class UsdtTracePoint final : public TracePoint {
 public:
  void emit(uint32_t code, uint64_t a, uint64_t b, uint64_t c, uint64_t d) override;
};

}  // namespace vx::lnx
