// Payloads whose bytes lie in memory that somebody else owns.
#pragma once

#include <cstddef>
#include <cstdint>

#include "propertylist/Payload.h"

namespace vx {

// Makes a Payload in place, in memory that its owner keeps until he is told that nobody refers to
// it any more. Thread-safe. One owner per process.
class PlacedPayload {
 public:
  // Before the bytes: | references 4 bytes, changed by every copy | flags and size 4 bytes |
  static constexpr std::size_t kReferenceBytes = 4;
  static constexpr std::size_t kHeaderBytes = 8;

  // `released` is told the place of each Payload whose last copy has gone, on the thread that let
  // go of it. To be set before the first is placed.
  static void setOwner(void (*released)(void* place));

  // Copies the bytes of a dictionary that is not empty to a place of kHeaderBytes + bytes.size(),
  // aligned to 4.
  static Payload at(void* place, const Payload::Validated& dictionary);

  // The number of bytes that the header at `place` says follow it.
  static std::size_t sizeAt(const uint8_t* place);
};

}  // namespace vx
