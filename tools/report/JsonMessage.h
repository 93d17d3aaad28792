// A message as people write it, as a client would send it.
#pragma once

#include <string>

#include "propertylist/Payload.h"

namespace vx::report {

// Failure for what is no JSON object, or holds what no message can: the sentence names it.
Payload messageOf(const std::string& json);

}  // namespace vx::report
