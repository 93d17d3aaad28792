// Turns any text into one safe file-name component, reversibly.
#pragma once

#include <string>
#include <string_view>

namespace vx {

// Letters, digits, '.', '-' and '_' (and bytes above 0x7F) stay as they are, so ordinary
// identifiers are unchanged. Everything else, '%' included, becomes %XX of its byte; so does a
// leading '.'. The empty text becomes "%00"-free
// "%". A result longer than 120 bytes is cut and closed with "%~" and the 16 hexadecimal digits of
// the FNV-1a hash of the whole text: such a name is unique but not reversible.
std::string encodeFileNameComponent(std::string_view text);

}  // namespace vx
