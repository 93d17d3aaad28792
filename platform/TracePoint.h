// Trace points: a 32-bit code and four numbers, for tools that look from outside.
#pragma once

#include <cstdint>

namespace vx {

class TracePoint {
 public:
  virtual ~TracePoint() = default;
  virtual void emit(uint32_t code, uint64_t a, uint64_t b, uint64_t c, uint64_t d) = 0;
};

}  // namespace vx
