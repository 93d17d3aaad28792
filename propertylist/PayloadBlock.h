// The one allocation of a Payload. For the files that implement Payload only.
#pragma once

#include <cstddef>
#include <new>
#include <stdexcept>

#include "propertylist/Payload.h"

namespace vx {

//   | references 4 bytes | space, number and placed flag 1 bit each, size 29 bits | size bytes of
//   CBOR |
//
// A placed block lies in memory that somebody else owns (PlacedPayload.h), who is told when nobody
// refers to it any more.
struct Payload::Block {
  static constexpr uint32_t kSpaceFlag = 0x80000000u;
  static constexpr uint32_t kNonFiniteFlag = 0x40000000u;
  static constexpr uint32_t kPlacedFlag = 0x20000000u;
  static constexpr std::size_t kMaxSize = Payload::kMaxBytes;
  static_assert(kMaxSize < kPlacedFlag);

  using Traits = Payload::Traits;

  std::atomic<uint32_t> references{1};
  uint32_t sizeAndFlags;

  std::size_t size() const { return sizeAndFlags & kMaxSize; }
  bool isPlaced() const { return (sizeAndFlags & kPlacedFlag) != 0; }
  bool spaceInKeys() const { return (sizeAndFlags & kSpaceFlag) != 0; }
  bool mayHoldNonFinite() const { return (sizeAndFlags & kNonFiniteFlag) != 0; }
  uint8_t* bytes() { return reinterpret_cast<uint8_t*>(this + 1); }

  // The bytes are the caller's to fill.
  static Block* allocate(std::size_t size, Traits traits) {
    if (size > kMaxSize) throw std::length_error("a property list is limited to 512 MiB");
    void* memory = ::operator new(sizeof(Block) + size);
    return new (memory) Block(static_cast<uint32_t>(size) | flagsOf(traits));
  }
  // The same in memory of at least sizeof(Block) + size bytes, aligned as a Block is.
  static Block* place(void* memory, std::size_t size, Traits traits) {
    return new (memory) Block(static_cast<uint32_t>(size) | kPlacedFlag | flagsOf(traits));
  }
  // Who is told that a placed block is free.
  static inline constinit std::atomic<void (*)(void* block)> placedReleased{nullptr};

 private:
  static uint32_t flagsOf(Traits traits) {
    return (traits.spaceInKeys ? kSpaceFlag : 0) | (traits.mayHoldNonFinite ? kNonFiniteFlag : 0);
  }
  explicit Block(uint32_t sizeWithFlags) : sizeAndFlags(sizeWithFlags) {}
};
static_assert(sizeof(std::atomic<uint32_t>) == 4);

}  // namespace vx
