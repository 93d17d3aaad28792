#include "propertylist/PlacedPayload.h"

#include <cstring>

#include "propertylist/PayloadBlock.h"

namespace vx {

static_assert(PlacedPayload::kHeaderBytes == sizeof(uint32_t) + sizeof(std::atomic<uint32_t>));

void PlacedPayload::setOwner(void (*released)(void* place)) {
  Payload::Block::placedReleased.store(released, std::memory_order_release);
}

Payload PlacedPayload::at(void* place, const Payload::Validated& dictionary) {
  Payload::Block* block = Payload::Block::place(place, dictionary.bytes.size(), dictionary.traits);
  std::memcpy(block->bytes(), dictionary.bytes.data(), dictionary.bytes.size());
  return Payload(block);
}

std::size_t PlacedPayload::sizeAt(const uint8_t* place) {
  uint32_t sizeAndFlags;
  std::memcpy(&sizeAndFlags, place + kReferenceBytes, sizeof sizeAndFlags);
  return sizeAndFlags & Payload::Block::kMaxSize;
}

}  // namespace vx
