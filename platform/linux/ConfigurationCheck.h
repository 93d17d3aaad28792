// What is wrong in the configuration and the preferences, said without a service.
#pragma once

#include <string>
#include <vector>

namespace vx::lnx {

// A line for each mistake in <folder>/platform.toml, as the service would log it, and in
// <folder>/preferences/com.quorvel.sonik.toml, where the service is silent about what it leaves
// out. A file that is not there is no mistake.
std::vector<std::string> checkConfiguration(const std::string& folder);

}  // namespace vx::lnx
