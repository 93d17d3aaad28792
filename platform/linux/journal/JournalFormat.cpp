#include "platform/linux/journal/JournalFormat.h"

#include <cstring>

#include "base/Bytes.h"
#include "propertylist/PlacedPayload.h"

namespace vx::lnx {

namespace {

// Odd constants without a pattern: the fractional digits of the square roots of 2, 3, 5 and 7.
constexpr uint64_t kRoot2 = 0x6A09E667F3BCC909u;
constexpr uint64_t kRoot3 = 0xBB67AE8584CAA73Bu;
constexpr uint64_t kRoot5 = 0x3C6EF372FE94F82Bu;
constexpr uint64_t kRoot7 = 0xA54FF53A5F1D36F1u;

// Both halves of the product of two words, folded.
inline uint64_t fold(uint64_t a, uint64_t b) {
  __extension__ using Wide = unsigned __int128;
  const Wide product = static_cast<Wide>(a) * b;
  return static_cast<uint64_t>(product) ^ static_cast<uint64_t>(product >> 64);
}

inline uint64_t foldAt(const uint8_t* at, uint64_t key, uint64_t seed) {
  return fold(loadWord<uint64_t>(at) ^ key, loadWord<uint64_t>(at + 8) ^ seed);
}

}  // namespace

// A processor's CRC takes one word at a time, each waiting for the last; these lanes do not wait
// for each other.
uint64_t mixOf(std::span<const uint8_t> bytes, uint64_t seed) {
  const uint8_t* at = bytes.data();
  std::size_t left = bytes.size();
  uint64_t a = seed ^ fold(left ^ kRoot2, kRoot7);
  if (left >= 64) {
    uint64_t b = a ^ kRoot3;
    uint64_t c = a ^ kRoot5;
    uint64_t d = a ^ kRoot7;
    for (; left >= 64; left -= 64, at += 64) {
      a = foldAt(at, kRoot2, a);
      b = foldAt(at + 16, kRoot3, b);
      c = foldAt(at + 32, kRoot5, c);
      d = foldAt(at + 48, kRoot7, d);
    }
    a = fold(a ^ c, kRoot3) ^ fold(b ^ d, kRoot5);
  }
  for (; left >= 16; left -= 16, at += 16) a = foldAt(at, kRoot2, a);
  if (left > 0 && bytes.size() >= 16) {
    a = foldAt(bytes.data() + bytes.size() - 16, kRoot3, a);  // once more what came before them
  } else if (left > 0) {
    uint8_t rest[16] = {};
    std::memcpy(rest, at, left);
    a = foldAt(rest, kRoot3, a);
  }
  return fold(a ^ kRoot5, kRoot7);
}

uint64_t checksumOf(const SegmentHeader& header) {
  SegmentHeader stable = header;
  stable.state = 0;
  stable.checksum = 0;
  stable.owner = nullptr;
  uint8_t bytes[sizeof stable];
  std::memcpy(bytes, &stable, sizeof stable);
  return mixOf(bytes, kRoot3);
}

uint64_t checksumOf(const uint8_t* entry, std::size_t length, uint64_t sequence) {
  constexpr std::size_t kFrom = offsetof(EntryHeader, call);
  EntryHeader header;
  std::memcpy(&header, entry, sizeof header);
  std::size_t body = bodyOffset(header.headBytes);
  if (body > length) body = length;
  const uint64_t seed = fold(sequence ^ kRoot5, length ^ kRoot2);
  const uint64_t first = mixOf({entry + kFrom, body - kFrom}, seed);
  if ((header.flags & EntryHeader::kDictionary) != 0) body += PlacedPayload::kReferenceBytes;
  return body < length ? mixOf({entry + body, length - body}, first) : first;
}

}  // namespace vx::lnx
