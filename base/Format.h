#pragma once
// The one message formatter. Every log line and error text of the system is
// written at its call site exactly as the system's own text, placeholders
// included, and filled here:
//   %@  the argument's printable description (a value, a string, an error...)
//   %d  a signed integer        %u  an unsigned integer
//   %s  a C string ("(null)" for a null pointer)
//   %lx an unsigned integer in lower-case hexadecimal
//   %p  a pointer              %%  a percent sign
// A missing argument prints "(missing)"; an unknown conversion is copied as
// it stands. Nothing here can read past its arguments.

#include <concepts>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>

namespace vantrel::base {

// A type takes part in %@ by offering `std::string describe(const T&)`,
// found by argument-dependent lookup.
template <typename T>
concept Describable = requires(const T& t) {
  { describe(t) } -> std::convertible_to<std::string>;
};

class FormatArg {
 public:
  enum class Kind { kSigned, kUnsigned, kReal, kText, kNullText, kPointer };

  template <std::signed_integral T>
  FormatArg(T v) : kind_(Kind::kSigned), s_(v) {}
  template <std::unsigned_integral T>
  requires(!std::same_as<T, bool>) FormatArg(T v) : kind_(Kind::kUnsigned), u_(v) {}
  FormatArg(bool v) : kind_(Kind::kText), text_(v ? "YES" : "NO") {}
  FormatArg(double v) : kind_(Kind::kReal), d_(v) {}
  FormatArg(const char* v) : kind_(v ? Kind::kText : Kind::kNullText), text_(v ? v : "") {}
  FormatArg(std::string_view v) : kind_(Kind::kText), text_(v) {}
  FormatArg(const std::string& v) : kind_(Kind::kText), text_(v) {}
  FormatArg(const void* v) : kind_(Kind::kPointer), u_(reinterpret_cast<uintptr_t>(v)) {}

  template <Describable T>
  requires(!std::convertible_to<T, std::string_view>) FormatArg(const T& v)
      : kind_(Kind::kText), text_(describe(v)) {}

  template <typename T>
  FormatArg(const std::optional<T>& v) : FormatArg(v ? FormatArg(*v) : FormatArg(nullptr_text())) {}
  template <Describable T>
  FormatArg(const std::shared_ptr<T>& v)
      : FormatArg(v ? FormatArg(*v) : FormatArg(nullptr_text())) {}

  Kind kind() const { return kind_; }
  int64_t asSigned() const;
  uint64_t asUnsigned() const;
  // The text %@ and %s print: the description, the number, or "(null)".
  std::string asText() const;

 private:
  static const char* nullptr_text() { return nullptr; }
  Kind kind_;
  union {
    int64_t s_;
    uint64_t u_;
    double d_;
  };
  std::string text_;
};

std::string formatArgs(std::string_view fmt, const FormatArg* args, size_t count);

template <typename... Args>
std::string format(std::string_view fmt, const Args&... args) {
  if constexpr (sizeof...(Args) == 0) {
    return formatArgs(fmt, nullptr, 0);
  } else {
    const FormatArg list[] = {FormatArg(args)...};
    return formatArgs(fmt, list, sizeof...(Args));
  }
}

}  // namespace vantrel::base
