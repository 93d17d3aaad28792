// Where sessions keep what they received: memory that survives the process, where there is such.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

namespace vx {

// Gives out blocks under the name of an aggregate and the number of the block in it, so that the
// next process finds again what one that ended without a stop had kept. Thread-safe.
//
// Blocks that were released stay findable, and are not used again, before a snapshot of the
// service's state is complete that was begun after their release: until then the snapshot before it
// may have to be gone back to, and it names them. (Those that were acquired after it are named by
// none.) The same goes for the blocks of an earlier process that nobody asks for.
class AggregateMemory {
 public:
  struct Block {
    uint8_t* bytes = nullptr;
    std::size_t size = 0;
    bool survives = false;  // the process
  };

  virtual ~AggregateMemory() = default;
  // Somebody who pays for what is kept.
  using Payer = uint16_t;
  // Whoever the calling thread works for, and whether more may be kept for him.
  struct Account {
    Payer payer = 0;
    bool isFull = false;
  };
  virtual Account account() { return {}; }
  // So many bytes more are kept for him, or less: here, or in a session.
  virtual void charge(Payer /*payer*/, int64_t /*bytes*/) {}
  // Of a session: something is left out from here on (0), or so many messages were in all.
  virtual void leftOut(int64_t /*reporterID*/, uint64_t /*messages*/) {}
  // Not 0, and never given twice, by no other process either.
  virtual uint64_t nameAggregate() = 0;
  // Of `bytes` at least; what is in them is anything. Ordinals count from 0 without a gap. Never
  // without an answer: a block that does not survive where no other can be had.
  virtual Block acquire(uint64_t aggregate, uint32_t ordinal, std::size_t bytes) = 0;
  // From any thread.
  virtual void release(std::span<const Block> blocks) = 0;

  // In a recovery, once for an aggregate: its blocks in order, as many as hold its first `bytes`
  // bytes, fewer where the next one is not there. They are the caller's, who may go on with
  // acquire() for the ordinals after them; those beyond are free at once.
  virtual std::vector<Block> find(uint64_t aggregate, std::size_t bytes) = 0;
  // The state of the service is about to be recorded; it is, and no earlier one is gone back to.
  // Without a completion a begun one counts for nothing.
  virtual void snapshotBegan() = 0;
  virtual void snapshotCompleted() = 0;
};

}  // namespace vx
