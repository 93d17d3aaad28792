// Reading memory a word at a time, made for short texts: never past the end.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>
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

}  // namespace vx
