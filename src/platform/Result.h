// Result<T>: the outcome of a platform call that can fail, with the reason as text.
// Callers log the system's own line; the reason is there for details and tests.
#pragma once

#include <optional>
#include <string>
#include <utility>

namespace telvane {

template <typename T>
class Result {
 public:
  static Result success(T value) { return Result(std::move(value), {}); }
  static Result failure(std::string error) { return Result(std::nullopt, std::move(error)); }

  bool ok() const { return value_.has_value(); }
  explicit operator bool() const { return ok(); }
  const T& value() const& { return *value_; }
  T& value() & { return *value_; }
  T&& value() && { return std::move(*value_); }
  const T* operator->() const { return &*value_; }
  const T& operator*() const { return *value_; }
  const std::string& error() const { return error_; }

 private:
  Result(std::optional<T> v, std::string e) : value_(std::move(v)), error_(std::move(e)) {}
  std::optional<T> value_;
  std::string error_;
};

// For operations with no value.
struct Ok {};
using Status = Result<Ok>;
inline Status statusOk() { return Status::success(Ok{}); }
inline Status statusError(std::string e) { return Status::failure(std::move(e)); }

}  // namespace telvane
