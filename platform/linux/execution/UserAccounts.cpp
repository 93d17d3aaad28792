#include "platform/linux/execution/UserAccounts.h"

#include <algorithm>

namespace vx::lnx {

namespace {

// What waits grows after it was counted, when a message becomes rows: but by a small factor.
constexpr std::size_t kMostUnseen = 16 << 10;

}  // namespace

UserAccounts::UserAccounts(const MemoryLimits& limits)
    : limits_(limits),
      quantum_(std::min<std::size_t>(kMostUnseen,
                                     std::min({limits.maxUserWaitingBytes, limits.maxWaitingBytes,
                                               limits.maxUserBytes, limits.maxBytes}) /
                                         256)) {
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

// What comes and goes by itself has bounds of its own, at which nothing is refused or left out.
int64_t UserAccounts::heldBytesOf(const Account& account) {
  return bytesOf(account, MemoryKind::Unread) + bytesOf(account, MemoryKind::Delayed) +
         bytesOf(account, MemoryKind::Kept);
}

bool UserAccounts::mayHold(UserIndex user, MemoryKind kind, std::size_t bytes) const {
  const auto ofKind = [kind](const Account& of) { return bytesOf(of, kind); };
  const int64_t own = ofKind(at(user));
  const int64_t wanted = own + static_cast<int64_t>(bytes);
  return user == kServiceItself || own == 0 ||
         wanted <= boundOf(wanted, limits_.maxUserWaitingBytes, limits_.maxWaitingBytes, ofKind);
}

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

// Of a user who has so many bytes of some kind: his bound, or his share while all have too many.
template <class BytesOf>
int64_t UserAccounts::boundOf(int64_t own, uint64_t ofUser, uint64_t ofAll,
                              const BytesOf& bytesOf) const {
  const auto most = static_cast<int64_t>(ofAll);
  const auto bound = static_cast<int64_t>(ofUser);
  // Below the least share that there can be, the others need not be asked.
  if (own <= most / static_cast<int64_t>(used_)) return bound;
  int64_t total = bytesOf(at(kServiceItself));
  int64_t users = 0;
  for (std::size_t i = 1; i < used_; ++i) {
    const int64_t bytes = bytesOf(at(static_cast<UserIndex>(i)));
    total += bytes;
    users += bytes > 0 ? 1 : 0;
  }
  return total <= most ? bound : std::min(bound, most / std::max<int64_t>(users, 1));
}

void UserAccounts::look(Account& account) {
  account.sinceLook = 0;
  const int64_t held = heldBytesOf(account);
  account.full = held > boundOf(held, limits_.maxUserBytes, limits_.maxBytes, heldBytesOf);
  if (account.paused.load()) return;
  const auto waitingOf = [](const Account& of) { return bytesOf(of, MemoryKind::Waiting); };
  const int64_t waiting = waitingOf(account);
  const int64_t bound =
      boundOf(waiting, limits_.maxUserWaitingBytes, limits_.maxWaitingBytes, waitingOf);
  if (waiting <= bound) return;
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
