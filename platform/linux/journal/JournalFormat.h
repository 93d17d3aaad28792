// How a journal lies in its files. Of this host only: numbers are in its byte order.
//
// A journal is a folder of segments, files of kSegmentBytes each:
//
//   | SegmentHeader, padded to kFirstEntry | entry | entry | ... | length word 0 |
//
// and an entry, at a multiple of kEntryAlignment,
//
//   | EntryHeader | head, padded to 8 | body |
//
// where the body is nothing, the bytes of a note, or a dictionary as PlacedPayload lays it out.
// The length word is written last: what has one is whole. It is 0 after the last entry unless the
// entry ends with the segment.
#pragma once

#include <algorithm>
#include <array>
#include <cstddef>
#include <cstdint>
#include <span>

namespace vx::lnx {

inline constexpr std::size_t kSegmentBytes = std::size_t{2} << 20;
inline constexpr std::size_t kEntryAlignment = 8;
// Room for the largest frame that a client may send and what is noted of it.
inline constexpr std::size_t kMaxEntryBytes = (std::size_t{1} << 20) + 4096;

using JournalEpoch = std::array<uint8_t, 16>;

// No user has this number (chown(2)).
inline constexpr uint32_t kNoUser = UINT32_MAX;

enum class EntryType : uint8_t {
  Call = 1,              // waits until its tickets have gone
  Note = 2,              // an input of an earlier call, whose number it bears
  Snapshot = 3,          // part of the state with which its generation begins
  SnapshotComplete = 4,  // its generation's state has been written
};

struct SegmentHeader {
  static constexpr uint64_t kMagic = 0x314C4E524A5856;  // "VXJRNL1"
  static constexpr uint32_t kVersion = 2;
  static constexpr uint32_t kFree = 0;
  static constexpr uint32_t kInUse = 0x5AC3965A;  // no flipped bit makes one of the other

  uint64_t magic;
  uint32_t version;
  uint32_t state;  // written last when a segment begins, first when it ends; not in the checksum
  JournalEpoch epoch;
  uint64_t sequence;   // of the segment, from 1
  uint64_t firstCall;  // no call in it has a lower number
  uint32_t generation;
  uint32_t reserved;
  uint64_t checksum;
  void* owner;  // of the mapping, in the process that has it; never read from a file
};

struct EntryHeader {
  static constexpr uint8_t kDictionary = 1;       // the body is one
  static constexpr uint8_t kEmptyDictionary = 2;  // there is one, and it is empty
  static constexpr uint8_t kForEarlier = 4;       // work of the call whose number is `connection`

  // Beside the tickets of a call that is replayed although it was done.
  static constexpr uint32_t kWasDone = uint32_t{1} << 31;

  uint32_t length;    // of the whole entry without padding after it
  uint32_t waiting;   // tickets; a call is done at 0. Not in the checksum
  uint64_t checksum;  // of all that follows but the body's reference count
  uint64_t call;
  double time;  // seconds since 1970
  uint64_t connection;
  uint32_t user;  // whose call it is; kNoUser when it is nobody's
  uint32_t headBytes;
  uint8_t kind;
  EntryType type;
  uint8_t flags;
  uint8_t reserved[5];
};
static_assert(sizeof(SegmentHeader) == 72 && sizeof(EntryHeader) == 56);

inline constexpr std::size_t kFirstEntry = 128;
inline constexpr std::size_t kMaxEntriesPerSegment = kSegmentBytes / sizeof(EntryHeader);

// What comes next in a journal. Numbers never come twice in one epoch.
struct JournalNumbers {
  uint64_t call = 1;
  uint64_t sequence = 1;
  uint32_t generation = 1;
  // Past all that a segment may hold, whether or not it can still be read.
  void goPast(const SegmentHeader& header) {
    call = std::max(call, header.firstCall + kMaxEntriesPerSegment);
    sequence = std::max(sequence, header.sequence + 1);
    generation = std::max(generation, header.generation + 1);
  }
};

// Where an entry lies.
struct JournalPlace {
  uint64_t sequence = 0;  // of its segment
  uint32_t offset = 0;
};

inline constexpr std::size_t padded(std::size_t bytes) {
  return (bytes + kEntryAlignment - 1) & ~(kEntryAlignment - 1);
}
// From the entry's beginning.
inline constexpr std::size_t bodyOffset(std::size_t headBytes) {
  return sizeof(EntryHeader) + padded(headBytes);
}

// A 64-bit mix that finds torn and flipped bytes; no protection against an author.
uint64_t mixOf(std::span<const uint8_t> bytes, uint64_t seed);
uint64_t checksumOf(const SegmentHeader& header);
// Of the entry at `entry`, of `length` bytes, in the segment of that sequence number: what a
// recycled segment holds from before does not agree. headBytes must fit the length.
uint64_t checksumOf(const uint8_t* entry, std::size_t length, uint64_t sequence);

}  // namespace vx::lnx
