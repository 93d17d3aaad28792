#include "platform/linux/ipc/CallTable.h"

#include "base/Check.h"

namespace vx::lnx {

uint64_t CallTable::open(uint64_t number, Answer answer) {
  uint32_t index = 0;
  if (free_.empty()) {
    index = static_cast<uint32_t>(slots_.size());
    slots_.emplace_back();
  } else {
    index = free_.back();
    free_.pop_back();
  }
  Call& call = slots_[index];
  call.number = number;
  call.open = true;
  call.settled = false;
  call.counted = answer == Answer::Soon;
  if (call.counted) ++inFlight_;
  return uint64_t{call.generation} << 32 | index;
}

CallTable::Call* CallTable::find(uint64_t token) {
  const auto index = static_cast<uint32_t>(token);
  VX_DCHECK(index < slots_.size());  // tokens are made here
  Call& call = slots_[index];
  return call.open && call.generation == token >> 32 ? &call : nullptr;
}

void CallTable::settle(Call& call) {
  call.settled = true;
  if (!call.counted) return;
  call.counted = false;
  --inFlight_;
}

void CallTable::close(uint64_t token) {
  Call* const call = find(token);
  VX_DCHECK(call != nullptr && call->settled);
  ++call->generation;
  call->open = false;
  free_.push_back(static_cast<uint32_t>(token));
}

}  // namespace vx::lnx
