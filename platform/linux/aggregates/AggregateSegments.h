// The memory of the aggregates: files of tmpfs, so that it survives the process.
#pragma once

#include <array>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "base/Function.h"
#include "base/Mutex.h"
#include "base/Status.h"
#include "platform/AggregateMemory.h"
#include "platform/linux/aggregates/AggregateSegment.h"
#include "platform/linux/execution/UserAccounts.h"
#include "platform/linux/journal/JournalFolder.h"

namespace vx::lnx {

struct AggregateOptions {
  // The journal's: what is moved with it stays together.
  std::string folder;
  std::size_t maxBytes = std::size_t{192} << 20;  // of files
  // Runs work soon, on a thread that may be held up: giving memory back to the system takes half a
  // millisecond for each MiB. Without it that is done at once.
  Function<void(Function<void()> work)> runElsewhere{};
  UserAccounts* accounts = nullptr;  // of those who pay; without, nobody does
  Function<void(int64_t reporterID, uint64_t messages)> leftOut{};  // see AggregateMemory
};

struct AggregateCounters {
  uint64_t fileBytes = 0;
  uint64_t waitingBytes = 0;     // of blocks that the next complete snapshot makes free
  uint64_t unrecordedBytes = 0;  // of blocks that do not survive the process
  uint64_t aside = 0;            // files that were not understood
};

// Files of blocks, each of one size. A file whose blocks are all free goes back to the system.
// Beyond maxBytes, and where the files cannot be had, blocks are of the heap. Owned by the
// platform; thread-safe. Outlives every block and the work that runs elsewhere.
class AggregateSegments final : public AggregateMemory {
 public:
  explicit AggregateSegments(AggregateOptions options = {});

  // Takes over what an earlier process left. Without success, and before it, blocks are of the
  // heap. Files that are not understood are set aside; `complaints` names them.
  Status open(std::vector<std::string>& complaints);
  // Is told once, on the thread that asks for a block, of the first that does not survive.
  void setUnrecordedHandler(Function<void(const Status& why)> handler);
  // Nothing in the files is wanted by another process: a stop that has committed everything.
  void discard();
  AggregateCounters counters() const;
  // A snapshot names no block that is taken from here on.
  void snapshotTaken();
  // Files without a block in use go back to the system.
  void giveBack();

  Account account() override;
  void charge(Payer payer, int64_t bytes) override;
  void leftOut(int64_t reporterID, uint64_t messages) override;
  uint64_t nameAggregate() override;
  Block acquire(uint64_t aggregate, uint32_t ordinal, std::size_t bytes) override;
  void release(std::span<const Block> blocks) override;
  std::vector<Block> find(uint64_t aggregate, std::size_t bytes) override;
  void snapshotBegan() override;
  void snapshotCompleted() override;

 private:
  using Place = AggregateSegment::Place;
  using Segments = std::vector<std::unique_ptr<AggregateSegment>>;
  // Of blocks whose segments hold many: 512 bytes to 64 KiB, in powers of two.
  static constexpr std::size_t kSizes = 8;

  std::string adopt(const std::string& name) REQUIRES(mutex_);
  std::vector<Block> takeFound(uint64_t aggregate, std::size_t bytes) REQUIRES(mutex_);
  Result<Place> take(std::size_t bytes) REQUIRES(mutex_);
  Result<AggregateSegment*> grow(std::size_t blockBytes, uint32_t blocks) REQUIRES(mutex_);
  void add(std::unique_ptr<AggregateSegment> segment) REQUIRES(mutex_);
  Place placeOf(const Block& block) REQUIRES(mutex_);
  void makeFree(const Place& place) REQUIRES(mutex_);
  Segments takeUnused() REQUIRES(mutex_);
  void unmap(Segments unused) EXCLUDES(mutex_);

  const AggregateOptions options_;
  mutable Mutex mutex_;
  std::optional<JournalFolder> folder_ GUARDED_BY(mutex_);
  std::map<const uint8_t*, std::unique_ptr<AggregateSegment>> segments_ GUARDED_BY(mutex_);
  std::array<std::vector<AggregateSegment*>, kSizes> available_ GUARDED_BY(mutex_);  // have free
  std::array<std::size_t, kSizes> sizeBytes_ GUARDED_BY(mutex_){};                   // of files
  std::unordered_map<uint64_t, std::vector<Place>> adopted_ GUARDED_BY(mutex_);      // by aggregate
  std::vector<Place> released_ GUARDED_BY(mutex_);  // since the newest snapshot was begun
  std::vector<Place> cut_ GUARDED_BY(mutex_);       // before it
  bool adoptedCut_ GUARDED_BY(mutex_) = false;
  uint32_t snapshotsTaken_ GUARDED_BY(mutex_) = 1;  // 0: of an earlier process
  uint64_t named_ GUARDED_BY(mutex_);
  // Of the next file. A journal that is moved takes its files along, to where others may be.
  uint64_t nextFile_ GUARDED_BY(mutex_);
  uint32_t acquiresUntilGrowth_ GUARDED_BY(mutex_) = 0;
  AggregateCounters counters_ GUARDED_BY(mutex_);
  Function<void(const Status&)> onUnrecorded_ GUARDED_BY(mutex_);
};

}  // namespace vx::lnx
