// The calls of a connection that are under way.
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

namespace vx::lnx {

// Each call has a slot from open() until its Reply is gone, found again by a token that no later
// call shares: an answer that comes after the slot went to another call finds nothing.
//
// Owned by SocketConnection, on its queue. Calls that count are bounded by the connection, which
// reads no more at maxCallsInFlight of them; those whose answer may be held, by the sessions that
// one peer may have.
class CallTable {
 public:
  enum class Answer : uint8_t {
    Soon,  // counts as a call in flight until it is settled
    MayBeHeld,
  };
  struct Call {
    uint64_t number = 0;  // the peer's
    uint32_t generation = 0;
    bool open = false;
    bool settled = false;
    bool counted = false;
  };

  // Returns the token.
  uint64_t open(uint64_t number, Answer answer);
  // Null when the call is over. Valid until open() or close().
  Call* find(uint64_t token);
  // The call has its answer, or will never have one.
  void settle(Call& call);
  // Its token stands for nothing any more.
  void close(uint64_t token);

  std::size_t inFlight() const { return inFlight_; }

 private:
  std::vector<Call> slots_;
  std::vector<uint32_t> free_;
  std::size_t inFlight_ = 0;
};

}  // namespace vx::lnx
