// Wall-clock dates and monotonic time. Nothing else reads a clock, so tests own time.
#pragma once

#include <algorithm>
#include <chrono>
#include <string>

namespace vx {

using Date = std::chrono::time_point<std::chrono::system_clock, std::chrono::nanoseconds>;
using Monotonic = std::chrono::time_point<std::chrono::steady_clock, std::chrono::nanoseconds>;

inline double secondsSince1970(Date date) {
  return std::chrono::duration<double>(date.time_since_epoch()).count();
}
// To the microsecond: that much of a second such a number has. Numbers may come from anywhere; none
// stands for a date beyond what Date can hold.
inline Date dateFromSeconds(double seconds) {
  constexpr double kMost = 9e9;
  const double clamped = seconds > -kMost ? std::min(seconds, kMost) : -kMost;
  return Date(
      std::chrono::round<std::chrono::microseconds>(std::chrono::duration<double>(clamped)));
}

class Clock {
 public:
  virtual ~Clock() = default;
  virtual Date now() = 0;             // wall clock; may jump
  virtual Monotonic monotonic() = 0;  // never goes back
  // Local time in a strftime(3) format.
  virtual std::string formatLocal(Date date, const char* format) = 0;
};

}  // namespace vx
