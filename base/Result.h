#pragma once
// Result<T>: a value or an Error, with the member names of std::expected.
// No implicit bool conversion and no default constructor, so `return {};`
// cannot silently mean success.

#include <utility>
#include <variant>

#include "base/Check.h"
#include "base/Error.h"

namespace vantrel::base {

template <typename T>
class [[nodiscard]] Result {
 public:
  Result(T value) : v_(std::in_place_index<0>, std::move(value)) {}
  Result(Error error) : v_(std::in_place_index<1>, std::move(error)) {}

  bool has_value() const { return v_.index() == 0; }

  T& value() & {
    VT_CHECK(has_value(), "Result::value() on an error");
    return std::get<0>(v_);
  }
  const T& value() const& {
    VT_CHECK(has_value(), "Result::value() on an error");
    return std::get<0>(v_);
  }
  T&& value() && {
    VT_CHECK(has_value(), "Result::value() on an error");
    return std::get<0>(std::move(v_));
  }
  const Error& error() const {
    VT_CHECK(!has_value(), "Result::error() on a value");
    return std::get<1>(v_);
  }
  T* operator->() { return &value(); }
  const T* operator->() const { return &value(); }

 private:
  std::variant<T, Error> v_;
};

template <>
class [[nodiscard]] Result<void> {
 public:
  static Result success() { return Result(); }
  Result(Error error) : error_(std::move(error)), ok_(false) {}

  bool has_value() const { return ok_; }
  void value() const { VT_CHECK(ok_, "Result::value() on an error"); }
  const Error& error() const {
    VT_CHECK(!ok_, "Result::error() on a value");
    return error_;
  }

 private:
  Result() = default;
  Error error_;
  bool ok_ = true;
};

}  // namespace vantrel::base

// VT_TRY(expr): evaluates a Result; on error returns that error from the
// enclosing function (whose return type must accept an Error), otherwise
// yields the value. Uses a GNU statement expression.
#define VT_TRY(expr)                                        \
  ({                                                        \
    auto _vt_result = (expr);                               \
    if (!_vt_result.has_value()) return _vt_result.error(); \
    std::move(_vt_result).value();                          \
  })
