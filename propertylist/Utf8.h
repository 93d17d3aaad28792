// Small helpers for UTF-8 text (RFC 3629), made for short strings.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "base/Bytes.h"

namespace vx {

// Length of the well-formed sequence at `at`, 0 when there is none: no overlong forms, no
// surrogates, nothing above U+10FFFF.
inline std::size_t utf8SequenceLength(const uint8_t* at, const uint8_t* end) {
  const auto continues = [&](int i) { return at + i < end && (at[i] & 0xC0) == 0x80; };
  const uint8_t lead = *at;
  if (lead < 0x80) return 1;
  if (lead < 0xC2 || lead > 0xF4 || !continues(1)) return 0;
  if (lead < 0xE0) return 2;
  const uint8_t second = at[1];
  if (lead < 0xF0) {
    if ((lead == 0xE0 && second < 0xA0) || (lead == 0xED && second > 0x9F)) return 0;
    return continues(2) ? 3 : 0;
  }
  if ((lead == 0xF0 && second < 0x90) || (lead == 0xF4 && second > 0x8F)) return 0;
  return continues(2) && continues(3) ? 4 : 0;
}

inline bool isUtf8Slowly(const uint8_t* at, const uint8_t* end) {
  while (at < end) {
    if (end - at >= 8 && (loadWord<uint64_t>(at) & kHighBits) == 0) {
      at += 8;
      continue;
    }
    const std::size_t length = utf8SequenceLength(at, end);
    if (length == 0) return false;
    at += length;
  }
  return true;
}

inline bool isUtf8(std::string_view text) {
  uint64_t high = 0;
  forEachWord(bytesOf(text), text.size(), [&](uint64_t word) { high |= word; });
  return (high & kHighBits) == 0 || isUtf8Slowly(bytesOf(text), bytesOf(text) + text.size());
}

// The text with every byte that belongs to no well-formed sequence replaced by U+FFFD.
inline std::string wellFormedUtf8(std::string_view text) {
  std::string out;
  for (const uint8_t *at = bytesOf(text), *end = at + text.size(); at < end;) {
    const std::size_t length = utf8SequenceLength(at, end);
    if (length == 0)
      out += "\xEF\xBF\xBD";
    else
      out.append(text, static_cast<std::size_t>(at - bytesOf(text)), length);
    at += length == 0 ? 1 : length;
  }
  return out;
}

}  // namespace vx
