// Reads CBOR items (RFC 8949) whose bytes have been validated already; nothing here checks lengths.
#pragma once

#include <bit>
#include <cmath>
#include <cstdint>
#include <string_view>

#include "base/Bytes.h"

namespace vx::cbor {

inline constexpr uint8_t kUnsigned = 0;
inline constexpr uint8_t kNegative = 1;
inline constexpr uint8_t kBytes = 2;
inline constexpr uint8_t kText = 3;
inline constexpr uint8_t kArray = 4;
inline constexpr uint8_t kMap = 5;
inline constexpr uint8_t kTag = 6;
inline constexpr uint8_t kSimple = 7;

inline constexpr uint8_t kFalse = 0xF4;
inline constexpr uint8_t kTrue = 0xF5;
inline constexpr uint8_t kNull = 0xF6;
inline constexpr uint8_t kHalf = 0xF9;
inline constexpr uint8_t kSingle = 0xFA;
inline constexpr uint8_t kDouble = 0xFB;

// The initial byte and the argument after it:
//
//   | major 3 bits | info 5 bits | 0, 1, 2, 4 or 8 bytes of argument, big-endian |
//
// An info below 24 is the argument itself; 24 to 27 say how many bytes hold it.
struct Head {
  uint8_t initial = 0;
  uint64_t argument = 0;
  const uint8_t* next = nullptr;  // first byte after the head
  uint8_t major() const { return initial >> 5; }
};

inline uint64_t bigEndian(const uint8_t* at, int info) {
  switch (info) {
    case 24:
      return *at;
    case 25:
      return __builtin_bswap16(loadWord<uint16_t>(at));
    case 26:
      return __builtin_bswap32(loadWord<uint32_t>(at));
    default:
      return __builtin_bswap64(loadWord<uint64_t>(at));
  }
}

inline Head head(const uint8_t* at) {
  const uint8_t info = *at & 31;
  if (info < 24) return {*at, info, at + 1};
  return {*at, bigEndian(at + 1, info), at + 1 + (1 << (info - 24))};
}

// The string at `at`, which must be one.
inline std::string_view text(const uint8_t* at) {
  const Head h = head(at);
  return {reinterpret_cast<const char*>(h.next), h.argument};
}

// First byte after the item. Nested items cost no stack.
inline const uint8_t* skip(const uint8_t* at) {
  for (uint64_t items = 1; items > 0; --items) {
    const Head h = head(at);
    at = h.next;
    switch (h.major()) {
      case kText:
        at += h.argument;
        break;
      case kArray:
        items += h.argument;
        break;
      case kMap:
        items += 2 * h.argument;
        break;
      case kTag:
        ++items;
        break;
      default:
        break;
    }
  }
  return at;
}

inline bool isFloating(const Head& h) { return h.initial >= kHalf && h.initial <= kDouble; }

// Half precision as RFC 8949, Appendix D reads it.
inline float halfToFloat(uint16_t half) {
  const int exponent = half >> 10 & 31;
  const int mantissa = half & 1023;
  float magnitude;
  if (exponent == 0)
    magnitude = std::ldexp(static_cast<float>(mantissa), -24);
  else if (exponent != 31)
    magnitude = std::ldexp(static_cast<float>(mantissa + 1024), exponent - 25);
  else
    magnitude = mantissa == 0 ? HUGE_VALF : std::nanf("");
  return (half & 0x8000) != 0 ? -magnitude : magnitude;
}

// Of a half or single.
inline float singleOf(const Head& h) {
  return h.initial == kHalf ? halfToFloat(static_cast<uint16_t>(h.argument))
                            : std::bit_cast<float>(static_cast<uint32_t>(h.argument));
}

inline double floatingOf(const Head& h) {
  return h.initial == kDouble ? std::bit_cast<double>(h.argument)
                              : static_cast<double>(singleOf(h));
}

// Whether a number inside [at, end), which holds whole items, is infinite or not a number.
inline bool anyNonFinite(const uint8_t* at, const uint8_t* end) {
  while (at < end) {
    const Head h = head(at);
    if (isFloating(h) && !std::isfinite(floatingOf(h))) return true;
    at = h.next + (h.major() == kText ? h.argument : 0);
  }
  return false;
}

}  // namespace vx::cbor
