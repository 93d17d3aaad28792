// Turns any text into one safe file-name component, reversibly.
#pragma once

#include <string>
#include <string_view>

namespace vx {

// Letters, digits, '.', '-', '_' and well-formed UTF-8 above U+009F stay as they are, so ordinary
// identifiers such as com.example.app are unchanged. Every other byte, '%' included, becomes %XX
// (two upper-case hexadecimal digits); so does a leading '.', so that no name is hidden or leads
// out of its directory. The empty text becomes a lone "%": an encoded text has a '%' only with
// two digits after it, so this is no other text's name.
//
// Two different texts have two different names as long as these have at most 120 bytes. A longer
// name is cut to 120, never inside a character or %XX, and closed with "%~" and the 16 hexadecimal
// digits of the FNV-1a hash of the whole text: it is told apart by its hash alone, and not
// reversible.
std::string encodeFileNameComponent(std::string_view text);

}  // namespace vx
