// How much of the store's text is whose.
#pragma once

#include <algorithm>
#include <cstdint>
#include <utility>
#include <vector>

namespace vx::lnx {

// By user, in no order; there are few.
using UserBytes = std::vector<std::pair<uint32_t, int64_t>>;

inline void addTo(UserBytes& all, uint32_t user, int64_t bytes) {
  const auto found = std::ranges::find(all, user, &std::pair<uint32_t, int64_t>::first);
  if (found != all.end())
    found->second = std::max<int64_t>(0, found->second + bytes);
  else if (bytes > 0)
    all.emplace_back(user, bytes);
}

}  // namespace vx::lnx
