// Whose bytes are read next: users take turns, and the connections of each.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <deque>
#include <list>
#include <memory>
#include <unordered_map>

#include "base/Clock.h"
#include "platform/linux/execution/Executor.h"

namespace vx::lnx {

// The time that a connection may take for what its peer has sent. What it runs may queue
// interactive work; that is the reader's own cost, so it runs within the turn.
//
// Of the stack of whoever gives the turn; interactive thread.
class ReadTurn {
 public:
  ReadTurn(Executor& executor, Clock& clock, std::chrono::nanoseconds time)
      : executor_(executor), clock_(clock), began_(clock.monotonic()), end_(began_ + time) {}
  ReadTurn(const ReadTurn&) = delete;
  ReadTurn& operator=(const ReadTurn&) = delete;

  // Runs what has been queued. False: the time is over, what is left waits for another turn. May
  // have ended whoever asks.
  bool goOn();
  std::chrono::nanoseconds left() const { return end_ - now_; }

 private:
  static constexpr std::size_t kItems = 4096;

  Executor& executor_;
  Clock& clock_;
  const Monotonic began_;
  const Monotonic end_;
  Monotonic now_ = began_;
};

// What is read, or done, in turns.
class TurnTaker {
 public:
  virtual ~TurnTaker() = default;
  // Is out of the list then, and may add itself again.
  virtual void takeTurn(ReadTurn& turn) = 0;
  // There are no turns any more.
  virtual void turnsEnded() {}
};

// A round gives each user who has something to read the same time, whatever he does with it, and
// within that his connections one read each. A call cannot be stopped half-way: what it took beyond
// the turn is taken from that user's next ones, as long as others want theirs. So a call waits for
// one turn of each other user at most, not for what they have sent.
//
// Owned by SocketListener, on the interactive thread. Bounded by the number of connections.
class ReadTurns {
 public:
  // Long against what changing between users costs, short against what a caller notices.
  static constexpr std::chrono::microseconds kTurn{500};

  ReadTurns(Executor& executor, Clock& clock) : executor_(executor), clock_(clock) {}

  // At the end of its user's. Once: it says itself whether it is there already.
  void add(uid_t user, std::shared_ptr<TurnTaker> reader);
  // True: somebody still has something to read.
  bool runRound();
  // From here on nobody gets a turn; those who wait for one are told.
  void end();

 private:
  struct User {
    uid_t uid = 0;
    std::deque<std::shared_ptr<TurnTaker>> readers;
    std::chrono::nanoseconds debt{0};
    bool wantsTurns = false;  // in users_
  };
  // Who reads no more is remembered for a while: he is likely to come again, and his place is made.
  static constexpr std::size_t kMostIdle = 16;

  void runTurnOf(User& user);
  void becomeIdle(std::list<User>::iterator user);

  Executor& executor_;
  Clock& clock_;
  bool ended_ = false;
  std::list<User> users_;  // in the order of their turns; those with readers or a debt
  std::list<User> idle_;   // the last to become so first
  std::unordered_map<uid_t, std::list<User>::iterator> byUid_;
};

}  // namespace vx::lnx
