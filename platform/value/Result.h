#pragma once

// tn::Result<T>: a value or the error that kept it from being made. Failures
// are values in this system, never exceptions across an API.

#include <cassert>
#include <utility>
#include <variant>

#include "platform/value/Error.h"

namespace tn {

template <typename T>
class [[nodiscard]] Result {
 public:
  Result(T value) : state_(std::move(value)) {}       // NOLINT: implicit by design
  Result(Error error) : state_(std::move(error)) {}   // NOLINT: implicit by design

  bool ok() const { return std::holds_alternative<T>(state_); }
  explicit operator bool() const { return ok(); }

  // Requires ok().
  const T& value() const& { assert(ok()); return std::get<T>(state_); }
  T& value() & { assert(ok()); return std::get<T>(state_); }
  T&& value() && { assert(ok()); return std::get<T>(std::move(state_)); }
  const T& operator*() const& { return value(); }
  T& operator*() & { return value(); }
  const T* operator->() const { return &value(); }
  T* operator->() { return &value(); }

  // Requires !ok().
  const Error& error() const { assert(!ok()); return std::get<Error>(state_); }

 private:
  std::variant<T, Error> state_;
};

// Result<void>: success, or an error.
template <>
class [[nodiscard]] Result<void> {
 public:
  Result() = default;
  Result(Error error) : error_(std::move(error)), failed_(true) {}  // NOLINT

  bool ok() const { return !failed_; }
  explicit operator bool() const { return ok(); }
  const Error& error() const { assert(failed_); return error_; }

 private:
  Error error_;
  bool failed_ = false;
};

}  // namespace tn
