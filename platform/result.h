// Result types for the platform layer: a Status (success or an Error) and a
// Result<T> (a value or an Error). errno is turned into an Error once, where
// the operating system is called; nothing here throws.
#ifndef VTR_PLATFORM_RESULT_H_
#define VTR_PLATFORM_RESULT_H_

#include <cerrno>
#include <optional>
#include <string>
#include <utility>
#include <variant>

namespace vtr {

// What went wrong: an errno value (0 when no system call failed) and the
// context it happened in, e.g. the path or the rule of a format that was broken.
class Error {
 public:
  Error() = default;
  Error(int code, std::string message) : code_(code), message_(std::move(message)) {}

  // An Error from the current errno, with the given context.
  static Error FromErrno(std::string context) { return Error(errno, std::move(context)); }
  // An Error that no system call caused (a malformed input, a refused request).
  static Error Invalid(std::string message) { return Error(0, std::move(message)); }

  int code() const { return code_; }
  const std::string& message() const { return message_; }

  // "message: strerror(code)", or only one of the two when the other is empty.
  // This is the text log lines print for an error's localized description.
  std::string description() const;

 private:
  int code_ = 0;
  std::string message_;
};

// Success, or an Error.
class [[nodiscard]] Status {
 public:
  Status() = default;
  Status(Error error) : error_(std::move(error)) {}  // NOLINT: implicit on purpose
  static Status Ok() { return Status(); }

  bool ok() const { return !error_.has_value(); }
  explicit operator bool() const { return ok(); }
  // Only valid when !ok().
  const Error& error() const { return *error_; }

 private:
  std::optional<Error> error_;
};

// A value of type T, or an Error.
template <typename T>
class [[nodiscard]] Result {
 public:
  Result(T value) : state_(std::move(value)) {}          // NOLINT: implicit on purpose
  Result(Error error) : state_(std::move(error)) {}      // NOLINT: implicit on purpose

  bool ok() const { return state_.index() == 0; }
  explicit operator bool() const { return ok(); }

  // Only valid when ok().
  T& value() & { return std::get<0>(state_); }
  const T& value() const& { return std::get<0>(state_); }
  T&& value() && { return std::get<0>(std::move(state_)); }
  T* operator->() { return &value(); }
  const T* operator->() const { return &value(); }
  T& operator*() & { return value(); }
  const T& operator*() const& { return value(); }

  // Only valid when !ok().
  const Error& error() const { return std::get<1>(state_); }
  Status status() const { return ok() ? Status::Ok() : Status(error()); }

 private:
  std::variant<T, Error> state_;
};

}  // namespace vtr

#endif  // VTR_PLATFORM_RESULT_H_
