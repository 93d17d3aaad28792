// Names of processes, and the end of this one.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace vx {

class ProcessInfoQuery {
 public:
  virtual ~ProcessInfoQuery() = default;
  virtual int32_t ownProcessIdentifier() = 0;
  virtual std::string ownProcessName() = 0;
  // The kernel's short command name (at most 16 bytes, UTF-8). None when there is no such process
  // or its record is not what was expected.
  virtual std::optional<std::string> shortCommandName(int32_t processIdentifier) = 0;
};

class ProcessControl {
 public:
  virtual ~ProcessControl() = default;
  // Ends the process at once. Returns only in tests.
  virtual void exit(int status) = 0;
};

// Uniformly distributed whole numbers.
class RandomSource {
 public:
  virtual ~RandomSource() = default;
  virtual uint32_t below(uint32_t bound) = 0;  // 0 to bound - 1
};

}  // namespace vx
