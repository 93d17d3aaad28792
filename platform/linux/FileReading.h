// Reads small files that somebody else writes, without being held up or flooded by what stands in
// their place.
#pragma once

#include <cstddef>
#include <optional>
#include <string>

#include "platform/Error.h"

namespace vx::lnx {

// The whole content of a regular file of at most `maxBytes`. None and an error (code: errno) for
// anything else: a directory, a FIFO (never waited for), a loop of links, a larger file.
std::optional<std::string> readRegularFile(const std::string& path, std::size_t maxBytes,
                                           Error& error);

// The text of a TOML file of at most 1 MiB, safe to hand to the parser: that one recurses once per
// part of a dotted key and has no limit of its own, so a file with a key of more than 16 parts is
// refused (EINVAL, naming file and line).
std::optional<std::string> readTomlText(const std::string& path, Error& error);

// An error that carries errno and what was tried.
Error posixError(int errnoValue, const std::string& what);

}  // namespace vx::lnx
