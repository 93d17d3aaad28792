#include "platform/linux/aggregates/AggregateSegments.h"

#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <bit>
#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <random>
#include <utility>

#include "platform/linux/execution/CauseScope.h"

namespace vx::lnx {

namespace {

constexpr std::string_view kPrefix = "aggregate-";
constexpr std::string_view kSuffix = ".vxa";
constexpr std::size_t kSmallest = AggregateSegment::kSmallest;
constexpr std::size_t kLargest = AggregateSegment::kLargestShared;
constexpr std::size_t kPage = 4096;
// Of a segment: as much as there is of its kind, within these.
constexpr std::size_t kLeastBytes = 64 << 10;
constexpr std::size_t kMostBytes = 2 << 20;
// How many blocks are of the heap before a file system that was full is tried again: an attempt
// that fails costs milliseconds.
constexpr uint32_t kAcquiresBetweenGrowths = 256;

std::size_t sizeIndex(std::size_t blockBytes) {
  return static_cast<std::size_t>(std::bit_width((blockBytes - 1) / kSmallest));
}

// Where names begin, so that no two processes agree.
uint64_t byChance() {
  std::random_device random;
  return uint64_t{random()} << 32 | random();
}

}  // namespace

AggregateSegments::AggregateSegments(AggregateOptions options)
    : options_(std::move(options)), named_(byChance()), nextFile_(byChance()) {}

// ---------------------------------------------------------------------------------------------------------------------
// What an earlier process left

Status AggregateSegments::open(std::vector<std::string>& complaints) {
  Result<JournalFolder> opened =
      JournalFolder::open(options_.folder, JournalFolder::IfMissing::Create);
  if (!opened.ok()) return opened.status();
  Segments unused;
  std::error_code error;
  std::vector<std::string> names;
  for (std::filesystem::directory_iterator at(options_.folder, error), end; !error && at != end;
       at.increment(error)) {
    std::string name = at->path().filename();
    if (name.starts_with(kPrefix) && name.ends_with(AggregateSegment::kNew))
      std::filesystem::remove(at->path(), error);  // its process ended while it was made
    else if (name.starts_with(kPrefix) && name.ends_with(kSuffix))
      names.push_back(std::move(name));
  }
  {
    MutexLock lock(mutex_);
    folder_ = std::move(opened).value();
    for (const std::string& name : names) {
      if (std::string complaint = adopt(name); !complaint.empty())
        complaints.push_back(std::move(complaint));
    }
    unused = takeUnused();
  }
  unmap(std::move(unused));
  return {};
}

// What there is to say when the file had to be set aside.
std::string AggregateSegments::adopt(const std::string& name) {
  Result<std::unique_ptr<AggregateSegment>> adopted =
      AggregateSegment::adopt(options_.folder + "/" + name);
  if (!adopted.ok()) {
    ++counters_.aside;
    return adopted.status().text() +
           (folder_->setAside(name) ? "; set aside" : "; it could not be set aside");
  }
  AggregateSegment* const segment = adopted->get();
  add(std::move(adopted).value());
  for (uint32_t index = 0; index < segment->blocks(); ++index) {
    const uint64_t aggregate = segment->header(index).aggregate;
    if (aggregate == 0)
      makeFree({segment, index});
    else
      adopted_[aggregate].push_back({segment, index});
  }
  return {};
}

std::vector<AggregateMemory::Block> AggregateSegments::find(uint64_t aggregate, std::size_t bytes) {
  std::vector<Block> blocks;
  Segments unused;
  {
    MutexLock lock(mutex_);
    blocks = takeFound(aggregate, bytes);
    unused = takeUnused();
  }
  unmap(std::move(unused));
  return blocks;
}

std::vector<AggregateMemory::Block> AggregateSegments::takeFound(uint64_t aggregate,
                                                                 std::size_t bytes) {
  const auto found = adopted_.find(aggregate);
  if (found == adopted_.end()) return {};
  std::vector<Place> places = std::move(found->second);
  adopted_.erase(found);
  const auto ordinal = [](const Place& place) {
    return place.segment->header(place.index).ordinal;
  };
  std::ranges::sort(places, {}, ordinal);
  std::vector<Block> blocks;
  std::size_t have = 0;
  for (const Place& place : places) {
    if (have >= bytes || ordinal(place) != blocks.size()) {
      makeFree(place);
      continue;
    }
    place.segment->header(place.index).taken = 0;
    blocks.push_back({place.segment->contents(place.index), place.segment->capacity(), true});
    have += blocks.back().size;
  }
  return blocks;
}

// ---------------------------------------------------------------------------------------------------------------------
// Blocks

void AggregateSegments::setUnrecordedHandler(Function<void(const Status& why)> handler) {
  MutexLock lock(mutex_);
  onUnrecorded_ = std::move(handler);
}

AggregateMemory::Account AggregateSegments::account() {
  const UserIndex user = CauseScope::currentUser();
  return {user, options_.accounts != nullptr && options_.accounts->isFull(user)};
}

void AggregateSegments::charge(Payer payer, int64_t bytes) {
  if (options_.accounts == nullptr) return;
  if (bytes >= 0)
    options_.accounts->add(payer, MemoryKind::Kept, static_cast<std::size_t>(bytes));
  else
    options_.accounts->remove(payer, MemoryKind::Kept, static_cast<std::size_t>(-bytes));
}

// What a call that is run again says, it has said before.
void AggregateSegments::leftOut(int64_t reporterID, uint64_t messages) {
  const JournalTicket* const call = CauseScope::current();
  if (options_.leftOut && (call == nullptr || !call->wasDone()))
    options_.leftOut(reporterID, messages);
}

uint64_t AggregateSegments::nameAggregate() {
  MutexLock lock(mutex_);
  while (++named_ == 0 || adopted_.contains(named_)) {
  }
  return named_;
}

AggregateMemory::Block AggregateSegments::acquire(uint64_t aggregate, uint32_t ordinal,
                                                  std::size_t bytes) {
  Status why;
  Function<void(const Status&)> onUnrecorded;
  {
    MutexLock lock(mutex_);
    const Result<Place> taken = take(bytes + sizeof(AggregateSegment::BlockHeader));
    if (taken.ok()) {
      AggregateSegment::BlockHeader& header = taken->segment->header(taken->index);
      header.ordinal = ordinal;
      header.taken = snapshotsTaken_;
      std::atomic_ref<uint64_t>(header.aggregate).store(aggregate, std::memory_order_release);
      return {taken->segment->contents(taken->index), taken->segment->capacity(), true};
    }
    counters_.unrecordedBytes += bytes;
    why = taken.status();
    std::swap(onUnrecorded, onUnrecorded_);
  }
  if (onUnrecorded) onUnrecorded(why);
  return {new uint8_t[bytes], bytes, false};
}

Result<AggregateSegment::Place> AggregateSegments::take(std::size_t bytes) {
  if (bytes > kLargest) {
    const Result<AggregateSegment*> made = grow((bytes + kPage - 1) / kPage * kPage, 1);
    if (!made.ok()) return made.status();
    return Place{*made, (*made)->take()};
  }
  const std::size_t size = sizeIndex(bytes);
  std::vector<AggregateSegment*>& available = available_[size];
  if (available.empty()) {
    const std::size_t blockBytes = kSmallest << size;
    const std::size_t wanted = std::clamp(sizeBytes_[size], kLeastBytes, kMostBytes);
    const Result<AggregateSegment*> made =
        grow(blockBytes, static_cast<uint32_t>(wanted / blockBytes));
    if (!made.ok()) return made.status();
    available.push_back(*made);
  }
  AggregateSegment* const segment = available.back();
  const Place place{segment, segment->take()};
  if (!segment->hasFree()) available.pop_back();
  return place;
}

// A new file. None of its blocks has been told to be available.
Result<AggregateSegment*> AggregateSegments::grow(std::size_t blockBytes, uint32_t blocks) {
  if (!folder_) return Status::failure("there is no memory that survives the process");
  const std::size_t bytes = AggregateSegment::fileBytes(blockBytes, blocks);
  if (counters_.fileBytes + bytes > options_.maxBytes)
    return Status::posix("cannot enlarge the memory of the aggregates", ENOSPC);
  if (acquiresUntilGrowth_ > 0) {
    --acquiresUntilGrowth_;
    return Status::posix("cannot enlarge the memory of the aggregates", ENOSPC);
  }
  for (;;) {
    char number[17];
    std::snprintf(number, sizeof number, "%016llx", static_cast<unsigned long long>(nextFile_++));
    const std::string path =
        options_.folder + "/" + std::string(kPrefix) + number + std::string(kSuffix);
    Result<std::unique_ptr<AggregateSegment>> made =
        AggregateSegment::create(path, blockBytes, blocks);
    if (!made.ok() && made.status().code() == EEXIST) continue;
    if (!made.ok()) {
      acquiresUntilGrowth_ = kAcquiresBetweenGrowths;
      return made.status();
    }
    AggregateSegment* const segment = made->get();
    add(std::move(made).value());
    return segment;
  }
}

void AggregateSegments::add(std::unique_ptr<AggregateSegment> segment) {
  counters_.fileBytes += segment->bytes();
  if (segment->blockBytes() <= kLargest)
    sizeBytes_[sizeIndex(segment->blockBytes())] += segment->bytes();
  segments_.emplace(segment->base(), std::move(segment));
}

void AggregateSegments::release(std::span<const Block> blocks) {
  MutexLock lock(mutex_);
  for (const Block& block : blocks) {
    if (!block.survives) {
      counters_.unrecordedBytes -= block.size;
      delete[] block.bytes;
      continue;
    }
    const Place place = placeOf(block);
    if (place.segment->header(place.index).taken == snapshotsTaken_) {
      makeFree(place);
    } else {
      released_.push_back(place);
      counters_.waitingBytes += block.size;
    }
  }
}

AggregateSegment::Place AggregateSegments::placeOf(const Block& block) {
  AggregateSegment* const segment = std::prev(segments_.upper_bound(block.bytes))->second.get();
  return {segment, segment->indexOf(block.bytes)};
}

// Of one of the usual sizes: to be taken again.
void AggregateSegments::makeFree(const Place& place) {
  AggregateSegment* const segment = place.segment;
  if (!segment->hasFree() && segment->blockBytes() <= kLargest)
    available_[sizeIndex(segment->blockBytes())].push_back(segment);
  segment->makeFree(place.index);
}

// ---------------------------------------------------------------------------------------------------------------------
// Snapshots

void AggregateSegments::snapshotBegan() {
  MutexLock lock(mutex_);
  cut_.insert(cut_.end(), released_.begin(), released_.end());
  released_.clear();
  adoptedCut_ = true;
}

void AggregateSegments::snapshotTaken() {
  MutexLock lock(mutex_);
  ++snapshotsTaken_;
}

void AggregateSegments::giveBack() {
  Segments unused;
  {
    MutexLock lock(mutex_);
    unused = takeUnused();
  }
  unmap(std::move(unused));
}

void AggregateSegments::snapshotCompleted() {
  Segments unused;
  {
    MutexLock lock(mutex_);
    for (const Place& place : cut_) {
      counters_.waitingBytes -= place.segment->capacity();
      makeFree(place);
    }
    cut_.clear();
    if (adoptedCut_) {
      for (const auto& [aggregate, places] : adopted_)
        for (const Place& place : places) makeFree(place);
      adopted_.clear();
    }
    unused = takeUnused();
  }
  unmap(std::move(unused));
}

// Their files are gone. Their memory counts until it is.
AggregateSegments::Segments AggregateSegments::takeUnused() {
  for (std::vector<AggregateSegment*>& available : available_)
    std::erase_if(available, [](const AggregateSegment* segment) { return segment->isUnused(); });
  Segments unused;
  for (auto at = segments_.begin(); at != segments_.end();) {
    const AggregateSegment& segment = *at->second;
    if (!segment.isUnused()) {
      ++at;
      continue;
    }
    if (segment.blockBytes() <= kLargest)
      sizeBytes_[sizeIndex(segment.blockBytes())] -= segment.bytes();
    unlink(segment.path().c_str());
    unused.push_back(std::move(at->second));
    at = segments_.erase(at);
  }
  acquiresUntilGrowth_ = 0;
  return unused;
}

void AggregateSegments::unmap(Segments unused) {
  if (unused.empty()) return;
  Function<void()> work = [this, unused = std::move(unused)]() mutable {
    for (std::unique_ptr<AggregateSegment>& segment : unused) {
      const std::size_t bytes = segment->bytes();
      segment.reset();
      MutexLock lock(mutex_);
      counters_.fileBytes -= bytes;
    }
  };
  if (options_.runElsewhere)
    options_.runElsewhere(std::move(work));
  else
    work();
}

void AggregateSegments::discard() {
  MutexLock lock(mutex_);
  for (const auto& [base, segment] : segments_) unlink(segment->path().c_str());
  folder_.reset();
}

AggregateCounters AggregateSegments::counters() const {
  MutexLock lock(mutex_);
  return counters_;
}

}  // namespace vx::lnx
