#include "platform/linux/journal/Journal.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstring>

#include "propertylist/PlacedPayload.h"

namespace vx::lnx {

namespace {

// How many appends are refused before a file system that was full is tried again: an attempt that
// fails costs milliseconds.
constexpr uint32_t kAppendsBetweenGrowths = 256;
constexpr std::size_t kMinSegments = 4;
constexpr std::size_t kSpares = 2;  // that are kept free, once a second segment was needed

void store(uint32_t& word, uint32_t value, std::memory_order order) {
  std::atomic_ref<uint32_t>(word).store(value, order);
}

void copyTo(uint8_t* to, std::span<const uint8_t> bytes) {
  if (!bytes.empty()) std::memcpy(to, bytes.data(), bytes.size());
}

}  // namespace

// --------------------------------------------------------------------------------- open and close

Result<std::unique_ptr<Journal>> Journal::open(JournalOptions options,
                                               std::vector<std::string>* complaints) {
  Result<JournalFolder> folder =
      JournalFolder::open(options.folder, JournalFolder::IfMissing::Create);
  if (!folder.ok()) return folder.status();
  PlacedPayload::setOwner([](void* place) { JournalSegment::of(place)->payloadReleased(); });
  options.maxBytes = std::max(options.maxBytes, kMinSegments * kSegmentBytes);
  std::unique_ptr<Journal> journal(new Journal(std::move(options), std::move(folder).value()));
  for (const std::string& name : journal->folder_.segments()) {
    Result<std::string> complaint = journal->adopt(name);
    if (!complaint.ok()) return complaint.status();
    if (!complaint->empty() && complaints != nullptr) complaints->push_back(*std::move(complaint));
  }
  journal->sortAdopted();
  (void)journal->lookForCapacity();
  return journal;
}

Journal::Journal(JournalOptions options, JournalFolder folder)
    : options_(std::move(options)), folder_(std::move(folder)), next_(options_.first) {}

// Takes over a file that is there; what there is to say when it had to be set aside. A failure when
// that cannot be told at this moment.
Result<std::string> Journal::adopt(const std::string& name) {
  MutexLock lock(mutex_);
  Result<JournalFolder::Opened> opened = folder_.openSegment(name, JournalFolder::Access::Write);
  const SegmentHeader header = opened.ok() ? opened->header : SegmentHeader{};
  if (opened.ok() && header.state == SegmentHeader::kFree) {
    folder_.remove(name);
    // The process ended just then, or somebody emptied it.
    return opened->blank ? name + " is blank; removed" : std::string();
  }
  if (!opened.ok() && isOfTheMoment(opened.status())) return opened.status();
  std::string why = opened.ok() ? name + " is of another store" : opened.status().text();
  if (opened.ok() && header.epoch == options_.epoch) {
    next_.goPast(header);
    Result<JournalSegment::Pointer> segment = JournalSegment::map(std::move(opened->fd), name);
    if (segment.ok()) {
      sealed_.push_back(std::move(segment).value());
      return std::string();
    }
    if (isOfTheMoment(segment.status())) return segment.status();
    why = segment.status().text();
  }
  if (!folder_.setAside(name)) return why + "; it could not be set aside";
  ++counters_.aside;
  return why + "; set aside";
}

Journal::~Journal() {
  MutexLock lock(mutex_);
  if (active_ != nullptr) active_->seal(callsInActive_, payloadsInActive_);
}

// Files are numbered in the order in which they were made, and used again in another.
void Journal::sortAdopted() {
  MutexLock lock(mutex_);
  std::ranges::stable_sort(
      sealed_, {}, [](const JournalSegment::Pointer& segment) { return segment->sequence(); });
}

JournalTicket Journal::resume(JournalPlace place) {
  MutexLock lock(mutex_);
  const auto segment = std::ranges::lower_bound(
      sealed_, place.sequence, {},
      [](const JournalSegment::Pointer& sealed) { return sealed->sequence(); });
  if (segment == sealed_.end() || (*segment)->sequence() != place.sequence) return {};
  if (place.offset < kFirstEntry || place.offset > kSegmentBytes - sizeof(EntryHeader)) return {};
  auto* const entry = reinterpret_cast<EntryHeader*>((*segment)->at(place.offset));
  const bool done = entry->waiting == 0 || (entry->waiting & EntryHeader::kWasDone) != 0;
  store(entry->waiting, done ? EntryHeader::kWasDone | 1 : 1, std::memory_order_relaxed);
  (*segment)->resumeCall();
  return JournalTicket(entry);
}

void Journal::setCallsDoneHandler(void (*handler)(void*), void* with) {
  JournalSegment::setCallsDoneHandler(handler, with);
}

bool Journal::earlierCallsAreDone() const {
  MutexLock lock(mutex_);
  return std::ranges::none_of(sealed_, [this](const auto& segment) REQUIRES(mutex_) {
    return segment->generation() < next_.generation && segment->hasUndoneCalls();
  });
}

void Journal::discard() {
  MutexLock lock(mutex_);
  discarded_ = true;
  offset_ = kSegmentBytes;
  if (active_ != nullptr) folder_.remove(active_->name());
  for (const auto* list : {&lingering_, &free_})
    for (const JournalSegment::Pointer& segment : *list) folder_.remove(segment->name());
  for (const JournalSegment::Pointer& segment : sealed_) folder_.remove(segment->name());
  folder_.clearAttempts();
}

// ---------------------------------------------------------------------------------------- entries

Result<JournalAppended> Journal::append(const JournalRecord& record) {
  MutexLock lock(mutex_);
  return write(record, EntryType::Call, Use::Calls);
}

Result<JournalAppended> Journal::appendEnd(const JournalRecord& record) {
  MutexLock lock(mutex_);
  return write(record, EntryType::Call, Use::Ends);
}

Result<JournalAppended> Journal::appendToSnapshot(const JournalRecord& record) {
  MutexLock lock(mutex_);
  if (!inSnapshot_) return Status::failure("no snapshot has been begun");
  return write(record, EntryType::Snapshot, Use::Snapshot);
}

Status Journal::endSnapshot() {
  MutexLock lock(mutex_);
  if (!inSnapshot_) return Status::failure("no snapshot has been begun");
  const Result<JournalAppended> end = write({}, EntryType::SnapshotComplete, Use::Snapshot);
  if (!end.ok()) return end.status();
  inSnapshot_ = false;
  base_ = next_.generation;
  recycle();
  updateCapacity();
  return {};
}

Result<JournalAppended> Journal::write(const JournalRecord& record, EntryType type, Use use) {
  const bool placed = record.dictionary.has_value() && !record.dictionary->bytes.empty();
  const std::size_t body = bodyOffset(record.head.size());
  const std::size_t length =
      body + (placed ? PlacedPayload::kHeaderBytes + record.dictionary->bytes.size() : 0);
  Status status;
  EntryHeader* const entry = reserve(length, use, status);
  if (entry == nullptr) return status;
  uint8_t* const bytes = reinterpret_cast<uint8_t*>(entry);
  entry->waiting = type == EntryType::Call ? 1 : 0;
  entry->call = next_.call;
  entry->time = record.time;
  entry->connection = record.connection;
  entry->user = record.user;
  entry->headBytes = static_cast<uint32_t>(record.head.size());
  entry->kind = record.kind;
  entry->type = type;
  entry->flags = placed               ? EntryHeader::kDictionary
                 : !record.dictionary ? uint8_t{0}
                                      : EntryHeader::kEmptyDictionary;
  if (record.forEarlier) entry->flags |= EntryHeader::kForEarlier;
  std::ranges::fill(entry->reserved, uint8_t{0});
  std::memset(bytes + body - kEntryAlignment, 0, record.head.empty() ? 0 : kEntryAlignment);
  copyTo(bytes + sizeof(EntryHeader), record.head);
  JournalAppended appended;
  appended.call = next_.call++;
  if (placed) {
    appended.dictionary = PlacedPayload::at(bytes + body, *record.dictionary);
    ++payloadsInActive_;
  }
  if (type == EntryType::Call) {
    appended.ticket = JournalTicket(entry);
    ++callsInActive_;
  }
  publish(entry, length);
  return appended;
}

Status Journal::note(const JournalTicket& ticket, uint8_t kind, std::span<const uint8_t> bytes) {
  if (!ticket) return Status::failure("a note without its call");
  MutexLock lock(mutex_);
  const std::size_t length = bodyOffset(0) + bytes.size();
  Status status;
  EntryHeader* const entry = reserve(length, Use::Ends, status);
  if (entry == nullptr) return status;
  *entry = {};
  entry->call = ticket.call();
  entry->kind = kind;
  entry->type = EntryType::Note;
  copyTo(reinterpret_cast<uint8_t*>(entry) + bodyOffset(0), bytes);
  publish(entry, length);
  return {};
}

// The place of an entry of `length` bytes, whose length word is 0; null and why when there is none.
inline EntryHeader* Journal::reserve(std::size_t length, Use use, Status& status) {
  if (length > kMaxEntryBytes) [[unlikely]] {
    status = Status::posix("cannot record a call", EMSGSIZE);
    return nullptr;
  }
  if (kSegmentBytes - offset_ < padded(length)) [[unlikely]] {
    status = roll(use);
    if (!status.ok()) return nullptr;
  }
  // With the length of the next one.
  const std::size_t end = std::min(offset_ + padded(length) + kEntryAlignment, kSegmentBytes);
  status = active_->allocate(end);
  if (!status.ok()) [[unlikely]] {
    ++counters_.full;
    return nullptr;
  }
  return reinterpret_cast<EntryHeader*>(active_->at(offset_));
}

// What was written at the end becomes an entry.
inline void Journal::publish(EntryHeader* entry, std::size_t length) {
  const uint8_t* const bytes = reinterpret_cast<const uint8_t*>(entry);
  entry->checksum = checksumOf(bytes, length, active_->sequence());
  offset_ += padded(length);
  if (offset_ < kSegmentBytes)
    store(reinterpret_cast<EntryHeader*>(active_->at(offset_))->length, 0,
          std::memory_order_relaxed);
  store(entry->length, static_cast<uint32_t>(length), std::memory_order_release);
  ++counters_.appended;
  bytesAppended_.store(bytesAppended() + length, std::memory_order_relaxed);
}

// --------------------------------------------------------------------------------------- segments

Status Journal::beginGeneration() {
  MutexLock lock(mutex_);
  ++next_.generation;
  Status rolled = roll(Use::Snapshot);
  if (!rolled.ok()) {
    --next_.generation;
    return rolled;
  }
  inSnapshot_ = true;
  return {};
}

// A new segment takes the place of the active one, which has no space left or is of a generation
// that has ended.
Status Journal::roll(Use use) {
  recycle();
  Result<JournalSegment::Pointer> next = acquire(use);
  if (!next.ok()) return next.status();
  severalNeeded_ = active_ != nullptr || !sealed_.empty();
  if (active_ != nullptr) {
    active_->seal(callsInActive_, payloadsInActive_);
    sealed_.push_back(std::move(active_));
  }
  active_ = std::move(next).value();
  active_->begin(options_.epoch, next_.generation, next_.sequence++, next_.call);
  offset_ = kFirstEntry;
  callsInActive_ = 0;
  payloadsInActive_ = 0;
  keepSpares();
  updateCapacity();
  return {};
}

bool Journal::isWithinShare(Use use) const {
  const std::size_t most = options_.maxBytes / kSegmentBytes;
  const std::size_t forOthers = use == Use::Calls ? most / 4 : use == Use::Ends ? 1 : 0;
  return segmentsInUse() < most - forOthers;
}

// Where the file system has become full there must be a segment for the calls that come next and
// one for the snapshot that makes the others free. Most processes need one segment, and have no
// spares.
void Journal::keepSpares() {
  if (!severalNeeded_) return;
  while (free_.size() < kSpares && isWithinShare(Use::Snapshot)) {
    Result<JournalSegment::Pointer> spare = grow(kSegmentBytes);
    if (!spare.ok()) return;
    free_.push_back(std::move(spare).value());
  }
}

void Journal::updateCapacity() {
  const bool spares = !severalNeeded_ || free_.size() >= kSpares || !isWithinShare(Use::Snapshot);
  full_.store(!isWithinShare(Use::Calls) || !spares, std::memory_order_relaxed);
}

bool Journal::lookForCapacity() {
  MutexLock lock(mutex_);
  appendsUntilGrowth_ = 0;
  recycle();
  keepSpares();
  updateCapacity();
  return hasCapacity();
}

void Journal::giveBack() {
  std::vector<JournalSegment::Pointer> free;  // unmapped without the lock
  MutexLock lock(mutex_);
  recycle();
  if (sealed_.empty() && lingering_.empty()) severalNeeded_ = false;
  const std::size_t kept = severalNeeded_ ? kSpares : 0;
  while (free_.size() > kept) {
    folder_.remove(free_.back()->name());
    free.push_back(std::move(free_.back()));
    free_.pop_back();
  }
  updateCapacity();
}

Result<JournalSegment::Pointer> Journal::acquire(Use use) {
  if (discarded_ || !isWithinShare(use)) return full("cannot record a call");
  const bool first = active_ == nullptr && sealed_.empty();
  if (free_.empty()) return grow(first ? JournalSegment::kStep : kSegmentBytes);
  // The last one is a snapshot's.
  if (use != Use::Snapshot && free_.size() == 1 && severalNeeded_) {
    if (Result<JournalSegment::Pointer> grown = grow(kSegmentBytes); grown.ok()) return grown;
    return full("cannot record a call");
  }
  JournalSegment::Pointer segment = std::move(free_.back());
  free_.pop_back();
  return segment;
}

Result<JournalSegment::Pointer> Journal::grow(std::size_t bytes) {
  if (appendsUntilGrowth_ > 0) {
    --appendsUntilGrowth_;
    return full("cannot enlarge the journal");
  }
  const std::string name = folder_.freshSegment(nextFile_);
  Result<UniqueFd> fd = folder_.createSegment(name, bytes);
  if (!fd.ok()) {
    appendsUntilGrowth_ = kAppendsBetweenGrowths;
    const int code = fd.status().code();
    if (code == ENOSPC || code == EDQUOT || code == EFBIG)
      return full("cannot enlarge the journal");
    return fd.status();
  }
  Result<JournalSegment::Pointer> segment = JournalSegment::map(std::move(fd).value(), name);
  if (!segment.ok()) folder_.remove(name);
  return segment;
}

Status Journal::full(std::string_view tried) {
  ++counters_.full;
  return Status::posix(tried, ENOSPC);
}

// In order, and no further than the first that is still wanted: notes lie behind their calls.
void Journal::recycle() {
  while (!sealed_.empty() && sealed_.front()->generation() < base_ &&
         !sealed_.front()->hasUndoneCalls()) {
    sealed_.front()->markFree();
    lingering_.push_back(std::move(sealed_.front()));
    sealed_.pop_front();
    ++counters_.recycled;
  }
  std::erase_if(lingering_, [this](JournalSegment::Pointer& segment) REQUIRES(mutex_) {
    if (segment->hasPayloads()) return false;
    makeFree(std::move(segment));
    return true;
  });
}

void Journal::makeFree(JournalSegment::Pointer segment) {
  if (free_.size() < options_.maxFree)
    free_.push_back(std::move(segment));
  else
    folder_.remove(segment->name());
}

// Those that hold something.
std::size_t Journal::segmentsInUse() const {
  return (active_ != nullptr ? 1 : 0) + sealed_.size() + lingering_.size();
}

bool Journal::allDone() const {
  MutexLock lock(mutex_);
  const auto undone = [](const JournalSegment::Pointer& segment) {
    return segment->hasUndoneCalls();
  };
  return (active_ == nullptr || !active_->hasUndoneCallsOf(callsInActive_)) &&
         std::ranges::none_of(sealed_, undone);
}

JournalCounters Journal::counters() const {
  MutexLock lock(mutex_);
  JournalCounters counters = counters_;
  counters.segmentsInUse = segmentsInUse();
  counters.bytes = bytesAppended();
  return counters;
}

}  // namespace vx::lnx
