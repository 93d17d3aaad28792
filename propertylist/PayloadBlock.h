// The one allocation of a Payload. For the files that implement Payload only.
#pragma once

#include <cstddef>
#include <new>
#include <stdexcept>

#include "propertylist/Payload.h"

namespace vx {

//   | references 4 bytes | space flag 1 bit, number flag 1 bit, size 30 bits | size bytes of CBOR |
struct Payload::Block {
  static constexpr uint32_t kSpaceFlag = 0x80000000u;
  static constexpr uint32_t kNonFiniteFlag = 0x40000000u;
  static constexpr std::size_t kMaxSize = 0x3FFFFFFFu;

  // What is known of the bytes, so that nobody has to look for it again.
  struct Traits {
    bool spaceInKeys = false;       // of this dictionary
    bool mayHoldNonFinite = false;  // anywhere inside; a value replaced since may have been it
  };

  std::atomic<uint32_t> references{1};
  uint32_t sizeAndFlags;

  std::size_t size() const { return sizeAndFlags & ~(kSpaceFlag | kNonFiniteFlag); }
  bool spaceInKeys() const { return (sizeAndFlags & kSpaceFlag) != 0; }
  bool mayHoldNonFinite() const { return (sizeAndFlags & kNonFiniteFlag) != 0; }
  uint8_t* bytes() { return reinterpret_cast<uint8_t*>(this + 1); }

  // The bytes are the caller's to fill.
  static Block* allocate(std::size_t size, Traits traits) {
    if (size > kMaxSize) throw std::length_error("a property list is limited to 1 GiB");
    void* memory = ::operator new(sizeof(Block) + size);
    return new (memory) Block(static_cast<uint32_t>(size) | (traits.spaceInKeys ? kSpaceFlag : 0) |
                              (traits.mayHoldNonFinite ? kNonFiniteFlag : 0));
  }

 private:
  explicit Block(uint32_t sizeWithFlags) : sizeAndFlags(sizeWithFlags) {}
};
static_assert(sizeof(std::atomic<uint32_t>) == 4);

}  // namespace vx
