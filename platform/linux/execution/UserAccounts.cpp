#include "platform/linux/execution/UserAccounts.h"

#include <algorithm>

namespace vx::lnx {

namespace {

// What waits grows after it was counted, when a message becomes rows: but by a small factor.
constexpr std::size_t kMostUnseen = 16 << 10;

}  // namespace

UserAccounts::UserAccounts(const MemoryLimits& limits)
    : limits_(limits),
      quantum_(std::min<std::size_t>(
          kMostUnseen, std::min(limits.maxUserWaitingBytes, limits.maxWaitingBytes) / 256)) {
  chunks_[0] = new Chunk;
}

UserAccounts::~UserAccounts() {
  for (const std::atomic<Chunk*>& chunk : chunks_) delete chunk.load();
}

std::optional<UserIndex> UserAccounts::enter(uid_t user) {
  const UserIndex found = accountFor(user);
  if (found == kServiceItself) return std::nullopt;
  Account& account = at(found);
  account.user = user;
  ++account.connections;
  return found;
}

void UserAccounts::leave(UserIndex user) { --at(user).connections; }

bool UserAccounts::isIdle(const Account& account) {
  if (account.connections > 0) return false;
  for (std::size_t kind = 0; kind < kMemoryKinds; ++kind)
    if (bytesOf(account, static_cast<MemoryKind>(kind)) != 0) return false;
  return true;
}

// His own, or one that nobody uses, or a new one; the service's when there is none.
UserIndex UserAccounts::accountFor(uid_t user) {
  UserIndex free = kServiceItself;
  for (std::size_t i = 1; i < used_; ++i) {
    const auto candidate = static_cast<UserIndex>(i);
    const bool idle = isIdle(at(candidate));
    if (at(candidate).user == user && !idle) return candidate;
    if (idle && free == kServiceItself) free = candidate;
  }
  if (free != kServiceItself || used_ > kMostUsers) return free;
  if (used_ % kChunk == 0) chunks_[used_ / kChunk].store(new Chunk, std::memory_order_release);
  return static_cast<UserIndex>(used_++);
}

int64_t UserAccounts::total(MemoryKind kind) const {
  int64_t total = 0;
  for (std::size_t i = 0; i < used_; ++i) total += bytesOf(at(static_cast<UserIndex>(i)), kind);
  return total;
}

// Of a user who has so much waiting.
int64_t UserAccounts::waitingBound(int64_t own) const {
  const auto most = static_cast<int64_t>(limits_.maxWaitingBytes);
  const auto ofUser = static_cast<int64_t>(limits_.maxUserWaitingBytes);
  // Below the least share that there can be, the others need not be asked.
  if (own <= most / static_cast<int64_t>(used_)) return ofUser;
  int64_t total = bytesOf(at(kServiceItself), MemoryKind::Waiting);
  int64_t users = 0;
  for (std::size_t i = 1; i < used_; ++i) {
    const int64_t waiting = bytesOf(at(static_cast<UserIndex>(i)), MemoryKind::Waiting);
    total += waiting;
    users += waiting > 0 ? 1 : 0;
  }
  return total <= most ? ofUser : std::min(ofUser, most / std::max<int64_t>(users, 1));
}

void UserAccounts::look(Account& account) {
  account.sinceLook = 0;
  if (account.paused.load()) return;
  const int64_t own = bytesOf(account, MemoryKind::Waiting);
  const int64_t bound = waitingBound(own);
  if (own <= bound) return;
  ++pauses_;
  account.resumeAt.store(bound / 2);
  account.paused.store(true);
  maybeResume(account);  // what it waits for may have happened meanwhile
}

void UserAccounts::maybeResume(Account& account) {
  if (bytesOf(account, MemoryKind::Waiting) > account.resumeAt.load()) return;
  bool expected = true;
  if (account.paused.compare_exchange_strong(expected, false) && resumed_) resumed_();
}

}  // namespace vx::lnx
