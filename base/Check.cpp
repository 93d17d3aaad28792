#include "base/Check.h"

#include <cstdio>
#include <cstdlib>

namespace vx {

void checkFailed(const char* file, int line, const char* condition) {
  std::fprintf(stderr, "%s:%d: an invariant does not hold: %s\n", file, line, condition);
  std::abort();
}

}  // namespace vx
