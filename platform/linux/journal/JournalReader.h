// What a journal holds when its process has ended.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "base/Status.h"
#include "platform/linux/journal/JournalFolder.h"
#include "propertylist/Payload.h"

namespace vx::lnx {

struct JournalContents {
  struct Note {
    uint8_t kind = 0;
    std::vector<uint8_t> bytes;
  };
  struct Record {
    EntryType type = EntryType::Call;  // Call or Snapshot
    uint8_t kind = 0;
    bool done = false;            // nothing waits because of this call
    bool beforeSnapshot = false;  // its effect on live state is in the snapshot
    uint32_t generation = 0;
    uint64_t call = 0;
    double time = 0;
    uint64_t connection = 0;
    JournalPlace place;
    std::vector<uint8_t> head;
    std::optional<Payload> dictionary;  // lies on the heap
    std::vector<Note> notes;
  };
  JournalNumbers next;               // beyond all that is here
  std::vector<Record> records;       // by call number
  uint32_t base = 0;                 // the generation whose snapshot counts; 0: none does
  uint64_t entries = 0;              // read, also those that are not given
  uint64_t tornBytes = 0;            // from entries that are not believed to the next that is
  std::vector<std::string> torn;     // the files that they are in
  std::vector<std::string> refused;  // files that are not this journal's, and why
};

// Reads the folder of a process that has ended, or one that a journal was moved to. Believes no
// length, checksum or dictionary before it has been checked: of a segment it gives the entries
// before and after what is torn. Stateless; the caller's thread. Bounds: one segment's bytes beside
// what it gives; looking for an entry after what is torn ends after kMostSearched bytes.
class JournalReader {
 public:
  // The base is the newest generation with a complete snapshot. It is given whole; of the calls
  // before it those that are not done; snapshots that are older or incomplete are not given. A
  // failure when a file cannot be read at this moment.
  static Result<JournalContents> read(const std::string& folder, const JournalEpoch& epoch);

  // One segment's bytes, of any length. Views of them.
  struct Entry {
    EntryHeader header;
    uint32_t offset = 0;
    std::span<const uint8_t> head;
    std::span<const uint8_t> body;  // of a note
    std::optional<Payload> dictionary;
  };
  struct Segment {
    std::vector<Entry> entries;
    std::size_t tornBytes = 0;
  };
  static Segment readSegment(std::span<const uint8_t> bytes);

 private:
  static constexpr std::size_t kMostSearched = std::size_t{64} << 20;
  static std::size_t nextEntry(std::span<const uint8_t> bytes, std::size_t at, uint64_t sequence,
                               uint64_t firstCall);
};

}  // namespace vx::lnx
