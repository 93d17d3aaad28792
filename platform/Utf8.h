// Small helpers for UTF-8 text (RFC 3629), made for short strings: they look at eight bytes at a
// time and never read past the end.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>

namespace vx {

inline const uint8_t* bytesOf(std::string_view text) {
  return reinterpret_cast<const uint8_t*>(text.data());
}

template <typename Word>
inline Word loadWord(const uint8_t* at) {
  Word word;
  std::memcpy(&word, at, sizeof word);
  return word;
}

inline constexpr uint64_t kEveryByte = 0x0101010101010101u;
inline constexpr uint64_t kHighBits = 0x80 * kEveryByte;

// Not 0 when a byte of the word is `byte`.
inline uint64_t hasByte(uint64_t word, uint8_t byte) {
  const uint64_t zeroed = word ^ (byte * kEveryByte);
  return (zeroed - kEveryByte) & ~zeroed & kHighBits;
}

// Not 0 when a byte of the word is below `limit` (at most 128).
inline uint64_t hasByteBelow(uint64_t word, uint8_t limit) {
  return (word - limit * kEveryByte) & ~word & kHighBits;
}

// Calls f(word) until every byte has been in a word. Bytes may come more than once (the last word
// overlaps the one before it), but no byte comes that is not in the text.
template <typename F>
inline void forEachWord(const uint8_t* at, std::size_t size, F f) {
  if (size >= 8) {
    for (std::size_t i = 0; i + 8 < size; i += 8) f(loadWord<uint64_t>(at + i));
    f(loadWord<uint64_t>(at + size - 8));
  } else if (size >= 4) {
    f(loadWord<uint32_t>(at) | uint64_t{loadWord<uint32_t>(at + size - 4)} << 32);
  } else if (size > 0) {
    const uint64_t bytes = at[0] | at[size / 2] << 8 | at[size - 1] << 16;
    f(bytes | bytes << 24 | uint64_t{at[0]} << 48 | uint64_t{at[0]} << 56);
  }
}

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
