// How rows lie in memory. Of this host only, and of one version of the service.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>

#include "Statistics/VXReportingUtility.h"

namespace vx {

// Messages of one kind have the same keys in the same order, so these are kept once, as a shape,
// and a message is its values. One stream of records, in the blocks of an aggregate; no record lies
// in two blocks:
//
//   | 0 |                                                the rest of the block is not used
//   | 1 | kind + 1, or 0 | number of keys | keys |       a shape; they are numbered as they come
//   | 2 | kind | count |                                 that of the kind's last message
//   | 3 | kind + 1, or 0 | dictionary |                  a row without a shape
//   | 4 | kind + 1, or 0 | number |                      a row that is kept elsewhere
//   | 5 + shape, or 255 and shape - 250 | values |       a row
//
// Numbers are LEB128. Keys, values and dictionaries are their CBOR items, but for two forms of a
// value that begin as no item of a property list does: kSame, as in the shape's row before, and
// kShortDouble, with the four bytes of a single that is the double. The count of a message is one
// more than that of its kind's message before.
struct VXReportingRowFormat {
  enum Tag : uint8_t {
    kEndOfBlock = 0,
    kShape = 1,
    kCount = 2,
    kWhole = 3,
    kReference = 4,
    kFirstRow = 5,
    kFarRow = 255
  };
  static constexpr uint32_t kShapesByTag = kFarRow - kFirstRow;
  static constexpr uint8_t kSame = 0x40;
  static constexpr uint8_t kShortDouble = 0x41;
  static constexpr std::size_t kShortDoubleBytes = 5;

  // Others have no shape.
  static constexpr std::size_t kMostShapes = 1024;
  static constexpr std::size_t kMostKeys = 256;

  static constexpr std::size_t kMaxNumberBytes = 10;
  static constexpr std::size_t kMaxTagBytes = 1 + kMaxNumberBytes;

  static uint8_t* writeNumber(uint8_t* at, uint64_t number) {
    for (; number > 0x7F; number >>= 7) *at++ = static_cast<uint8_t>(number | 0x80);
    *at++ = static_cast<uint8_t>(number);
    return at;
  }
  // Null when the bytes end first, or it has more than 64 bits.
  static const uint8_t* readNumber(const uint8_t* at, const uint8_t* end, uint64_t& number) {
    number = 0;
    for (int shift = 0; at != end && shift < 64; shift += 7) {
      const uint8_t byte = *at++;
      number |= uint64_t{byte & 0x7Fu} << shift;
      if (byte < 0x80) return shift < 63 || byte <= 1 ? at : nullptr;
    }
    return nullptr;
  }
  static uint64_t numberOf(std::optional<MessageKind> kind) {
    return kind ? uint64_t{*kind} + 1 : 0;
  }
  static std::optional<MessageKind> kindOf(uint64_t number) {
    if (number == 0) return std::nullopt;
    return static_cast<MessageKind>(number - 1);
  }
};

}  // namespace vx
