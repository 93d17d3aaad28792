// What the endpoint for those who look into the service may be told.
#pragma once

#include <string>

namespace vx::lnx {

struct InspectOptions {
  std::string group = "vxreporting-read";  // whose members may look, if there is such a group
};

}  // namespace vx::lnx
