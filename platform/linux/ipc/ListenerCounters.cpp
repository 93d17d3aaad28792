#include "platform/linux/ipc/ListenerCounters.h"

namespace vx::lnx {

std::string ListenerCounters::text() const {
  std::string out;
#define VX_COUNTER_TEXT(field, name) \
  out += (out.empty() ? "" : " ") + std::string(name "=") + std::to_string(field);
  VX_LISTENER_COUNTERS(VX_COUNTER_TEXT)
#undef VX_COUNTER_TEXT
  return out;
}

}  // namespace vx::lnx
