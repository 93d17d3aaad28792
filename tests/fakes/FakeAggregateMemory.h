// Blocks that a test finds again, as the next process would.
#pragma once

#include <algorithm>
#include <atomic>
#include <deque>
#include <map>
#include <mutex>
#include <utility>

#include "platform/AggregateMemory.h"

namespace vx::fakes {

class FakeAggregateMemory final : public AggregateMemory {
 public:
  Account account() override { return {payer, full}; }
  void charge(Payer who, int64_t bytes) override {
    const std::lock_guard lock(mutex_);
    charged[who] += bytes;
  }
  void leftOut(int64_t reporterID, uint64_t messages) override {
    told.emplace_back(reporterID, messages);
  }
  uint64_t nameAggregate() override {
    const std::lock_guard lock(mutex_);
    return ++named;
  }
  Block acquire(uint64_t aggregate, uint32_t ordinal, std::size_t bytes) override {
    const std::lock_guard lock(mutex_);
    bytes = std::max(bytes, least);
    std::vector<uint8_t>& memory = memory_.emplace_back(bytes, fill);
    ++held;
    return blocks[{aggregate, ordinal}] = {memory.data(), bytes, ordinal < surviving};
  }
  void release(std::span<const Block> released) override {
    const std::lock_guard lock(mutex_);
    held -= released.size();
  }
  std::vector<Block> find(uint64_t aggregate, std::size_t bytes) override {
    const std::lock_guard lock(mutex_);
    std::vector<Block> found;
    for (std::size_t have = 0; have < bytes; have += found.back().size) {
      const auto at = blocks.find({aggregate, static_cast<uint32_t>(found.size())});
      if (at == blocks.end() || !at->second.survives) break;
      found.push_back(at->second);
    }
    held += found.size();
    return found;
  }
  void snapshotBegan() override {}
  void snapshotCompleted() override {}

  std::map<std::pair<uint64_t, uint32_t>, Block> blocks;  // by aggregate and ordinal; ever
  Payer payer = 0;
  std::atomic<bool> full{false};
  std::map<Payer, int64_t> charged;
  std::vector<std::pair<int64_t, uint64_t>> told;  // of what was left out
  std::size_t held = 0;
  std::size_t least = 0;  // of a block
  uint8_t fill = 0xA5;    // what a new one holds
  uint64_t named = 0;
  uint32_t surviving = UINT32_MAX;  // the first so many of each aggregate

 private:
  std::mutex mutex_;
  std::deque<std::vector<uint8_t>> memory_;
};

}  // namespace vx::fakes
