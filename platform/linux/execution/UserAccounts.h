// Who makes the service hold how much.
#pragma once

#include <sys/types.h>

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <thread>

#include "base/Function.h"
#include "platform/linux/execution/MemoryLimits.h"

namespace vx::lnx {

// Stands for a user as long as he has a connection or the service holds something for him.
using UserIndex = uint16_t;
// What no client has caused. Counts in the totals, and has no bounds.
inline constexpr UserIndex kServiceItself = 0;

// Bytes, as the kernel's allocator and the files see them: about.
enum class MemoryKind : uint8_t {
  Waiting,  // work of the relay and standalone queues, and records of the store
  Frames,   // large ones that are coming in, and what reading has left over
  Unread,   // replies
  Delayed,  // standalone messages in their delay
  Kept,     // aggregates, sessions and what they were configured with
};
inline constexpr std::size_t kMemoryKinds = 5;

// The accounts of the users. Owned by the platform, which it outlives nobody of. add() and remove()
// are for any thread, everything else for the interactive one. Counting takes no lock, and the
// interactive thread, which counts something for every message, shares no line of memory with those
// that take it off again.
//
// A user whose work waits beyond his bound is paused: whoever reads from his clients stops until
// half of it is done. While all that waits is beyond its bound too, his bound is no more than his
// share of it, an equal one for each user that has something waiting. Frames and unread replies
// have the same bounds, each for itself. In the same way a user is full whose bytes of the other
// kinds and unread replies are beyond his bound: nothing more is to be kept for him.
//
// Bounded: kMostUsers accounts, each for good; those that are not used are used again.
class UserAccounts {
 public:
  static constexpr std::size_t kMostUsers = 4096;

  explicit UserAccounts(const MemoryLimits& limits = {});
  ~UserAccounts();
  UserAccounts(const UserAccounts&) = delete;
  UserAccounts& operator=(const UserAccounts&) = delete;

  // Names the calling thread the interactive one.
  void adoptThread() { interactive_ = std::this_thread::get_id(); }
  // Called, on whatever thread, when a user goes on that was paused. Before there is traffic.
  void setResumedHandler(Function<void()> handler) { resumed_ = std::move(handler); }

  // A connection of the user; none when there are too many users.
  std::optional<UserIndex> enter(uid_t user);
  void leave(UserIndex user);
  // One more connection's worth of a user who is known, until leave().
  void stay(UserIndex user) { ++at(user).connections; }
  uid_t uidOf(UserIndex user) const { return at(user).user; }
  uint32_t connections(UserIndex user) const { return at(user).connections; }

  void add(UserIndex user, MemoryKind kind, std::size_t bytes) {
    Account& account = at(user);
    const auto more = static_cast<int64_t>(bytes);
    if (interactive_.load(std::memory_order_relaxed) == std::this_thread::get_id()) {
      std::atomic<int64_t>& own = account.byInteractive[index(kind)];
      own.store(own.load(std::memory_order_relaxed) + more, std::memory_order_relaxed);
      account.sinceLook += bytes;
    } else {
      account.byOthers[index(kind)].fetch_add(more, std::memory_order_relaxed);
    }
  }
  void remove(UserIndex user, MemoryKind kind, std::size_t bytes) {
    Account& account = at(user);
    account.byOthers[index(kind)].fetch_sub(static_cast<int64_t>(bytes));
    if (account.paused.load()) [[unlikely]]
      maybeResume(account);
  }

  // Cheap: asked before every frame.
  bool isPaused(UserIndex user) {
    Account& account = at(user);
    if (account.sinceLook >= quantum_) [[unlikely]]
      look(account);
    return account.paused.load(std::memory_order_relaxed);
  }
  // Cheap, but for one who is: asked before something is kept.
  bool isFull(UserIndex user) {
    if (user == kServiceItself) return false;
    Account& account = at(user);
    if (account.full || account.sinceLook >= quantum_) [[unlikely]]
      look(account);
    return account.full;
  }
  // Whether so many bytes more of that kind are within his bound, or the first ones.
  bool mayHold(UserIndex user, MemoryKind kind, std::size_t bytes) const;
  // All that waits is beyond its bound.
  bool isTooMuchWaiting() const {
    return total(MemoryKind::Waiting) > static_cast<int64_t>(limits_.maxWaitingBytes);
  }
  int64_t bytes(UserIndex user, MemoryKind kind) const { return bytesOf(at(user), kind); }
  int64_t total(MemoryKind kind) const;
  uint64_t pauses() const { return pauses_; }

 private:
  static constexpr std::size_t kLine = 64;
  using Counts = std::array<std::atomic<int64_t>, kMemoryKinds>;
  struct Account {
    alignas(kLine) Counts byInteractive{};  // written by that thread alone
    std::size_t sinceLook = 0;              // bytes added
    uint32_t connections = 0;
    uid_t user = 0;
    bool full = false;
    alignas(kLine) Counts byOthers{};
    alignas(kLine) std::atomic<bool> paused{false};
    std::atomic<int64_t> resumeAt{0};
  };
  static constexpr std::size_t kChunk = 64;
  using Chunk = std::array<Account, kChunk>;

  static constexpr std::size_t index(MemoryKind kind) { return static_cast<std::size_t>(kind); }
  Account& at(UserIndex user) const {
    return (*chunks_[user / kChunk].load(std::memory_order_acquire))[user % kChunk];
  }
  static int64_t bytesOf(const Account& account, MemoryKind kind) {
    return account.byInteractive[index(kind)].load(std::memory_order_relaxed) +
           account.byOthers[index(kind)].load();
  }
  static int64_t heldBytesOf(const Account& account);
  static bool isIdle(const Account& account);
  UserIndex accountFor(uid_t user);
  void look(Account& account);
  template <class BytesOf>
  int64_t boundOf(int64_t own, uint64_t ofUser, uint64_t ofAll, const BytesOf& bytesOf) const;
  void maybeResume(Account& account);

  const MemoryLimits limits_;
  const std::size_t quantum_;  // bytes that may be added before anybody looks
  std::atomic<std::thread::id> interactive_{};
  std::array<std::atomic<Chunk*>, kMostUsers / kChunk + 1> chunks_{};
  std::size_t used_ = 1;  // accounts so far, the service's own included
  uint64_t pauses_ = 0;
  Function<void()> resumed_;
};

}  // namespace vx::lnx
