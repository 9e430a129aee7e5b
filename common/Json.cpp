#include "common/Json.h"

#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstring>
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

// The writer's output: a small buffer in front of the string, so that the many short
// writes of a value are plain copies and the string grows by whole buffers. Flush() before
// the string is read.
class Sink {
 public:
  static constexpr std::size_t kSize = 2048;

  explicit Sink(std::string& out) : out_(out) {}

  void Put(char c) {
    if (used_ == kSize) Flush();
    buffer_[used_++] = c;
  }
  // Forced inline: this is the writer's hot path, and the store's ingest rate shows it.
  [[gnu::always_inline]] void Put(const char* text, std::size_t n) {
    if (n > kSize - used_) {
      PutLong(text, n);
      return;
    }
    std::memcpy(buffer_ + used_, text, n);
    used_ += n;
  }
  void Put(std::string_view text) { Put(text.data(), text.size()); }
  template <std::size_t N>
  void Put(const char (&literal)[N]) {
    Put(literal, N - 1);
  }
  // Room for `n` bytes to be written in place, then Commit()ted. REQUIRES: n <= kSize.
  char* Reserve(std::size_t n) {
    if (n > kSize - used_) Flush();
    return buffer_ + used_;
  }
  void Commit(std::size_t n) { used_ += n; }
  void Flush() {
    out_.append(buffer_, used_);
    used_ = 0;
  }

 private:
  // Put() of more than the buffer has room for.
  void PutLong(const char* text, std::size_t n) {
    Flush();
    if (n > kSize) {
      out_.append(text, n);
    } else {
      std::memcpy(buffer_, text, n);
      used_ = n;
    }
  }

  std::string& out_;
  char buffer_[kSize];
  std::size_t used_ = 0;
};

void PutBase64(Sink& out, const std::vector<std::uint8_t>& bytes) {
  static const char* kAlphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::size_t i = 0;
  for (; i + 3 <= bytes.size(); i += 3) {
    std::uint32_t n = (std::uint32_t{bytes[i]} << 16) | (std::uint32_t{bytes[i + 1]} << 8) |
                      std::uint32_t{bytes[i + 2]};
    const char quad[4] = {kAlphabet[(n >> 18) & 63], kAlphabet[(n >> 12) & 63],
                          kAlphabet[(n >> 6) & 63], kAlphabet[n & 63]};
    out.Put(quad, 4);
  }
  if (std::size_t rest = bytes.size() - i; rest > 0) {
    std::uint32_t n = std::uint32_t{bytes[i]} << 16;
    if (rest == 2) n |= std::uint32_t{bytes[i + 1]} << 8;
    const char quad[4] = {kAlphabet[(n >> 18) & 63], kAlphabet[(n >> 12) & 63],
                          rest == 2 ? kAlphabet[(n >> 6) & 63] : '=', '='};
    out.Put(quad, 4);
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

// Shortest text that reads back as the same double, in fixed notation for magnitudes from
// 1e-5 below 1e17 and scientific otherwise; integral values get ".0" so that they read
// back as floating point. REQUIRES: d is finite.
void PutDouble(Sink& out, double d) {
  // Far more than the longest shortest form (fixed notation below 1e17 included).
  constexpr std::size_t kRoom = 400;
  char* p = out.Reserve(kRoom + 2);
  const double magnitude = std::fabs(d);
  const bool fixed = magnitude == 0 || (magnitude >= 1e-5 && magnitude < 1e17);
  auto r = fixed ? std::to_chars(p, p + kRoom, d, std::chars_format::fixed)
                 : std::to_chars(p, p + kRoom, d, std::chars_format::scientific);
  std::size_t n = static_cast<std::size_t>(r.ptr - p);
  if (std::memchr(p, '.', n) == nullptr && std::memchr(p, 'e', n) == nullptr) {
    std::memcpy(r.ptr, ".0", 2);
    n += 2;
  }
  out.Commit(n);
}

// Whether none of the 8 bytes in `w` needs attention when writing a string: no byte below
// 0x20, no '"', no '\\' and no byte of 0x80 or above (those go through UTF-8 validation).
inline bool PlainWord(std::uint64_t w) {
  constexpr std::uint64_t kOnes = 0x0101010101010101ULL;
  constexpr std::uint64_t kHighs = 0x8080808080808080ULL;
  auto zero_byte = [](std::uint64_t v) { return (v - kOnes) & ~v & kHighs; };
  const std::uint64_t below_space = (w - kOnes * 0x20) & ~w & kHighs;
  return ((w & kHighs) | below_space | zero_byte(w ^ (kOnes * '"')) |
          zero_byte(w ^ (kOnes * '\\'))) == 0;
}

inline bool PlainByte(unsigned char c) { return c >= 0x20 && c < 0x80 && c != '"' && c != '\\'; }

// Writes the escape of the ASCII byte `c` (a control character, '"' or '\\').
void PutEscape(Sink& out, unsigned char c) {
  static constexpr char kHex[] = "0123456789abcdef";
  char escape[6] = {'\\', 'u', '0', '0', kHex[c >> 4], kHex[c & 15]};
  switch (c) {
    case '"':
    case '\\':
      escape[1] = static_cast<char>(c);
      break;
    case '\b':
      escape[1] = 'b';
      break;
    case '\f':
      escape[1] = 'f';
      break;
    case '\n':
      escape[1] = 'n';
      break;
    case '\r':
      escape[1] = 'r';
      break;
    case '\t':
      escape[1] = 't';
      break;
    default:
      out.Put(escape, 6);
      return;
  }
  out.Put(escape, 2);
}

// Our own writer rather than nlohmann/json's dump (whose parser we do use): for the store's
// hot path, the compact text of a typical 8-key payload (bench_json_writer), this writer
// takes 220-232 ns; nlohmann takes 1090-1115 ns with the conversion of our Value to its
// tree that a switch would need, and 575-583 ns for the dump of a ready tree alone (CPU
// time, medians of 5, the 2-core development machine under load).
//
// Writes Values as JSON text, appending to a string. In strict mode the first value without
// a JSON form stops the writer, and TakeError() tells what and where; in lenient mode
// everything is written. The store writes every row through here: the common cases (short
// strings, integers, small maps) allocate nothing, and plain runs of a string are found
// eight bytes at a time and copied at once.
template <bool kStrict, bool kPretty>
class Writer {
 public:
  explicit Writer(std::string& out) : out_(out) {}

  // Appends the text of `value`; after a strict failure, part of it.
  void Write(const Value& value) {
    WriteValue(value, 0);
    out_.Flush();
  }

  // What stopped a strict writer; nullopt when all was written.
  std::optional<Error> TakeError() { return std::move(error_); }

 private:
  using PathElement = std::variant<const std::string*, std::size_t>;

  bool WriteValue(const Value& value, int level) {
    if (level > kMaxJsonWriteDepth) {
      if constexpr (kStrict) return Fail("JSON cannot hold values nested this deep");
      out_.Put("null");
      return true;
    }
    switch (value.kind()) {
      case Value::Kind::kNull:
        out_.Put("null");
        return true;
      case Value::Kind::kBool:
        if (*value.as_bool()) {
          out_.Put("true");
        } else {
          out_.Put("false");
        }
        return true;
      case Value::Kind::kInt:
        PutInteger(*value.as_int64());
        return true;
      case Value::Kind::kUInt:
        PutInteger(*value.as_uint64());
        return true;
      case Value::Kind::kDouble: {
        double d = *value.as_double();
        if (std::isfinite(d)) {
          PutDouble(out_, d);
          return true;
        }
        if constexpr (kStrict) return Fail("JSON cannot hold NaN or infinity");
        out_.Put("null");
        return true;
      }
      case Value::Kind::kString:
        return WriteString(*value.as_string());
      case Value::Kind::kData:
        if constexpr (kStrict) return Fail("JSON cannot hold data");
        out_.Put('"');
        PutBase64(out_, value.as_data()->bytes);
        out_.Put('"');
        return true;
      case Value::Kind::kDate: {
        if constexpr (kStrict) return Fail("JSON cannot hold a date");
        if (auto iso = IsoDate(value.as_date()->seconds_since_1970)) {
          out_.Put('"');
          out_.Put(*iso);
          out_.Put('"');
        } else {
          out_.Put("null");
        }
        return true;
      }
      case Value::Kind::kArray:
        return WriteArray(*value.as_array(), level);
      case Value::Kind::kDictionary:
        return WriteDictionary(*value.as_dictionary(), level);
    }
    return true;
  }

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

  // Only strict mode says where it failed, so only it keeps the path.
  void Enter(PathElement element) {
    if constexpr (kStrict) path_.push_back(element);
  }
  void Leave() {
    if constexpr (kStrict) path_.pop_back();
  }

  template <typename T>
  void PutInteger(T n) {
    constexpr std::size_t kRoom = 24;  // 20 digits and a sign at most
    char* p = out_.Reserve(kRoom);
    out_.Commit(static_cast<std::size_t>(std::to_chars(p, p + kRoom, n).ptr - p));
  }

  void NewLine(int level) {
    if constexpr (!kPretty) return;
    out_.Put('\n');
    for (int i = 0; i < level; ++i) out_.Put("  ");
  }

  bool WriteString(std::string_view text) {
    const auto* s = reinterpret_cast<const unsigned char*>(text.data());
    const std::size_t n = text.size();
    out_.Put('"');
    std::size_t i = 0, plain_from = 0;
    while (true) {
      // Bytes that need no escaping (valid UTF-8 sequences included) stay in the run that
      // is copied at once.
      while (i + 8 <= n) {
        std::uint64_t w;
        std::memcpy(&w, s + i, 8);
        if (!PlainWord(w)) break;
        i += 8;
      }
      while (i < n && PlainByte(s[i])) ++i;
      if (i >= n) break;
      const unsigned char c = s[i];
      if (c >= 0x80) {
        if (std::size_t length = Utf8SequenceLength(text, i)) {
          i += length;
          continue;
        }
        if constexpr (kStrict) return Fail("JSON cannot hold a string that is not valid UTF-8");
        out_.Put(text.data() + plain_from, i - plain_from);
        out_.Put("\xef\xbf\xbd");  // U+FFFD for the invalid byte
      } else {
        out_.Put(text.data() + plain_from, i - plain_from);
        PutEscape(out_, c);
      }
      plain_from = ++i;
    }
    out_.Put(text.data() + plain_from, n - plain_from);
    out_.Put('"');
    return true;
  }

  bool WriteArray(const Array& array, int level) {
    if (array.empty()) {
      out_.Put("[]");
      return true;
    }
    out_.Put('[');
    for (std::size_t i = 0; i < array.size(); ++i) {
      if (i > 0) out_.Put(',');
      NewLine(level + 1);
      Enter(i);
      if (!WriteValue(array[i], level + 1)) return false;
      Leave();
    }
    NewLine(level);
    out_.Put(']');
    return true;
  }

  bool WriteDictionary(const Dictionary& dictionary, int level) {
    if (dictionary.empty()) {
      out_.Put("{}");
      return true;
    }
    // Printed forms of non-string keys may repeat a key: keep the first.
    std::optional<std::unordered_set<std::string>> written;
    if constexpr (!kStrict) {
      for (const auto& [key, unused] : dictionary) {
        if (!key.is_string()) {
          written.emplace();
          break;
        }
      }
    }
    out_.Put('{');
    bool first = true;
    for (const auto& [key, element] : dictionary) {
      std::string printed;
      const std::string* name = key.as_string();
      if (!name) {
        if constexpr (kStrict) {
          return Fail("JSON object keys must be strings, not " + key.Description());
        }
        printed = key.Description();
        name = &printed;
      }
      if (written && !written->insert(*name).second) continue;
      if (!first) out_.Put(',');
      first = false;
      NewLine(level + 1);
      if (!WriteString(*name)) return false;
      if constexpr (kPretty) {
        out_.Put(": ");
      } else {
        out_.Put(':');
      }
      Enter(name);
      if (!WriteValue(element, level + 1)) return false;
      Leave();
    }
    NewLine(level);
    out_.Put('}');
    return true;
  }

  Sink out_;
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

// Appends the text of `value` to `out`. Returns the strict mode's error, if any (then `out`
// holds part of the text).
template <bool kStrict>
std::optional<Error> WriteJson(const Value& value, JsonStyle style, std::string& out) {
  if (style == JsonStyle::kPretty) {
    Writer<kStrict, true> writer(out);
    writer.Write(value);
    return writer.TakeError();
  }
  Writer<kStrict, false> writer(out);
  writer.Write(value);
  return writer.TakeError();
}

}  // namespace

std::optional<Error> ToJson(const Value& value, JsonStyle style, std::string& out) {
  std::string text;
  if (auto error = WriteJson<true>(value, style, text)) return error;
  out = std::move(text);
  return std::nullopt;
}

std::string ToJsonLenient(const Value& value, JsonStyle style) {
  std::string text;
  WriteJson<false>(value, style, text);
  return text;
}

void AppendJsonLenient(std::string& out, const Value& value) {
  WriteJson<false>(value, JsonStyle::kCompact, out);
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
