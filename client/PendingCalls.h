// The calls that wait for their answers. Private to the client library.
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <set>
#include <variant>
#include <vector>

#include "client/ReportingClient.h"

namespace vx {

// What to do with the answer of one call. Holds the caller's callback as it came, so that a call
// allocates nothing; none when nobody wants the answer.
using CallAnswer = std::variant<
    std::monostate, ReportingClient::Callback<bool>, ReportingClient::Callback<uint16_t>,
    ReportingClient::Callback<ReportingClient::Done>, ReportingClient::Callback<ReporterValidation>,
    ReportingClient::Callback<std::vector<int64_t>>>;

// Runs the callback: with the reply's value, or without one and with the reason why. `value` is not
// looked at any more once the callback runs.
void deliver(const CallAnswer& answer, const ClientStatus& status, const Value* value);

// Calls are numbered in turn and mostly answered in turn, so they lie in a ring: adding and finding
// one costs an index. A call that is answered much later than its successors (a start) is moved to
// a map when it would keep the ring from turning.
class PendingCalls {
 public:
  uint64_t nextNumber() const { return next_; }
  std::size_t size() const { return waiting_; }

  void add(CallAnswer answer) {  // is call nextNumber()
    if (next_ - first_ == ring_.size()) makeRoom();
    Slot& slot = at(next_++);
    slot.answer = std::move(answer);
    slot.waiting = true;
    ++waiting_;
  }
  // False when no such call is waiting.
  bool take(uint64_t number, CallAnswer& answer);
  // Everything below `end` that waits, oldest first, with exceptions. Numbering goes on.
  std::vector<CallAnswer> takeBefore(uint64_t end, const std::set<uint64_t>& except = {});

 private:
  struct Slot {
    CallAnswer answer;
    bool waiting = false;
  };
  Slot& at(uint64_t number) { return ring_[number & (ring_.size() - 1)]; }
  void makeRoom();

  std::vector<Slot> ring_;  // a power of two; calls first_ to next_ - 1
  std::map<uint64_t, CallAnswer> older_;
  uint64_t first_ = 1;
  uint64_t next_ = 1;
  std::size_t waiting_ = 0;
};

}  // namespace vx
