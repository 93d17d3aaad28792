// The log statements of the service. A line is "%s:%d:%s: " (file, line, function) and the message;
// its arguments are evaluated and its text made only when somebody wants it.
//
//   VX_LOG(scope, Default, "creating session for reporter %lli", id);
//   VX_VERBOSE(scope, "sending single message");     // debug level, only while the scope's level 5
//   is on
//
// `scope` is a const LogScope*, null for the default system log. Formats are printf's.
#pragma once

#include "platform/Platform.h"

namespace vx {

[[gnu::format(printf, 4, 5)]] void writeLogLine(const LogScope* scope, LogLevel level,
                                                const LogSite& site, const char* format, ...);

}  // namespace vx

// As VX_LOG, for a function name other than the enclosing one.
#define VX_LOG_AS(functionName, scope, level, ...)                                      \
  do {                                                                                  \
    static const ::vx::LogSite vxLogSite{__FILE_NAME__, __LINE__, functionName, 0};     \
    const ::vx::LogScope* vxLogScope = (scope);                                         \
    if (::vx::platform().log.wantsLine(vxLogScope, ::vx::LogLevel::level, vxLogSite)) { \
      ::vx::writeLogLine(vxLogScope, ::vx::LogLevel::level, vxLogSite, __VA_ARGS__);    \
    }                                                                                   \
  } while (false)

#define VX_LOG(scope, level, ...) VX_LOG_AS(__func__, scope, level, __VA_ARGS__)

#define VX_VERBOSE(scope, ...)                                                            \
  do {                                                                                    \
    if (::vx::platform().log.isLogEnabled(5, (scope))) VX_LOG(scope, Debug, __VA_ARGS__); \
  } while (false)
