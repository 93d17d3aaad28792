// The operations of inspect.socket by the numbers they have on the wire (docs/inspecting.md).
#pragma once

#include <cstdint>

namespace vx::wire {

enum class InspectOperation : uint8_t {
  Status = 1,
  Connections = 2,
  Sessions = 3,
  Session = 4,
  Follow = 5,
  Erase = 6,
};

}  // namespace vx::wire
