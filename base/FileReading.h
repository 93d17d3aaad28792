// Reads a small file that somebody else writes, without being held up or flooded by what stands in
// its place.
#pragma once

#include <cstddef>
#include <string>

#include "base/Status.h"

namespace vx {

// The whole content of a regular file of at most `maxBytes`. A failure (code: errno) for anything
// else: a directory, a FIFO (never waited for), a loop of links, a larger file.
Result<std::string> readRegularFile(const std::string& path, std::size_t maxBytes);

}  // namespace vx
