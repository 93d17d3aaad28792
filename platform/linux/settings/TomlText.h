// The text of a TOML file, checked before a parser sees it.
#pragma once

#include <string>

#include "base/Status.h"

namespace vx::lnx {

// Of at most 1 MiB, safe to hand to the parser: that one recurses once per part of a dotted key and
// has no limit of its own, so a file with a key of more than 16 parts is refused (EINVAL, naming
// file and line).
Result<std::string> readTomlText(const std::string& path);

}  // namespace vx::lnx
