#include "base/Status.h"

#include <cerrno>
#include <cstring>

namespace vx {

Status Status::posix(std::string_view tried, int errnoValue) {
  return {errnoValue, std::string(tried) + ": " + std::strerror(errnoValue)};
}

Status Status::lastError(std::string_view tried) { return posix(tried, errno); }

Status Status::withHint(std::string_view hint) const {
  return ok() ? *this : Status(code_, text_ + " (" + std::string(hint) + ")");
}

std::optional<Error> Status::error() const {
  if (ok()) return std::nullopt;
  return Error{code_ != 0 ? kPosixErrorDomain : kGenericErrorDomain, code_, text_};
}

Error posixError(int errnoValue, std::string_view tried) {
  return *Status::posix(tried, errnoValue).error();
}

}  // namespace vx
