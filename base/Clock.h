// Wall-clock dates and monotonic time. Nothing else reads a clock, so tests own time.
#pragma once

#include <chrono>
#include <string>

namespace vx {

using Date = std::chrono::time_point<std::chrono::system_clock, std::chrono::nanoseconds>;
using Monotonic = std::chrono::time_point<std::chrono::steady_clock, std::chrono::nanoseconds>;

class Clock {
 public:
  virtual ~Clock() = default;
  virtual Date now() = 0;             // wall clock; may jump
  virtual Monotonic monotonic() = 0;  // never goes back
  // Local time in a strftime(3) format.
  virtual std::string formatLocal(Date date, const char* format) = 0;
};

}  // namespace vx
