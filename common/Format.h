#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <type_traits>
#include <variant>
#include <vector>

#include "common/Value.h"

namespace qn {

// One argument of StringWithFormat. Integers, floating point numbers, C strings, strings,
// Values and objects with a Description() method are accepted.
class FormatArg {
 public:
  template <typename T, std::enable_if_t<std::is_integral_v<T> && std::is_signed_v<T>, int> = 0>
  FormatArg(T n) : v_(static_cast<std::int64_t>(n)) {}
  template <typename T, std::enable_if_t<std::is_integral_v<T> && std::is_unsigned_v<T>, int> = 0>
  FormatArg(T n) : v_(static_cast<std::uint64_t>(n)) {}
  FormatArg(double d) : v_(d) {}
  FormatArg(const char* s) : v_(s ? std::string(s) : std::string("(null)")) {}
  FormatArg(std::string_view s) : v_(std::string(s)) {}
  FormatArg(const std::string& s) : v_(s) {}
  FormatArg(const Value& v) : v_(v.Description()) {}
  // Anything with a Description() (held by value, reference or pointer) prints that.
  template <typename T, typename = decltype(std::declval<const T&>().Description())>
  FormatArg(const T& object) : v_(object.Description()) {}
  template <typename T, typename = decltype(std::declval<const T&>().Description())>
  FormatArg(const std::shared_ptr<T>& object)
      : v_(object ? object->Description() : std::string("(null)")) {}

  using Storage = std::variant<std::int64_t, std::uint64_t, double, std::string>;
  const Storage& storage() const { return v_; }

 private:
  Storage v_;
};

// printf-style formatting with one extension: "%@" prints an argument's printed form
// (Value::Description(), a string as itself, "(null)" for a null object). Integer
// conversions (%d %i %u %x, with any length modifier such as l, ll) and %f/%g/%e take
// any numeric argument; %s and %@ take any argument. A missing argument prints "(missing)".
std::string StringWithFormatArgs(std::string_view format, const std::vector<FormatArg>& args);

template <typename... Args>
std::string StringWithFormat(std::string_view format, const Args&... args) {
  return StringWithFormatArgs(format, std::vector<FormatArg>{FormatArg(args)...});
}

// `text` with every control character written as an escape, so that a name another
// process chose (its command name) cannot start a line of its own or move the terminal's
// cursor: "\n", "\r", "\t" and "\\" as such, other bytes below 0x20 and 0x7f as "\x1b".
// Other bytes, UTF-8 included, stay as they are.
std::string EscapeControlCharacters(std::string_view text);

// A missing object for "%@" / "%s": prints "(null)", as the formatter prints an absent object.
struct NullObject {
  std::string Description() const { return "(null)"; }
};

}  // namespace qn
