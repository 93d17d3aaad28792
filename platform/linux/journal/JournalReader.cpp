#include "platform/linux/journal/JournalReader.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "propertylist/PlacedPayload.h"

namespace vx::lnx {

namespace {

// Reads an entry that begins `bytes`; none when it is not to be believed.
std::optional<JournalReader::Entry> entryAt(std::span<const uint8_t> bytes, uint64_t sequence) {
  JournalReader::Entry entry;
  EntryHeader& header = entry.header;
  std::memcpy(&header, bytes.data(), sizeof header);
  const std::size_t length = header.length;
  if (length < sizeof header || length > kMaxEntryBytes || length > bytes.size())
    return std::nullopt;
  if (header.headBytes > length - sizeof header || bodyOffset(header.headBytes) > length)
    return std::nullopt;
  if (header.checksum != checksumOf(bytes.data(), length, sequence)) return std::nullopt;
  if (header.type < EntryType::Call || header.type > EntryType::SnapshotComplete)
    return std::nullopt;
  entry.head = bytes.subspan(sizeof header, header.headBytes);
  entry.body = bytes.subspan(bodyOffset(header.headBytes));
  entry.body = entry.body.first(length - bodyOffset(header.headBytes));
  if ((header.flags & EntryHeader::kEmptyDictionary) != 0) entry.dictionary = Payload();
  if ((header.flags & EntryHeader::kDictionary) == 0) return entry;
  if (entry.body.size() < PlacedPayload::kHeaderBytes ||
      PlacedPayload::sizeAt(entry.body.data()) != entry.body.size() - PlacedPayload::kHeaderBytes)
    return std::nullopt;
  entry.dictionary = Payload::decode(entry.body.subspan(PlacedPayload::kHeaderBytes));
  if (!entry.dictionary) return std::nullopt;
  return entry;
}

// False: it is shorter, or cannot be read, which errno says.
bool readWhole(int fd, std::vector<uint8_t>& bytes) {
  errno = 0;
  bytes.resize(kSegmentBytes);
  std::size_t have = 0;
  while (have < bytes.size()) {
    const ssize_t got =
        pread(fd, bytes.data() + have, bytes.size() - have, static_cast<off_t>(have));
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) return false;
    have += static_cast<std::size_t>(got);
  }
  return true;
}

struct Source {
  SegmentHeader header;
  std::string name;
};

void give(JournalContents& contents, const JournalReader::Entry& entry,
          const SegmentHeader& segment) {
  const EntryHeader& header = entry.header;
  JournalContents::Record record;
  record.type = header.type;
  record.kind = header.kind;
  record.done = header.waiting == 0 || (header.waiting & EntryHeader::kWasDone) != 0;
  record.generation = segment.generation;
  record.place = {segment.sequence, entry.offset};
  record.call = header.call;
  record.time = header.time;
  record.connection = header.connection;
  record.head.assign(entry.head.begin(), entry.head.end());
  record.dictionary = entry.dictionary;
  contents.records.push_back(std::move(record));
}

// To its call; one whose call is not there has nothing to say.
void giveNote(JournalContents& contents, const JournalReader::Entry& entry) {
  const auto call = std::ranges::lower_bound(contents.records, entry.header.call, {},
                                             &JournalContents::Record::call);
  if (call == contents.records.end() || call->call != entry.header.call) return;
  call->notes.push_back({entry.header.kind, {entry.body.begin(), entry.body.end()}});
}

}  // namespace

JournalReader::Segment JournalReader::readSegment(std::span<const uint8_t> bytes) {
  Segment segment;
  if (bytes.size() < kFirstEntry) return segment;
  SegmentHeader header;
  std::memcpy(&header, bytes.data(), sizeof header);
  std::size_t at = kFirstEntry;
  uint64_t next = header.firstCall;  // the lowest number that a call may have
  while (bytes.size() - at >= sizeof(EntryHeader)) {
    uint32_t length;
    std::memcpy(&length, bytes.data() + at, sizeof length);
    // The end, unless something follows that only this segment can hold.
    if (length == 0 &&
        nextEntry(bytes, at + kEntryAlignment, header.sequence, next) == bytes.size())
      return segment;
    std::optional<Entry> entry = entryAt(bytes.subspan(at), header.sequence);
    const bool note = entry && entry->header.type == EntryType::Note;
    if (!entry || (note ? entry->header.call >= next : entry->header.call < next)) {
      const std::size_t torn = at;
      at = nextEntry(bytes, at + kEntryAlignment, header.sequence, next);
      segment.tornBytes += at - torn;
      continue;
    }
    if (!note) next = entry->header.call + 1;
    entry->offset = static_cast<uint32_t>(at);
    segment.entries.push_back(*std::move(entry));
    at = std::min(at + padded(length), bytes.size());
  }
  return segment;
}

// Where the next call begins that is to be believed; the end when there is none. What an earlier
// use of the file left has another sequence number, so that no checksum of it agrees.
std::size_t JournalReader::nextEntry(std::span<const uint8_t> bytes, std::size_t at,
                                     uint64_t sequence, uint64_t firstCall) {
  for (std::size_t searched = 0; at + sizeof(EntryHeader) <= bytes.size(); at += kEntryAlignment) {
    uint32_t length;
    std::memcpy(&length, bytes.data() + at, sizeof length);
    if (length < sizeof(EntryHeader) || length > bytes.size() - at) continue;
    searched += length;
    if (searched > kMostSearched) break;
    const std::optional<Entry> entry = entryAt(bytes.subspan(at), sequence);
    if (entry && entry->header.type != EntryType::Note && entry->header.call >= firstCall)
      return at;
  }
  return bytes.size();
}

Result<JournalContents> JournalReader::read(const std::string& path, const JournalEpoch& epoch) {
  Result<JournalFolder> folder = JournalFolder::open(path, JournalFolder::IfMissing::Fail);
  if (!folder.ok()) return folder.status();
  JournalContents contents;
  std::vector<Source> sources;
  for (const std::string& name : folder->segments()) {
    const auto opened = folder->openSegment(name, JournalFolder::Access::Read);
    if (!opened.ok() && isOfTheMoment(opened.status())) return opened.status();
    if (!opened.ok())
      contents.refused.push_back(opened.status().text());
    else if (opened->header.state != SegmentHeader::kFree && opened->header.epoch != epoch)
      contents.refused.push_back(name + " is of another store");
    else if (opened->header.state != SegmentHeader::kFree)
      sources.push_back({opened->header, name});
  }
  std::ranges::stable_sort(sources, {}, [](const Source& s) { return s.header.sequence; });
  // A move that was interrupted leaves a segment twice.
  const auto twice =
      std::ranges::unique(sources, {}, [](const Source& s) { return s.header.sequence; });
  sources.erase(twice.begin(), twice.end());

  std::vector<uint8_t> bytes;
  uint64_t last = 0;
  for (const Source& source : sources) {
    contents.next.goPast(source.header);
    const auto opened = folder->openSegment(source.name, JournalFolder::Access::Read);
    if (!opened.ok() || !readWhole(opened->fd.get(), bytes)) {
      Status failed =
          opened.ok() ? Status::lastError("cannot read " + source.name) : opened.status();
      if (isOfTheMoment(failed)) return failed;
      contents.refused.push_back(source.name + " cannot be read");
      continue;
    }
    const Segment segment = readSegment(bytes);
    contents.tornBytes += segment.tornBytes;
    if (segment.tornBytes > 0) contents.torn.push_back(source.name);
    contents.entries += segment.entries.size();
    for (const Entry& entry : segment.entries) {
      if (entry.header.type == EntryType::Note) {
        giveNote(contents, entry);
        continue;
      }
      if (entry.header.call <= last) continue;  // a header that is damaged and agrees
      last = entry.header.call;
      if (entry.header.type == EntryType::SnapshotComplete)
        contents.base = std::max(contents.base, source.header.generation);
      else
        give(contents, entry, source.header);
    }
  }
  std::erase_if(contents.records, [&](JournalContents::Record& record) {
    record.beforeSnapshot = record.generation < contents.base;
    if (record.type == EntryType::Snapshot) return record.generation != contents.base;
    return record.beforeSnapshot && record.done;
  });
  return contents;
}

}  // namespace vx::lnx
