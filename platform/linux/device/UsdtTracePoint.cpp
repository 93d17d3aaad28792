#include "platform/linux/device/UsdtTracePoint.h"

#include <sys/sdt.h>

namespace vx::lnx {

void UsdtTracePoint::emit(uint32_t code, uint64_t a, uint64_t b, uint64_t c, uint64_t d) {
  DTRACE_PROBE5(vxreporting, trace, code, a, b, c, d);
}

}  // namespace vx::lnx
