#include "common/Format.h"

#include <cmath>
#include <cstdio>

namespace qn {

namespace {

std::string Printf(const std::string& conversion, auto value) {
  char buf[128];
  int n = std::snprintf(buf, sizeof buf, conversion.c_str(), value);
  if (n < 0) return {};
  if (static_cast<std::size_t>(n) < sizeof buf)
    return std::string(buf, static_cast<std::size_t>(n));
  std::string big(static_cast<std::size_t>(n) + 1, '\0');
  std::snprintf(big.data(), big.size(), conversion.c_str(), value);
  big.resize(static_cast<std::size_t>(n));
  return big;
}

std::string AsText(const FormatArg::Storage& s) {
  struct {
    std::string operator()(std::int64_t i) { return std::to_string(i); }
    std::string operator()(std::uint64_t u) { return std::to_string(u); }
    std::string operator()(double d) { return Value(d).Description(); }
    std::string operator()(const std::string& str) { return str; }
  } visitor;
  return std::visit(visitor, s);
}

std::int64_t AsSigned(const FormatArg::Storage& s) {
  if (auto i = std::get_if<std::int64_t>(&s)) return *i;
  if (auto u = std::get_if<std::uint64_t>(&s)) return static_cast<std::int64_t>(*u);
  if (auto d = std::get_if<double>(&s)) {
    // Saturate instead of the undefined conversion of NaN or out-of-range doubles.
    if (std::isnan(*d)) return 0;
    if (*d >= 9223372036854775808.0) return INT64_MAX;
    if (*d < -9223372036854775808.0) return INT64_MIN;
    return static_cast<std::int64_t>(*d);
  }
  return 0;
}

double AsDouble(const FormatArg::Storage& s) {
  if (auto i = std::get_if<std::int64_t>(&s)) return static_cast<double>(*i);
  if (auto u = std::get_if<std::uint64_t>(&s)) return static_cast<double>(*u);
  if (auto d = std::get_if<double>(&s)) return *d;
  return 0;
}

}  // namespace

std::string StringWithFormatArgs(std::string_view format, const std::vector<FormatArg>& args) {
  std::string out;
  out.reserve(format.size() + 32);
  std::size_t next = 0;
  for (std::size_t i = 0; i < format.size(); ++i) {
    char c = format[i];
    if (c != '%') {
      out += c;
      continue;
    }
    // Collect flags, width, precision and length; then the conversion character.
    std::size_t j = i + 1;
    std::string flags;
    while (j < format.size() &&
           std::string_view("-+ #0123456789.").find(format[j]) != std::string_view::npos) {
      flags += format[j++];
    }
    while (j < format.size() &&
           std::string_view("hlqLjzt").find(format[j]) != std::string_view::npos) {
      ++j;  // length modifiers: all integers are formatted as 64-bit
    }
    if (j >= format.size()) {
      out.append(format.substr(i));
      break;
    }
    const char conv = format[j];
    const std::size_t start = i;
    i = j;
    if (conv == '%') {
      out += '%';
      continue;
    }
    if (std::string_view("@sdiuxXofFgGeEc").find(conv) == std::string_view::npos) {
      // Unknown conversion: keep the text as written, consume no argument.
      out.append(format.substr(start, j - start + 1));
      continue;
    }
    if (next >= args.size()) {
      out += "(missing)";
      continue;
    }
    const FormatArg::Storage& arg = args[next++].storage();
    switch (conv) {
      case '@':
      case 's':
        out += flags.empty() ? AsText(arg) : Printf("%" + flags + "s", AsText(arg).c_str());
        break;
      case 'd':
      case 'i':
        out += Printf("%" + flags + "lld", static_cast<long long>(AsSigned(arg)));
        break;
      case 'u':
      case 'x':
      case 'X':
      case 'o':
        out += Printf("%" + flags + "ll" + conv, static_cast<unsigned long long>(AsSigned(arg)));
        break;
      case 'f':
      case 'F':
      case 'g':
      case 'G':
      case 'e':
      case 'E':
        out += Printf("%" + flags + conv, AsDouble(arg));
        break;
      default:  // 'c'
        out += static_cast<char>(AsSigned(arg));
        break;
    }
  }
  return out;
}

}  // namespace qn

#include <cstring>

#include "common/Error.h"

namespace qn {

std::string EscapeControlCharacters(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (c == '\n') {
      out += "\\n";
    } else if (c == '\r') {
      out += "\\r";
    } else if (c == '\t') {
      out += "\\t";
    } else if (c == '\\') {
      out += "\\\\";
    } else if (byte < 0x20 || byte == 0x7f) {
      static constexpr char kHex[] = "0123456789abcdef";
      out += "\\x";
      out += kHex[byte >> 4];
      out += kHex[byte & 0xf];
    } else {
      out += c;
    }
  }
  return out;
}

Error ErrnoError(const std::string& what, int errnum) {
  char buf[256];
  const char* text = strerror_r(errnum, buf, sizeof buf);  // GNU variant
  return Error{"posix", errnum, what + ": " + text};
}

}  // namespace qn
