#include "platform/linux/ipc/ReadTurns.h"

#include <algorithm>
#include <utility>

namespace vx::lnx {

bool ReadTurn::goOn() {
  executor_.runInteractive(kItems);
  now_ = clock_.monotonic();
  return now_ < end_;
}

void ReadTurns::add(uid_t user, std::shared_ptr<TurnTaker> reader) {
  if (ended_) return;
  const auto [found, isNew] = byUid_.try_emplace(user);
  if (isNew) {
    found->second = idle_.emplace(idle_.begin());
    found->second->uid = user;
  }
  User& of = *found->second;
  if (!std::exchange(of.wantsTurns, true)) users_.splice(users_.end(), idle_, found->second);
  of.readers.push_back(std::move(reader));
}

void ReadTurns::becomeIdle(std::list<User>::iterator user) {
  user->wantsTurns = false;
  idle_.splice(idle_.begin(), users_, user);
  if (idle_.size() <= kMostIdle) return;
  byUid_.erase(idle_.back().uid);
  idle_.pop_back();
}

bool ReadTurns::runRound() {
  // Who comes while the round runs is in the next one.
  for (std::size_t left = users_.size(); left > 0 && !users_.empty(); --left) {
    const auto user = users_.begin();
    if (users_.size() == 1) user->debt = {};  // nobody else is there to be owed
    runTurnOf(*user);
    if (ended_) break;
    if (user->readers.empty() && user->debt.count() == 0) {
      becomeIdle(user);
    } else {
      users_.splice(users_.end(), users_, user);
    }
  }
  return std::any_of(users_.begin(), users_.end(),
                     [](const User& user) { return !user.readers.empty(); });
}

void ReadTurns::runTurnOf(User& user) {
  const std::chrono::nanoseconds paid = std::min<std::chrono::nanoseconds>(user.debt, kTurn);
  user.debt -= paid;
  if (paid == kTurn || user.readers.empty()) return;
  ReadTurn turn(executor_, clock_, kTurn - paid);
  // Each of them once: who has more to read is behind those that come meanwhile.
  for (std::size_t left = user.readers.size(); left > 0 && !user.readers.empty(); --left) {
    const std::shared_ptr<TurnTaker> reader = std::move(user.readers.front());
    user.readers.pop_front();
    reader->takeTurn(turn);
    if (!turn.goOn() || ended_) break;
  }
  user.debt += std::max<std::chrono::nanoseconds>(-turn.left(), {});
}

void ReadTurns::end() {
  ended_ = true;
  for (User& user : users_) {
    const std::deque<std::shared_ptr<TurnTaker>> readers = std::move(user.readers);
    for (const std::shared_ptr<TurnTaker>& reader : readers) reader->turnsEnded();
  }
}

}  // namespace vx::lnx
