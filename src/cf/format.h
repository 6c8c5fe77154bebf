// printf-style formatting for the system's fixed texts, with %@ (and
// %{public}@) for values.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <type_traits>

#include "cf/value.h"

namespace cf {

class FormatArg {
 public:
  enum class Kind { kNone, kSigned, kUnsigned, kDouble, kCString, kPointer, kValue };

  FormatArg() = default;
  template <typename T, std::enable_if_t<std::is_integral_v<T> && std::is_signed_v<T>, int> = 0>
  FormatArg(T v) : kind_(Kind::kSigned), i_(v) {}
  template <typename T, std::enable_if_t<std::is_integral_v<T> && std::is_unsigned_v<T> &&
                                             !std::is_same_v<T, bool>,
                                         int> = 0>
  FormatArg(T v) : kind_(Kind::kUnsigned), u_(v) {}
  FormatArg(bool v) : kind_(Kind::kSigned), i_(v) {}
  FormatArg(double v) : kind_(Kind::kDouble), d_(v) {}
  FormatArg(float v) : kind_(Kind::kDouble), d_(v) {}
  FormatArg(const char* s) : kind_(Kind::kCString), s_(s) {}
  FormatArg(const std::string& s) : kind_(Kind::kCString), s_(s.c_str()) {}
  FormatArg(const String& s) : kind_(Kind::kCString), s_(s.c_str()) {}
  FormatArg(const void* p) : kind_(Kind::kPointer), p_(p) {}
  FormatArg(const Value& v) : kind_(Kind::kValue), v_(&v) {}
  FormatArg(const Array& a) = delete;       // wrap in a Value first
  FormatArg(const Dictionary& d) = delete;  // wrap in a Value first

  Kind kind() const { return kind_; }
  int64_t AsSigned() const;
  uint64_t AsUnsigned() const;
  double AsDouble() const;
  std::string AsText() const;  // %s and %@
  const void* AsPointer() const;

 private:
  Kind kind_ = Kind::kNone;
  int64_t i_ = 0;
  uint64_t u_ = 0;
  double d_ = 0;
  const char* s_ = nullptr;
  const void* p_ = nullptr;
  const Value* v_ = nullptr;
};

std::string FormatV(std::string_view fmt, const FormatArg* args, size_t count);

template <typename... A>
std::string Format(std::string_view fmt, const A&... a) {
  const FormatArg args[] = {FormatArg(a)..., FormatArg()};
  return FormatV(fmt, args, sizeof...(A));
}

}  // namespace cf
