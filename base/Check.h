// Invariants that the code relies on. What a peer sends never reaches one: that is an error with a
// text.
#pragma once

namespace vx {

// Says where and what on stderr and aborts.
[[noreturn]] void checkFailed(const char* file, int line, const char* condition);

}  // namespace vx

// Holds in every build.
#define VX_CHECK(condition) \
  ((condition) ? void() : ::vx::checkFailed(__FILE_NAME__, __LINE__, #condition))

// Holds in development and test builds (VX_CHECKS); in a release the condition is not evaluated.
#ifdef VX_CHECKS
#define VX_DCHECK(condition) VX_CHECK(condition)
#else
#define VX_DCHECK(condition) static_cast<void>(sizeof((condition) ? 1 : 0))
#endif
