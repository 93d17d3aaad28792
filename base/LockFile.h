// Files that processes of one user lock against each other.
#pragma once

#include <string>

#include "base/Status.h"
#include "base/UniqueFd.h"

namespace vx {

// Opens the file, or makes it, for flock. Nobody else can open it, whatever modes it had: to hold
// an flock, reading is enough. A file of another user is refused: that user could hold it.
Result<UniqueFd> openLockFile(const std::string& path);

}  // namespace vx
