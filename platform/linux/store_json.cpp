#include "platform/linux/store_json.h"

#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstring>

namespace qn {
namespace {

// Deeper values than this are cut off (written as null) rather than risking the stack.
constexpr int kMaxDepth = 512;

constexpr char kReplacement[] = "\xEF\xBF\xBD";  // U+FFFD

// The length of the valid UTF-8 sequence starting at s[i] (2 to 4), or 0 when the bytes
// there are not one (overlong forms, surrogates and code points above U+10FFFF included).
std::size_t Utf8SequenceLength(const unsigned char* s, std::size_t i, std::size_t n) {
  const unsigned char c = s[i];
  auto cont = [&](std::size_t k) { return i + k < n && (s[i + k] & 0xC0) == 0x80; };
  if (c >= 0xC2 && c <= 0xDF) return cont(1) ? 2 : 0;
  if (c >= 0xE0 && c <= 0xEF) {
    if (!cont(1) || !cont(2)) return 0;
    if (c == 0xE0 && s[i + 1] < 0xA0) return 0;   // overlong
    if (c == 0xED && s[i + 1] >= 0xA0) return 0;  // surrogate
    return 3;
  }
  if (c >= 0xF0 && c <= 0xF4) {
    if (!cont(1) || !cont(2) || !cont(3)) return 0;
    if (c == 0xF0 && s[i + 1] < 0x90) return 0;   // overlong
    if (c == 0xF4 && s[i + 1] >= 0x90) return 0;  // above U+10FFFF
    return 4;
  }
  return 0;
}

void AppendString(std::string& out, std::string_view text) {
  static constexpr char kHex[] = "0123456789abcdef";
  const auto* s = reinterpret_cast<const unsigned char*>(text.data());
  const std::size_t n = text.size();
  out.push_back('"');
  std::size_t run = 0;  // start of the pending run of bytes that need no escaping
  std::size_t i = 0;
  while (i < n) {
    const unsigned char c = s[i];
    if (c >= 0x20 && c < 0x80 && c != '"' && c != '\\') {
      ++i;
      continue;
    }
    if (c >= 0x80) {
      if (std::size_t len = Utf8SequenceLength(s, i, n)) {
        i += len;
        continue;
      }
    }
    out.append(text.data() + run, i - run);
    switch (c) {
      case '"':
        out += "\\\"";
        break;
      case '\\':
        out += "\\\\";
        break;
      case '\n':
        out += "\\n";
        break;
      case '\r':
        out += "\\r";
        break;
      case '\t':
        out += "\\t";
        break;
      case '\b':
        out += "\\b";
        break;
      case '\f':
        out += "\\f";
        break;
      default:
        if (c < 0x20) {
          const char esc[] = {'\\', 'u', '0', '0', kHex[c >> 4], kHex[c & 0xF]};
          out.append(esc, sizeof esc);
        } else {
          out += kReplacement;
        }
    }
    ++i;
    run = i;
  }
  out.append(text.data() + run, n - run);
  out.push_back('"');
}

template <typename T>
void AppendInteger(std::string& out, T n) {
  char buf[24];
  auto r = std::to_chars(buf, buf + sizeof buf, n);
  out.append(buf, r.ptr);
}

void AppendDouble(std::string& out, double d) {
  if (!std::isfinite(d)) {
    out += "null";
    return;
  }
  char buf[32];
  auto r = std::to_chars(buf, buf + sizeof buf, d);
  out.append(buf, r.ptr);
  if (std::memchr(buf, '.', r.ptr - buf) == nullptr &&
      std::memchr(buf, 'e', r.ptr - buf) == nullptr) {
    out += ".0";
  }
}

void AppendValue(std::string& out, const Value& value, int depth) {
  if (depth > kMaxDepth) {
    out += "null";
    return;
  }
  switch (value.kind()) {
    case Value::Kind::kNull:
      out += "null";
      return;
    case Value::Kind::kBool:
      out += *value.as_bool() ? "true" : "false";
      return;
    case Value::Kind::kInt:
      AppendInteger(out, *value.as_int64());
      return;
    case Value::Kind::kUInt:
      AppendInteger(out, *value.as_uint64());
      return;
    case Value::Kind::kDouble:
      AppendDouble(out, *value.as_double());
      return;
    case Value::Kind::kString:
      AppendString(out, *value.as_string());
      return;
    case Value::Kind::kData:
    case Value::Kind::kDate:
      AppendString(out, value.Description());
      return;
    case Value::Kind::kArray: {
      out.push_back('[');
      bool first = true;
      for (const Value& element : *value.as_array()) {
        if (!first) out.push_back(',');
        first = false;
        AppendValue(out, element, depth + 1);
      }
      out.push_back(']');
      return;
    }
    case Value::Kind::kDictionary: {
      out.push_back('{');
      bool first = true;
      for (const auto& [key, element] : *value.as_dictionary()) {
        if (!first) out.push_back(',');
        first = false;
        if (const std::string* s = key.as_string()) {
          AppendString(out, *s);
        } else {
          AppendString(out, key.Description());
        }
        out.push_back(':');
        AppendValue(out, element, depth + 1);
      }
      out.push_back('}');
      return;
    }
  }
}

}  // namespace

void AppendJson(std::string& out, const Value& value) { AppendValue(out, value, 0); }

std::string StoreJsonText(const Value& value) {
  std::string out;
  AppendJson(out, value);
  return out;
}

}  // namespace qn
