// JSON that stands in an HTML page: whatever a client wrote stays text.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace vx::report {

// A string of at most `most` characters; a longer one ends in how long it was. No "<" is left in
// it, so that no tag begins or ends there, and no line break that only JSON takes for a character.
void appendPageString(std::string& out, std::string_view text, std::size_t most = 200);
// The same of JSON, which is not shortened. A number that a browser would round becomes a string.
void appendPageJson(std::string& out, std::string_view json);

}  // namespace vx::report
