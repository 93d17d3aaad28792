// Whatever a segment holds, the reader gives whole entries with valid dictionaries, or stops. With
// an odd first byte the checksums are made to agree, so that what they guard is reached.
#include <cstring>

#include "platform/linux/journal/JournalReader.h"

using vx::lnx::EntryHeader;

static void repair(std::vector<uint8_t>& bytes) {
  EntryHeader header;
  for (std::size_t at = vx::lnx::kFirstEntry; at + sizeof header <= bytes.size();) {
    std::memcpy(&header, &bytes[at], sizeof header);
    if (header.length < sizeof header || header.length > bytes.size() - at ||
        header.headBytes > header.length)
      return;
    header.checksum = vx::lnx::checksumOf(&bytes[at], header.length, 1);
    std::memcpy(&bytes[at], &header, sizeof header);
    at += vx::lnx::padded(header.length);
  }
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  vx::lnx::SegmentHeader header{};
  header.sequence = 1;
  std::vector<uint8_t> bytes(vx::lnx::kFirstEntry);
  std::memcpy(bytes.data(), &header, sizeof header);
  bytes.insert(bytes.end(), data + 1, data + size);
  if ((*data & 1) != 0) repair(bytes);
  const auto segment = vx::lnx::JournalReader::readSegment(bytes);
  for (const auto& entry : segment.entries) {
    if (entry.head.size() + entry.body.size() > size) __builtin_trap();
    if (entry.dictionary && !vx::Payload::decode(entry.dictionary->encoded())) __builtin_trap();
  }
  return 0;
}
