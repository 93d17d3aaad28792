// How much of the journal is whose.
#pragma once

#include <cstddef>
#include <cstdint>
#include <unordered_map>

namespace vx::lnx {

// What users have had recorded since the state that the journal goes back to. While it is more than
// `most` in all, whoever has more than an equal share of that is over it: he waits for the next
// snapshot, so that there is space left for the others.
//
// Owned by JournalRecorder; belongs to the interactive thread. Bounded by the users who have
// something in the journal.
class JournalShares {
 public:
  explicit JournalShares(std::size_t most) : most_(most) {}

  void add(uint32_t user, std::size_t bytes) {
    Bytes& own = users_[user];
    own.sinceGeneration += bytes;
    total_ += bytes;
  }
  // A snapshot has been begun: when it is complete, what was recorded before is wanted no more.
  void generationBegan() {
    for (auto& [user, own] : users_) {
      own.before += own.sinceGeneration;
      own.sinceGeneration = 0;
    }
  }
  void snapshotCompleted() {
    total_ = 0;
    for (auto& [user, own] : users_) {
      own.before = 0;
      total_ += own.sinceGeneration;
    }
    std::erase_if(users_, [](const auto& entry) { return entry.second.sinceGeneration == 0; });
  }

  // Somebody is over his share: among several there always is.
  bool isCrowded() const { return total_ > most_ && users_.size() > 1; }
  bool isOver(uint32_t user) const {
    if (!isCrowded()) return false;
    const auto found = users_.find(user);
    return found != users_.end() &&
           found->second.before + found->second.sinceGeneration > most_ / users_.size();
  }

 private:
  struct Bytes {
    std::size_t before = 0;
    std::size_t sinceGeneration = 0;
  };
  const std::size_t most_;
  std::size_t total_ = 0;
  std::unordered_map<uint32_t, Bytes> users_;
};

}  // namespace vx::lnx
