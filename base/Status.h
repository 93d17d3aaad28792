// Whether something that depends on the world outside worked, and if not, what was tried and why.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "base/Error.h"

namespace vx {

// Success, or a failure with a sentence for people and, where the system gave one, an errno value.
// Absence that is expected is no failure: that is a std::optional.
class [[nodiscard]] Status {
 public:
  Status() = default;  // success
  // "cannot open /a/b: No such file or directory", from what was tried and an errno value.
  static Status posix(std::string_view tried, int errnoValue);
  // With the errno of this moment.
  static Status lastError(std::string_view tried);
  static Status failure(std::string text) { return Status(0, std::move(text)); }

  bool ok() const { return text_.empty(); }
  int code() const { return code_; }  // errno's value; 0 when there is none
  const std::string& text() const { return text_; }
  // The same failure with more to say after the sentence, " (set X to ...)"; success stays
  // success.
  Status withHint(std::string_view hint) const;
  // As the platform's interfaces say it; none for success.
  std::optional<Error> error() const;

 private:
  Status(int code, std::string text)
      : code_(code), text_(text.empty() ? "failed" : std::move(text)) {}
  int code_ = 0;
  std::string text_;
};

// The failure of Status::posix, as the platform's interfaces say it.
Error posixError(int errnoValue, std::string_view tried);

// A value, or the failure that kept it from being made.
template <class T>
class [[nodiscard]] Result {
 public:
  // Both convert, so that a function returns either as it is.
  // NOLINTBEGIN(google-explicit-constructor)
  Result(T value) : value_(std::move(value)) {}
  Result(Status failure) : status_(std::move(failure)) {}
  // NOLINTEND(google-explicit-constructor)
  bool ok() const { return value_.has_value(); }
  const Status& status() const { return status_; }
  T& value() & { return *value_; }
  const T& value() const& { return *value_; }
  T&& value() && { return *std::move(value_); }
  T* operator->() { return &*value_; }
  const T* operator->() const { return &*value_; }
  T& operator*() { return *value_; }
  const T& operator*() const { return *value_; }

 private:
  std::optional<T> value_;
  Status status_;
};

}  // namespace vx
