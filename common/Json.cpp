#include "common/Json.h"

#include <charconv>
#include <cmath>
#include <ctime>
#include <nlohmann/json.hpp>
#include <unordered_set>
#include <variant>
#include <vector>

#include "common/Format.h"

namespace qn {

namespace {

Error JsonError(JsonErrorCode code, std::string description) {
  return Error{kJsonErrorDomain, static_cast<std::int64_t>(code), std::move(description)};
}

// Length of the valid UTF-8 sequence at s[i] (a lead byte >= 0x80), or 0 when it is not
// one: overlong forms, surrogates and code points above U+10FFFF are invalid.
std::size_t Utf8SequenceLength(std::string_view s, std::size_t i) {
  auto byte = [&](std::size_t k) -> unsigned {
    return i + k < s.size() ? static_cast<unsigned char>(s[i + k]) : 0u;
  };
  auto cont = [&](std::size_t k, unsigned lo = 0x80, unsigned hi = 0xbf) {
    unsigned b = byte(k);
    return i + k < s.size() && b >= lo && b <= hi;
  };
  const unsigned c = byte(0);
  if (c >= 0xc2 && c <= 0xdf) return cont(1) ? 2 : 0;
  if (c == 0xe0) return cont(1, 0xa0) && cont(2) ? 3 : 0;
  if ((c >= 0xe1 && c <= 0xec) || c == 0xee || c == 0xef) return cont(1) && cont(2) ? 3 : 0;
  if (c == 0xed) return cont(1, 0x80, 0x9f) && cont(2) ? 3 : 0;
  if (c == 0xf0) return cont(1, 0x90) && cont(2) && cont(3) ? 4 : 0;
  if (c >= 0xf1 && c <= 0xf3) return cont(1) && cont(2) && cont(3) ? 4 : 0;
  if (c == 0xf4) return cont(1, 0x80, 0x8f) && cont(2) && cont(3) ? 4 : 0;
  return 0;
}

void AppendBase64(std::string& out, const std::vector<std::uint8_t>& bytes) {
  static const char* kAlphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::size_t i = 0;
  for (; i + 3 <= bytes.size(); i += 3) {
    std::uint32_t n = (std::uint32_t{bytes[i]} << 16) | (std::uint32_t{bytes[i + 1]} << 8) |
                      std::uint32_t{bytes[i + 2]};
    out += kAlphabet[(n >> 18) & 63];
    out += kAlphabet[(n >> 12) & 63];
    out += kAlphabet[(n >> 6) & 63];
    out += kAlphabet[n & 63];
  }
  if (std::size_t rest = bytes.size() - i; rest > 0) {
    std::uint32_t n = std::uint32_t{bytes[i]} << 16;
    if (rest == 2) n |= std::uint32_t{bytes[i + 1]} << 8;
    out += kAlphabet[(n >> 18) & 63];
    out += kAlphabet[(n >> 12) & 63];
    out += rest == 2 ? kAlphabet[(n >> 6) & 63] : '=';
    out += '=';
  }
}

// "2024-01-15T14:30:05.123Z", or nullopt for a date with no calendar form.
std::optional<std::string> IsoDate(double seconds) {
  if (!std::isfinite(seconds) || std::fabs(seconds) > 1e14) return std::nullopt;
  const long long total_millis = std::llround(seconds * 1000);
  long long whole = total_millis / 1000;
  long long millis = total_millis % 1000;
  if (millis < 0) {
    millis += 1000;
    whole -= 1;
  }
  std::time_t t = static_cast<std::time_t>(whole);
  std::tm tm{};
  if (!gmtime_r(&t, &tm)) return std::nullopt;
  char buf[64];
  std::size_t n = std::strftime(buf, sizeof buf, "%Y-%m-%dT%H:%M:%S", &tm);
  if (n == 0) return std::nullopt;
  std::snprintf(buf + n, sizeof buf - n, ".%03lldZ", millis);
  return std::string(buf);
}

// Shortest text that reads back as the same double; integral values get ".0" so that
// they read back as floating point. REQUIRES: d is finite.
void AppendDouble(std::string& out, double d) {
  char buf[400];
  const double magnitude = std::fabs(d);
  const bool fixed = magnitude == 0 || (magnitude >= 1e-5 && magnitude < 1e17);
  auto r = fixed ? std::to_chars(buf, buf + sizeof buf, d, std::chars_format::fixed)
                 : std::to_chars(buf, buf + sizeof buf, d, std::chars_format::scientific);
  std::string_view text(buf, static_cast<std::size_t>(r.ptr - buf));
  out.append(text);
  if (text.find_first_of(".e") == std::string_view::npos) out += ".0";
}

// Writes Values as JSON text. In strict mode the first value without a JSON form stops the
// writer, and error() tells what and where; in lenient mode everything is written.
class Writer {
 public:
  Writer(JsonStyle style, bool strict, std::string& out)
      : pretty_(style == JsonStyle::kPretty), strict_(strict), out_(out) {}

  bool Write(const Value& value, int level) {
    switch (value.kind()) {
      case Value::Kind::kNull:
        out_ += "null";
        return true;
      case Value::Kind::kBool:
        out_ += *value.as_bool() ? "true" : "false";
        return true;
      case Value::Kind::kInt:
        AppendInteger(*value.as_int64());
        return true;
      case Value::Kind::kUInt:
        AppendInteger(*value.as_uint64());
        return true;
      case Value::Kind::kDouble: {
        double d = *value.as_double();
        if (std::isfinite(d)) {
          AppendDouble(out_, d);
          return true;
        }
        if (strict_) return Fail("JSON cannot hold NaN or infinity");
        out_ += "null";
        return true;
      }
      case Value::Kind::kString:
        return WriteString(*value.as_string());
      case Value::Kind::kData:
        if (strict_) return Fail("JSON cannot hold data");
        out_ += '"';
        AppendBase64(out_, value.as_data()->bytes);
        out_ += '"';
        return true;
      case Value::Kind::kDate: {
        if (strict_) return Fail("JSON cannot hold a date");
        auto iso = IsoDate(value.as_date()->seconds_since_1970);
        out_ += iso ? '"' + *iso + '"' : std::string("null");
        return true;
      }
      case Value::Kind::kArray:
        return WriteArray(*value.as_array(), level);
      case Value::Kind::kDictionary:
        return WriteDictionary(*value.as_dictionary(), level);
    }
    return true;
  }

  std::optional<Error> TakeError() { return std::move(error_); }

 private:
  using PathElement = std::variant<const std::string*, std::size_t>;

  bool Fail(const std::string& what) {
    std::string path;
    for (const PathElement& element : path_) {
      if (auto* key = std::get_if<const std::string*>(&element)) {
        if (!path.empty()) path += '.';
        path += **key;
      } else {
        path += '[' + std::to_string(std::get<std::size_t>(element)) + ']';
      }
    }
    error_ = JsonError(JsonErrorCode::kInvalidValue,
                       what + " (at " + (path.empty() ? "the top level" : path) + ")");
    return false;
  }

  template <typename T>
  void AppendInteger(T n) {
    char buf[24];
    auto r = std::to_chars(buf, buf + sizeof buf, n);
    out_.append(buf, static_cast<std::size_t>(r.ptr - buf));
  }

  void NewLine(int level) {
    if (!pretty_) return;
    out_ += '\n';
    out_.append(static_cast<std::size_t>(level) * 2, ' ');
  }

  bool WriteString(std::string_view s) {
    static const char* kHex = "0123456789abcdef";
    out_ += '"';
    std::size_t i = 0, plain_from = 0;
    auto flush = [&] { out_.append(s.data() + plain_from, i - plain_from); };
    while (i < s.size()) {
      const unsigned char c = static_cast<unsigned char>(s[i]);
      if (c >= 0x20 && c != '"' && c != '\\' && c < 0x80) {
        ++i;
        continue;
      }
      if (c >= 0x80) {
        if (std::size_t n = Utf8SequenceLength(s, i)) {
          i += n;
          continue;
        }
        if (strict_) return Fail("JSON cannot hold a string that is not valid UTF-8");
        flush();
        out_ += "\xef\xbf\xbd";  // U+FFFD for the invalid byte
        plain_from = ++i;
        continue;
      }
      flush();
      switch (c) {
        case '"':
          out_ += "\\\"";
          break;
        case '\\':
          out_ += "\\\\";
          break;
        case '\b':
          out_ += "\\b";
          break;
        case '\f':
          out_ += "\\f";
          break;
        case '\n':
          out_ += "\\n";
          break;
        case '\r':
          out_ += "\\r";
          break;
        case '\t':
          out_ += "\\t";
          break;
        default:
          out_ += "\\u00";
          out_ += kHex[c >> 4];
          out_ += kHex[c & 15];
      }
      plain_from = ++i;
    }
    flush();
    out_ += '"';
    return true;
  }

  bool WriteArray(const Array& array, int level) {
    if (array.empty()) {
      out_ += "[]";
      return true;
    }
    out_ += '[';
    for (std::size_t i = 0; i < array.size(); ++i) {
      if (i > 0) out_ += ',';
      NewLine(level + 1);
      path_.emplace_back(i);
      if (!Write(array[i], level + 1)) return false;
      path_.pop_back();
    }
    NewLine(level);
    out_ += ']';
    return true;
  }

  bool WriteDictionary(const Dictionary& dictionary, int level) {
    if (dictionary.empty()) {
      out_ += "{}";
      return true;
    }
    // Printed forms of non-string keys may repeat a key: keep the first.
    std::optional<std::unordered_set<std::string>> written;
    if (!strict_) {
      for (const auto& [key, unused] : dictionary) {
        if (!key.is_string()) {
          written.emplace();
          break;
        }
      }
    }
    out_ += '{';
    bool first = true;
    for (const auto& [key, element] : dictionary) {
      std::string printed;
      const std::string* name = key.as_string();
      if (!name) {
        if (strict_) {
          return Fail("JSON object keys must be strings, not " + key.Description());
        }
        printed = key.Description();
        name = &printed;
      }
      if (written && !written->insert(*name).second) continue;
      if (!first) out_ += ',';
      first = false;
      NewLine(level + 1);
      if (!WriteString(*name)) return false;
      out_ += pretty_ ? ": " : ":";
      path_.emplace_back(name);
      if (!Write(element, level + 1)) return false;
      path_.pop_back();
    }
    NewLine(level);
    out_ += '}';
    return true;
  }

  const bool pretty_;
  const bool strict_;
  std::string& out_;
  std::vector<PathElement> path_;
  std::optional<Error> error_;
};

// Builds a Value from nlohmann's SAX events, with a depth limit (the parser itself is not
// recursive, so the limit is the only bound that matters for what is built).
class ValueBuilder {
 public:
  using json = nlohmann::json;

  bool null() { return Add(Value()); }
  bool boolean(bool b) { return Add(Value(b)); }
  bool number_integer(json::number_integer_t i) { return Add(Value(i)); }
  bool number_unsigned(json::number_unsigned_t u) { return Add(Value(u)); }
  bool number_float(json::number_float_t d, const json::string_t&) { return Add(Value(d)); }
  bool string(json::string_t& s) { return Add(Value(std::move(s))); }
  bool binary(json::binary_t&) { return Add(Value()); }  // not produced by JSON text
  bool start_object(std::size_t) { return Open(true); }
  bool key(json::string_t& k) {
    stack_.back().key = std::move(k);
    return true;
  }
  bool end_object() { return Close(); }
  bool start_array(std::size_t) { return Open(false); }
  bool end_array() { return Close(); }
  bool parse_error(std::size_t, const std::string&, const nlohmann::detail::exception& e) {
    error_ = JsonError(JsonErrorCode::kParse, e.what());
    return false;
  }

  std::optional<Error> TakeError() { return std::move(error_); }
  Value TakeRoot() { return std::move(root_); }

 private:
  struct Level {
    bool is_object;
    Array array;
    Dictionary dictionary;
    std::string key;
  };

  bool Add(Value v) {
    if (stack_.empty()) {
      root_ = std::move(v);
    } else if (stack_.back().is_object) {
      stack_.back().dictionary.Set(Value(std::move(stack_.back().key)), std::move(v));
    } else {
      stack_.back().array.push_back(std::move(v));
    }
    return true;
  }

  bool Open(bool is_object) {
    if (stack_.size() >= static_cast<std::size_t>(kMaxJsonDepth)) {
      error_ = JsonError(JsonErrorCode::kTooDeep,
                         StringWithFormat("JSON nests deeper than %d levels", kMaxJsonDepth));
      return false;
    }
    stack_.push_back(Level{is_object, {}, {}, {}});
    return true;
  }

  bool Close() {
    Level level = std::move(stack_.back());
    stack_.pop_back();
    return Add(level.is_object ? Value(std::move(level.dictionary))
                               : Value(std::move(level.array)));
  }

  std::vector<Level> stack_;
  Value root_;
  std::optional<Error> error_;
};

}  // namespace

std::optional<Error> ToJson(const Value& value, JsonStyle style, std::string& out) {
  std::string text;
  Writer writer(style, /*strict=*/true, text);
  if (!writer.Write(value, 0)) return writer.TakeError();
  out = std::move(text);
  return std::nullopt;
}

std::string ToJsonLenient(const Value& value, JsonStyle style) {
  std::string text;
  Writer writer(style, /*strict=*/false, text);
  writer.Write(value, 0);
  return text;
}

std::optional<Error> ParseJson(std::string_view text, Value& out) {
  try {
    ValueBuilder builder;
    if (!nlohmann::json::sax_parse(text, &builder)) {
      if (auto error = builder.TakeError()) return error;
      return JsonError(JsonErrorCode::kParse, "JSON parse error");
    }
    out = builder.TakeRoot();
    return std::nullopt;
  } catch (const std::exception& e) {
    return JsonError(JsonErrorCode::kParse, e.what());
  }
}

}  // namespace qn
