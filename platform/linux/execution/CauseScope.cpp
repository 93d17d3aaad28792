#include "platform/linux/execution/CauseScope.h"

#include <algorithm>

namespace vx::lnx {

namespace {

struct Bits {
  uint8_t shift;
  uint32_t most;
};
constexpr Bits kBits[] = {{30, 3}, {8, (1u << 22) - 1}, {4, 15}, {0, 15}};
static_assert(kDeepestCause == std::size(kBits) - 1);

thread_local CauseScope* innermost = nullptr;

}  // namespace

CauseScope::CauseScope(const Cause& cause, uint32_t taken)
    : ticket_(cause.ticket),
      place_(cause.position.place),
      depth_(cause.position.depth),
      user_(cause.user),
      taken_(taken),
      outer_(std::exchange(innermost, this)) {}

CauseScope::~CauseScope() { innermost = outer_; }

const JournalTicket* CauseScope::current() {
  return innermost != nullptr && innermost->ticket_ ? &innermost->ticket_ : nullptr;
}

UserIndex CauseScope::currentUser() {
  return innermost != nullptr ? innermost->user_ : kServiceItself;
}

Cause CauseScope::share() {
  const CauseScope* const scope = innermost;
  if (scope == nullptr) return {};
  return {scope->ticket_, {scope->place_, scope->depth_}, scope->user_};
}

uint32_t CauseScope::taken() { return innermost != nullptr ? innermost->taken_ : 0; }

std::optional<WorkOrigin> CauseScope::origin() {
  const CauseScope* const scope = innermost;
  if (scope == nullptr || !scope->ticket_) return std::nullopt;
  const JournalTicket& ticket = scope->ticket_;
  return WorkOrigin{ticket.namedCall(), scope->place_, scope->depth_, ticket.time()};
}

uint32_t CauseScope::nextPlace() {
  const CauseScope* const scope = innermost;
  if (scope == nullptr || !scope->ticket_) return 0;
  const Bits bits = kBits[scope->depth_];
  // More than a call can cause; they would share the last place rather than take another's.
  return scope->place_ | std::min(scope->taken_, bits.most) << bits.shift;
}

Cause Cause::take() {
  CauseScope* const scope = innermost;
  if (scope == nullptr) return {};
  if (!scope->ticket_) return {.user = scope->user_};
  const uint32_t place = CauseScope::nextPlace();
  ++scope->taken_;
  return {scope->ticket_,
          {place, std::min<uint8_t>(static_cast<uint8_t>(scope->depth_ + 1), kDeepestCause)},
          scope->user_};
}

void HeldCause::run(const Work& work) {
  {
    const CauseScope scope(cause_);
    work();
  }
  cause_.ticket = {};
}

}  // namespace vx::lnx
