#include "base/UniqueFd.h"

#include <cerrno>

namespace vx {

void UniqueFd::reset(int fd) {
  const int old = std::exchange(fd_, fd);
  if (old < 0 || old == fd) return;
  const int before = errno;
  // EINTR included: Linux has released the descriptor by then, see close(2).
  (void)::close(old);
  errno = before;
}

}  // namespace vx
