// Log scopes and the system log behind them.
#pragma once

#include <cstdint>
#include <string_view>

namespace vx {

enum class LogLevel : uint8_t { Default, Info, Debug, Error };

// A registered scope. Lives as long as the process.
class LogScope {
 public:
  virtual ~LogScope() = default;
};

// Where a line is written. One static object per log statement; the platform may keep a small word
// of its own in it (to limit how fast one statement can flood the log).
struct LogSite {
  const char* file;  // without its directory
  int line;
  const char* function;
  mutable uint64_t platformWord = 0;  // accessed through std::atomic_ref by the platform only
};

// Thread-safe.
class ScopedLog {
 public:
  virtual ~ScopedLog() = default;
  // `code` is the four-character code, first character in the most significant byte. Null when it
  // cannot register.
  virtual const LogScope* registerScope(bool enabled, uint32_t code, std::string_view name,
                                        std::string_view domain, std::string_view verboseKey,
                                        uint32_t level) = 0;
  // Whether lines of that level are wanted. Level 5 is the verbose one: true while the scope's
  // verbose preference is. A null scope stands for the default one, which has none: true where
  // debug lines are written.
  virtual bool isLogEnabled(int level, const LogScope* scope) = 0;

  // Whether a line would be written at all; asked before its text is made. A null scope is the
  // default system log.
  virtual bool wantsLine(const LogScope* scope, LogLevel level, const LogSite& site) = 0;
  // `text` is the whole line with its "%s:%d:%s: " prefix, which is `prefixLength` bytes long.
  virtual void write(const LogScope* scope, LogLevel level, const LogSite& site,
                     std::string_view text, std::size_t prefixLength) = 0;
};

// The four-character code of a scope's short name.
constexpr uint32_t fourCharacterCode(const char (&text)[5]) {
  return (static_cast<uint32_t>(static_cast<unsigned char>(text[0])) << 24) |
         (static_cast<uint32_t>(static_cast<unsigned char>(text[1])) << 16) |
         (static_cast<uint32_t>(static_cast<unsigned char>(text[2])) << 8) |
         static_cast<uint32_t>(static_cast<unsigned char>(text[3]));
}

}  // namespace vx
