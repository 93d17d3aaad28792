// The text of a TOML file, checked before a parser sees it.
#pragma once

#include <string>

#include "base/Status.h"

namespace vx::lnx {

// Of at most 1 MiB, safe to hand to the parser: that one recurses once per part of a dotted key and
// has no limit of its own, so a file with a key of more than 16 parts is refused (EINVAL, naming
// file and line).
Result<std::string> readTomlText(const std::string& path);

// "file:line:column: why" of a toml::parse_error.
template <class ParseError>
std::string complaintOf(const std::string& path, const ParseError& failure) {
  const auto& begin = failure.source().begin;
  return path + ":" + std::to_string(begin.line) + ":" + std::to_string(begin.column) + ": " +
         std::string(failure.description());
}

}  // namespace vx::lnx
