// The one allocation behind a Payload. For the files that implement Payload only.
#pragma once

#include <cstddef>
#include <new>
#include <stdexcept>

#include "platform/Payload.h"

namespace vx {

//   | references 4 bytes | space flag 1 bit, size 31 bits | size bytes of CBOR |
struct Payload::Block {
  static constexpr uint32_t kSpaceFlag = 0x80000000u;
  static constexpr std::size_t kMaxSize = 0x7FFFFFFFu;

  std::atomic<uint32_t> references{1};
  uint32_t sizeAndFlag;

  std::size_t size() const { return sizeAndFlag & ~kSpaceFlag; }
  bool spaceInKeys() const { return (sizeAndFlag & kSpaceFlag) != 0; }
  uint8_t* bytes() { return reinterpret_cast<uint8_t*>(this + 1); }

  // The bytes are the caller's to fill.
  static Block* allocate(std::size_t size, bool spaceInKeys) {
    if (size > kMaxSize) throw std::length_error("a property list is limited to 2 GiB");
    void* room = ::operator new(sizeof(Block) + size);
    return new (room) Block(static_cast<uint32_t>(size) | (spaceInKeys ? kSpaceFlag : 0));
  }

 private:
  explicit Block(uint32_t sizeWithFlag) : sizeAndFlag(sizeWithFlag) {}
};
static_assert(sizeof(std::atomic<uint32_t>) == 4);

}  // namespace vx
