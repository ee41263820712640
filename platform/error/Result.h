#pragma once

#include <cassert>
#include <optional>
#include <string>
#include <utility>
#include <variant>

#include "platform/error/VendError.h"

namespace larder {

// What a function gives back when it may fail: its value, or the VendError
// that says why not. It reads like the std::optional it replaces (true
// when there is a value, `*`, `->`, `value_or`), so a caller that only
// needs to know whether it worked stays as it was, and one that reports
// the failure has the error in hand instead of an out argument.
template <typename T>
class [[nodiscard]] Result {
 public:
  Result(T value) : state_(std::in_place_index<0>, std::move(value)) {}          // NOLINT: implicit
  Result(VendError error) : state_(std::in_place_index<1>, std::move(error)) {}  // NOLINT

  [[nodiscard]] bool has_value() const { return state_.index() == 0; }
  explicit operator bool() const { return has_value(); }

  T& operator*() & { return value(); }
  const T& operator*() const& { return value(); }
  T&& operator*() && { return std::move(value()); }
  T* operator->() { return &value(); }
  const T* operator->() const { return &value(); }

  T& value() & {
    assert(has_value());
    return std::get<0>(state_);
  }
  const T& value() const& {
    assert(has_value());
    return std::get<0>(state_);
  }

  template <typename U>
  T value_or(U&& fallback) const& {
    return has_value() ? std::get<0>(state_) : static_cast<T>(std::forward<U>(fallback));
  }
  template <typename U>
  T value_or(U&& fallback) && {
    return has_value() ? std::move(std::get<0>(state_)) : static_cast<T>(std::forward<U>(fallback));
  }

  // Only when there is no value.
  [[nodiscard]] const VendError& error() const {
    assert(!has_value());
    return std::get<1>(state_);
  }
  // Why there is no value, for a log line; empty when there is one.
  [[nodiscard]] std::string errorDescription() const {
    return has_value() ? std::string() : error().description;
  }
  // The value, or nullopt: for callers to whom the reason does not matter.
  std::optional<T> optional() && {
    if (!has_value()) return std::nullopt;
    return std::move(std::get<0>(state_));
  }
  operator std::optional<T>() && { return std::move(*this).optional(); }  // NOLINT: implicit
  operator std::optional<T>() const& {                                    // NOLINT: implicit
    if (!has_value()) return std::nullopt;
    return std::get<0>(state_);
  }

  friend bool operator==(const Result& left, const Result& right) {
    return left.state_ == right.state_;
  }
  friend bool operator==(const Result& result, const T& value) {
    return result.has_value() && *result == value;
  }

 private:
  std::variant<T, VendError> state_;
};

// A result without a value: success, or the error.
template <>
class [[nodiscard]] Result<void> {
 public:
  Result() = default;
  Result(VendError error) : error_(std::move(error)) {}  // NOLINT: implicit

  [[nodiscard]] bool has_value() const { return !error_; }
  explicit operator bool() const { return has_value(); }
  [[nodiscard]] const VendError& error() const {
    assert(error_);
    return *error_;
  }
  // Why it failed, for a log line; empty on success.
  [[nodiscard]] std::string errorDescription() const {
    return error_ ? error_->description : std::string();
  }

 private:
  std::optional<VendError> error_;
};

}  // namespace larder
