// A platform error object: where it comes from, a signed code, and a sentence for people.
#pragma once

#include <cstdint>
#include <string>

namespace vx {

struct Error {
  std::string domain;
  int64_t code = 0;
  std::string reason;  // may be empty

  // "reason (domain, code n)", or without the reason when there is none.
  std::string description() const {
    const std::string where = domain + ", code " + std::to_string(code);
    return reason.empty() ? where : reason + " (" + where + ")";
  }
  bool operator==(const Error&) const = default;
};

// Domain of errors that carry an errno value as their code.
inline constexpr const char* kPosixErrorDomain = "posix";
// Domain of errors that belong to no particular service.
inline constexpr const char* kGenericErrorDomain = "generic";

}  // namespace vx
