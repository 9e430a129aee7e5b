#include "platform/linux/store_json.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstring>
#include <optional>
#include <unordered_set>

#include "common/Json.h"

namespace qn {
namespace {

// Deeper values than this are cut off (written as null) rather than risking the stack.
constexpr int kMaxDepth = 512;

constexpr char kReplacement[] = "\xEF\xBF\xBD";  // U+FFFD

// Input bytes of a string handled per reservation: a byte becomes at most 6 bytes
// ("\u00XX"), and a UTF-8 sequence that starts inside a chunk may run 3 bytes past it.
constexpr std::size_t kStringChunk = 16384;
constexpr std::size_t kChunkReserve = 6 * kStringChunk + 8;

constexpr std::uint64_t kOnes = 0x0101010101010101ULL;
constexpr std::uint64_t kHighs = 0x8080808080808080ULL;

// Whether none of the 8 bytes in `w` needs attention: no byte below 0x20, no '"', no
// '\\' and no byte of 0x80 or above (which goes through UTF-8 validation).
inline bool PlainWord(std::uint64_t w) {
  auto zero_byte = [](std::uint64_t v) { return (v - kOnes) & ~v & kHighs; };
  const std::uint64_t below_space = (w - kOnes * 0x20) & ~w & kHighs;
  return ((w & kHighs) | below_space | zero_byte(w ^ (kOnes * '"')) |
          zero_byte(w ^ (kOnes * '\\'))) == 0;
}

inline bool PlainByte(unsigned char c) { return c >= 0x20 && c < 0x80 && c != '"' && c != '\\'; }

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

// Writes the escape of the ASCII byte `c` (a control character, '"' or '\\') at `p`;
// returns the end.
char* WriteEscape(char* p, unsigned char c) {
  static constexpr char kHex[] = "0123456789abcdef";
  *p++ = '\\';
  switch (c) {
    case '"':
      *p++ = '"';
      break;
    case '\\':
      *p++ = '\\';
      break;
    case '\n':
      *p++ = 'n';
      break;
    case '\r':
      *p++ = 'r';
      break;
    case '\t':
      *p++ = 't';
      break;
    case '\b':
      *p++ = 'b';
      break;
    case '\f':
      *p++ = 'f';
      break;
    default:
      *p++ = 'u';
      *p++ = '0';
      *p++ = '0';
      *p++ = kHex[c >> 4];
      *p++ = kHex[c & 0xF];
  }
  return p;
}

}  // namespace

// Writes values into a JsonBuffer: reserves room for a bounded piece, writes it through a
// plain pointer, commits it.
class JsonWriter {
 public:
  explicit JsonWriter(JsonBuffer& out) : out_(out) {}

  void Write(const Value& value, int depth) {
    if (depth > kMaxDepth) {
      Literal("null");
      return;
    }
    switch (value.kind()) {
      case Value::Kind::kNull:
        Literal("null");
        return;
      case Value::Kind::kBool:
        if (*value.as_bool()) {
          Literal("true");
        } else {
          Literal("false");
        }
        return;
      case Value::Kind::kInt:
        Integer(*value.as_int64());
        return;
      case Value::Kind::kUInt:
        Integer(*value.as_uint64());
        return;
      case Value::Kind::kDouble:
        Double(*value.as_double());
        return;
      case Value::Kind::kString:
        String(*value.as_string());
        return;
      case Value::Kind::kData:
      case Value::Kind::kDate:
        Lenient(value);
        return;
      case Value::Kind::kArray: {
        Char('[');
        bool first = true;
        for (const Value& element : *value.as_array()) {
          if (!first) Char(',');
          first = false;
          Write(element, depth + 1);
        }
        Char(']');
        return;
      }
      case Value::Kind::kDictionary: {
        const Dictionary& dictionary = *value.as_dictionary();
        // A key that is not a string is written as its printed form; when that repeats a
        // key already written, the later entry is left out.
        std::optional<std::unordered_set<std::string>> written;
        for (const auto& entry : dictionary) {
          if (!entry.first.is_string()) {
            written.emplace();
            break;
          }
        }
        Char('{');
        bool first = true;
        for (const auto& [key, element] : dictionary) {
          std::string printed;
          const std::string* name = key.as_string();
          if (!name) {
            printed = key.Description();
            name = &printed;
          }
          if (written && !written->insert(*name).second) continue;
          if (!first) Char(',');
          first = false;
          String(*name);
          Char(':');
          Write(element, depth + 1);
        }
        Char('}');
        return;
      }
    }
  }

 private:
  void Char(char c) {
    *out_.Reserve(1) = c;
    out_.Commit(1);
  }

  template <std::size_t N>
  void Literal(const char (&text)[N]) {
    std::memcpy(out_.Reserve(N - 1), text, N - 1);
    out_.Commit(N - 1);
  }

  template <typename T>
  void Integer(T n) {
    char* p = out_.Reserve(24);
    auto r = std::to_chars(p, p + 24, n);
    out_.Commit(static_cast<std::size_t>(r.ptr - p));
  }

  // The shortest text that reads back as the same double, in fixed notation for
  // magnitudes from 1e-5 below 1e17 and scientific otherwise; ".0" is added to integral
  // values so that they read back as floating point (as ToJsonLenient writes them).
  void Double(double d) {
    if (!std::isfinite(d)) {
      Literal("null");
      return;
    }
    // Fixed notation of a magnitude below 1e17 is at most 17 digits before the point and
    // the 17 significant ones after it, far below this.
    constexpr std::size_t kRoom = 400;
    char* p = out_.Reserve(kRoom + 2);
    const double magnitude = std::fabs(d);
    const bool fixed = magnitude == 0 || (magnitude >= 1e-5 && magnitude < 1e17);
    auto r = fixed ? std::to_chars(p, p + kRoom, d, std::chars_format::fixed)
                   : std::to_chars(p, p + kRoom, d, std::chars_format::scientific);
    const std::size_t n = static_cast<std::size_t>(r.ptr - p);
    if (std::memchr(p, '.', n) == nullptr && std::memchr(p, 'e', n) == nullptr) {
      std::memcpy(r.ptr, ".0", 2);
      out_.Commit(n + 2);
    } else {
      out_.Commit(n);
    }
  }

  // Data (base64) and dates (ISO-8601 UTC with milliseconds): rare in payloads, so they
  // go through the program's lenient serialiser itself.
  void Lenient(const Value& value) {
    const std::string text = ToJsonLenient(value, JsonStyle::kCompact);
    std::memcpy(out_.Reserve(text.size()), text.data(), text.size());
    out_.Commit(text.size());
  }

  void String(std::string_view text) {
    const auto* s = reinterpret_cast<const unsigned char*>(text.data());
    const std::size_t n = text.size();
    Char('"');
    std::size_t i = 0;
    while (i < n) {
      const std::size_t chunk_end = std::min(n, i + kStringChunk);
      char* const start = out_.Reserve(kChunkReserve);
      char* p = start;
      while (i < chunk_end) {
        // A run of bytes that need no escaping: 8 at a time, then one at a time.
        const std::size_t run = i;
        while (i + 8 <= chunk_end) {
          std::uint64_t w;
          std::memcpy(&w, s + i, 8);
          if (!PlainWord(w)) break;
          i += 8;
        }
        while (i < chunk_end && PlainByte(s[i])) ++i;
        std::memcpy(p, s + run, i - run);
        p += i - run;
        if (i >= chunk_end) break;

        const unsigned char c = s[i];
        if (c >= 0x80) {
          if (std::size_t len = Utf8SequenceLength(s, i, n)) {
            std::memcpy(p, s + i, len);
            p += len;
            i += len;
          } else {
            std::memcpy(p, kReplacement, 3);
            p += 3;
            ++i;
          }
        } else {
          p = WriteEscape(p, c);
          ++i;
        }
      }
      out_.Commit(static_cast<std::size_t>(p - start));
    }
    Char('"');
  }

  JsonBuffer& out_;
};

void JsonBuffer::Grow(std::size_t n) {
  const std::size_t capacity = std::max({capacity_ * 2, size_ + n, std::size_t{256}});
  auto data = std::make_unique_for_overwrite<char[]>(capacity);
  if (size_ > 0) std::memcpy(data.get(), data_.get(), size_);
  data_ = std::move(data);
  capacity_ = capacity;
}

void JsonBuffer::Append(const Value& value) { JsonWriter(*this).Write(value, 0); }

void AppendJson(std::string& out, const Value& value) {
  JsonBuffer buffer;
  buffer.Append(value);
  out.append(buffer.view());
}

std::string StoreJsonText(const Value& value) {
  JsonBuffer buffer;
  buffer.Append(value);
  return std::string(buffer.view());
}

}  // namespace qn
