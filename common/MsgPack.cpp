#include "common/MsgPack.h"

#include <array>
#include <cmath>
#include <cstdint>
#include <cstring>
#include <ctime>
#include <iterator>
#include <msgpack.hpp>
#include <new>
#include <utility>
#include <vector>

#include "common/Format.h"

namespace qn {

namespace {

using protocol::ConnectionError;
using protocol::RequestProblem;

constexpr std::int8_t kTimestampExtType = -1;
constexpr std::uint32_t kNanosPerSecond = 1'000'000'000;

// --- Encoding ---------------------------------------------------------------------------

// The stream msgpack::packer writes to: appends to a caller's string.
class StringSink {
 public:
  explicit StringSink(std::string& out) : out_(out) {}
  void write(const char* data, std::size_t size) { out_.append(data, size); }

 private:
  std::string& out_;
};

using Packer = msgpack::packer<StringSink>;

// A double as float64. (msgpack::packer::pack_double writes a whole-numbered double as an
// integer; a double on our wire stays a double.) The packer keeps no buffer of its own, so
// writing to its sink between its calls keeps the order.
void PackFloat64(StringSink& sink, double d) {
  std::uint64_t bits = 0;
  std::memcpy(&bits, &d, sizeof bits);
  char bytes[9] = {static_cast<char>(0xcb)};
  for (int i = 8; i >= 1; --i, bits >>= 8) bytes[i] = static_cast<char>(bits & 0xff);
  sink.write(bytes, sizeof bytes);
}

// A date as whole seconds and nanoseconds (rounded to the nearest nanosecond, clamped to
// the int64 range of seconds; not finite becomes the epoch).
timespec DateParts(double seconds) {
  if (!std::isfinite(seconds)) seconds = 0;
  const double whole = std::floor(seconds);
  timespec parts{};
  if (whole < -9223372036854775808.0) {
    parts.tv_sec = INT64_MIN;
  } else if (whole >= 9223372036854775808.0) {
    parts.tv_sec = INT64_MAX;
  } else {
    parts.tv_sec = static_cast<std::int64_t>(whole);
    parts.tv_nsec = std::llround((seconds - whole) * 1e9);
    if (parts.tv_nsec >= kNanosPerSecond) {
      parts.tv_nsec = 0;
      if (parts.tv_sec < INT64_MAX) ++parts.tv_sec;
    }
  }
  return parts;
}

void Encode(StringSink& sink, Packer& packer, const Value& value) {
  switch (value.kind()) {
    case Value::Kind::kNull:
      packer.pack_nil();
      break;
    case Value::Kind::kBool:
      if (*value.as_bool()) {
        packer.pack_true();
      } else {
        packer.pack_false();
      }
      break;
    case Value::Kind::kInt:
      packer.pack_int64(*value.as_int64());  // non-negative ones in the unsigned formats
      break;
    case Value::Kind::kUInt:
      packer.pack_uint64(*value.as_uint64());
      break;
    case Value::Kind::kDouble:
      PackFloat64(sink, *value.as_double());
      break;
    case Value::Kind::kString: {
      const std::string& s = *value.as_string();
      packer.pack_str(static_cast<std::uint32_t>(s.size()));
      packer.pack_str_body(s.data(), static_cast<std::uint32_t>(s.size()));
      break;
    }
    case Value::Kind::kData: {
      const auto& bytes = value.as_data()->bytes;
      packer.pack_bin(static_cast<std::uint32_t>(bytes.size()));
      packer.pack_bin_body(reinterpret_cast<const char*>(bytes.data()),
                           static_cast<std::uint32_t>(bytes.size()));
      break;
    }
    case Value::Kind::kDate:
      packer.pack(DateParts(value.as_date()->seconds_since_1970));  // the smallest timestamp form
      break;
    case Value::Kind::kArray: {
      const Array& array = *value.as_array();
      packer.pack_array(static_cast<std::uint32_t>(array.size()));
      for (const Value& element : array) Encode(sink, packer, element);
      break;
    }
    case Value::Kind::kDictionary: {
      const Dictionary& dictionary = *value.as_dictionary();
      packer.pack_map(static_cast<std::uint32_t>(dictionary.size()));
      for (const auto& [key, element] : dictionary) {
        Encode(sink, packer, key);
        Encode(sink, packer, element);
      }
      break;
    }
  }
}

// --- Decoding ---------------------------------------------------------------------------

// The unsigned big-endian number in the `width` bytes at `p`.
std::uint64_t BigEndian(const std::uint8_t* p, std::size_t width) {
  std::uint64_t n = 0;
  for (std::size_t i = 0; i < width; ++i) n = (n << 8) | p[i];
  return n;
}

// What follows a type byte in 0xc4..0xdf: `header` is the size of the encoding up to the
// contents (the type byte, and a length or count; an extension's own type byte not
// included), or of the whole value for numbers.
struct TypeInfo {
  enum Shape : std::uint8_t { kNumber, kBinary, kExtension, kFixExtension, kString, kArray, kMap };
  Shape shape;
  std::uint8_t header;
  const char* what;  // what the bytes after the type byte hold
};
constexpr TypeInfo kTypes[] = {
    {TypeInfo::kBinary, 2, "binary length"},        // 0xc4
    {TypeInfo::kBinary, 3, "binary length"},        // 0xc5
    {TypeInfo::kBinary, 5, "binary length"},        // 0xc6
    {TypeInfo::kExtension, 2, "extension length"},  // 0xc7
    {TypeInfo::kExtension, 3, "extension length"},  // 0xc8
    {TypeInfo::kExtension, 5, "extension length"},  // 0xc9
    {TypeInfo::kNumber, 5, "float32"},              // 0xca
    {TypeInfo::kNumber, 9, "float64"},              // 0xcb
    {TypeInfo::kNumber, 2, "uint8"},                // 0xcc
    {TypeInfo::kNumber, 3, "uint16"},               // 0xcd
    {TypeInfo::kNumber, 5, "uint32"},               // 0xce
    {TypeInfo::kNumber, 9, "uint64"},               // 0xcf
    {TypeInfo::kNumber, 2, "int8"},                 // 0xd0
    {TypeInfo::kNumber, 3, "int16"},                // 0xd1
    {TypeInfo::kNumber, 5, "int32"},                // 0xd2
    {TypeInfo::kNumber, 9, "int64"},                // 0xd3
    {TypeInfo::kFixExtension, 1, ""},               // 0xd4
    {TypeInfo::kFixExtension, 1, ""},               // 0xd5
    {TypeInfo::kFixExtension, 1, ""},               // 0xd6
    {TypeInfo::kFixExtension, 1, ""},               // 0xd7
    {TypeInfo::kFixExtension, 1, ""},               // 0xd8
    {TypeInfo::kString, 2, "string length"},        // 0xd9
    {TypeInfo::kString, 3, "string length"},        // 0xda
    {TypeInfo::kString, 5, "string length"},        // 0xdb
    {TypeInfo::kArray, 3, "array count"},           // 0xdc
    {TypeInfo::kArray, 5, "array count"},           // 0xdd
    {TypeInfo::kMap, 3, "map count"},               // 0xde
    {TypeInfo::kMap, 5, "map count"},               // 0xdf
};

// The size of the header that starts with type byte `b` (see TypeInfo).
std::size_t HeaderSize(std::uint8_t b) {
  return b >= 0xc4 && b <= 0xdf ? kTypes[b - 0xc4].header : 1;
}

// A msgpack::parse visitor that builds the Value as the parser reports the items, and
// enforces the limits the parser does not know: nesting depth, counts that the remaining
// bytes cannot hold, extensions other than the timestamp. It follows the parser's position
// itself (the parser reports values, not where they were), so that every error names its
// byte offset.
//
// Values are built in place on one stack; a finished array or map takes its elements off it
// in one piece. So nothing is ever sized from a count the peer sent: containers are sized
// by the elements that did arrive, and memory stays within a small multiple of the body.
class ValueBuilder : public msgpack::null_visitor {
 public:
  explicit ValueBuilder(std::string_view body)
      : bytes_(reinterpret_cast<const std::uint8_t*>(body.data())), size_(body.size()) {
    values_.reserve(kInitialValues);
  }

  // The decoded value, once msgpack::parse has succeeded.
  Value TakeValue() { return std::move(values_.front()); }
  RequestProblem TakeProblem() { return std::move(problem_); }

  // Fails with "trailing bytes" when the value ended at `end` before the body did.
  bool CheckEnd(std::size_t end) {
    if (end == size_) return true;
    return Fail(ConnectionError::kBadMessagePack, end,
                StringWithFormat("%zu trailing bytes after the value", size_ - end));
  }

  // --- msgpack visitor interface ---
  bool visit_nil() { return Scalar(); }
  bool visit_boolean(bool b) { return Scalar(b); }
  bool visit_positive_integer(std::uint64_t u) { return Scalar(u); }
  bool visit_negative_integer(std::int64_t i) { return Scalar(i); }
  bool visit_float32(float f) { return Scalar(static_cast<double>(f)); }
  bool visit_float64(double d) { return Scalar(d); }
  bool visit_str(const char* data, std::uint32_t size) {
    pos_ += HeaderSize(bytes_[pos_]) + size;
    if (size == 0) {
      values_.emplace_back(std::string());
    } else {
      values_.emplace_back(std::string_view(data, size));
    }
    return true;
  }
  bool visit_bin(const char* data, std::uint32_t size) {
    pos_ += HeaderSize(bytes_[pos_]) + size;
    const auto* p = reinterpret_cast<const std::uint8_t*>(data);
    values_.emplace_back(
        Data{size == 0 ? std::vector<std::uint8_t>() : std::vector<std::uint8_t>(p, p + size)});
    return true;
  }
  // `data` starts with the extension's type byte, which `size` includes.
  bool visit_ext(const char* data, std::uint32_t size);
  bool start_array(std::uint32_t n) { return Open(false, n); }
  bool end_array() { return Close(); }
  bool start_map(std::uint32_t n) { return Open(true, n); }
  bool end_map() { return Close(); }
  void parse_error(std::size_t, std::size_t) {
    Fail(ConnectionError::kBadMessagePack, pos_, "reserved byte 0xc1");  // the only one
  }
  void insufficient_bytes(std::size_t, std::size_t) { DescribeTruncation(); }

 private:
  static constexpr std::size_t kInitialValues = 32;  // a typical request holds about 30

  // An open array or map: its elements are values_[first, end).
  struct Frame {
    bool is_map;
    std::size_t first;
  };

  bool Fail(ConnectionError code, std::size_t offset, const std::string& what) {
    problem_.code = code;
    problem_.message = StringWithFormat(
        "%s at byte %zu: %s",
        code == ConnectionError::kTooDeep ? "MessagePack too deep" : "bad MessagePack", offset,
        what);
    return false;
  }

  bool Truncated(std::size_t offset, const char* what, std::size_t needed, std::size_t left) {
    return Fail(ConnectionError::kBadMessagePack, offset,
                StringWithFormat("%s needs %zu bytes, %zu left", what, needed, left));
  }

  template <typename... Args>
  bool Scalar(Args&&... args) {
    pos_ += HeaderSize(bytes_[pos_]);
    values_.emplace_back(std::forward<Args>(args)...);
    return true;
  }

  bool Open(bool is_map, std::size_t n) {
    const std::size_t start = pos_;
    if (open_ >= frames_.size()) {
      return Fail(ConnectionError::kTooDeep, start,
                  StringWithFormat("more than %d levels of arrays and maps", protocol::kMaxDepth));
    }
    pos_ += HeaderSize(bytes_[pos_]);
    const std::size_t left = size_ - pos_;
    // Every element takes at least one byte.
    if (is_map ? n > left / 2 : n > left) {
      return Fail(ConnectionError::kBadMessagePack, start,
                  StringWithFormat(is_map ? "map of %zu entries, %zu bytes left"
                                          : "array of %zu elements, %zu bytes left",
                                   n, left));
    }
    frames_[open_++] = Frame{is_map, values_.size()};
    return true;
  }

  // Replaces the open container's elements on the stack with the container.
  bool Close() {
    const Frame& frame = frames_[--open_];
    const auto first = values_.begin() + static_cast<std::ptrdiff_t>(frame.first);
    Value container;
    if (frame.is_map) {
      Dictionary dictionary;
      dictionary.Reserve(static_cast<std::size_t>(values_.end() - first) / 2);
      for (auto it = first; it != values_.end(); it += 2) {
        dictionary.Set(std::move(it[0]), std::move(it[1]));
      }
      container = Value(std::move(dictionary));
    } else {
      container =
          Value(Array(std::make_move_iterator(first), std::make_move_iterator(values_.end())));
    }
    values_.erase(first, values_.end());
    values_.push_back(std::move(container));
    return true;
  }

  // Explains why the parser ran out of bytes: the item that starts at pos_ (every item
  // before it is complete) is cut short.
  void DescribeTruncation();

  const std::uint8_t* bytes_;
  std::size_t size_;
  std::size_t pos_ = 0;   // where the next item starts
  std::size_t open_ = 0;  // arrays and maps being filled: frames_[0, open_)
  std::array<Frame, protocol::kMaxDepth> frames_;
  std::vector<Value> values_;  // finished values not yet in their container
  RequestProblem problem_{ConnectionError::kBadMessagePack, "bad MessagePack"};
};

bool ValueBuilder::visit_ext(const char* data, std::uint32_t size) {
  const std::size_t start = pos_;
  pos_ += HeaderSize(bytes_[pos_]) + size;
  const auto* p = reinterpret_cast<const std::uint8_t*>(data);
  const auto type = static_cast<std::int8_t>(p[0]);
  const std::size_t n = size - 1;
  ++p;
  if (type != kTimestampExtType) {
    return Fail(ConnectionError::kBadMessagePack, start,
                StringWithFormat("unsupported extension type %d", static_cast<int>(type)));
  }
  std::int64_t sec = 0;
  std::uint32_t nsec = 0;
  switch (n) {
    case 4:
      sec = static_cast<std::int64_t>(BigEndian(p, 4));
      break;
    case 8: {
      const std::uint64_t packed = BigEndian(p, 8);
      nsec = static_cast<std::uint32_t>(packed >> 34);
      sec = static_cast<std::int64_t>(packed & 0x3ffffffffULL);
      break;
    }
    case 12:
      nsec = static_cast<std::uint32_t>(BigEndian(p, 4));
      sec = static_cast<std::int64_t>(BigEndian(p + 4, 8));
      break;
    default:
      return Fail(ConnectionError::kBadMessagePack, start,
                  StringWithFormat("timestamp of %zu bytes", n));
  }
  if (nsec >= kNanosPerSecond) {
    return Fail(ConnectionError::kBadMessagePack, start,
                StringWithFormat("timestamp with %u nanoseconds", nsec));
  }
  values_.emplace_back(Date{static_cast<double>(sec) + static_cast<double>(nsec) / 1e9});
  return true;
}

void ValueBuilder::DescribeTruncation() {
  const std::size_t start = pos_;
  if (start >= size_) {
    Truncated(start, "a value", 1, 0);
    return;
  }
  const std::uint8_t b = bytes_[start];
  std::size_t left = size_ - start - 1;  // after the type byte
  if (b >= 0xa0 && b <= 0xbf) {
    Fail(ConnectionError::kBadMessagePack, start,
         StringWithFormat("string of %u bytes, %zu left", b & 0x1fu, left));
    return;
  }
  if (b < 0xc4 || b > 0xdf) {  // one-byte items are never cut short
    Truncated(start, "a value", 1, left);
    return;
  }
  const TypeInfo& type = kTypes[b - 0xc4];
  const std::size_t width = type.header - 1u;
  if (left < width) {
    Truncated(start, type.what, width, left);
    return;
  }
  std::size_t n = BigEndian(bytes_ + start + 1, width);
  left -= width;
  switch (type.shape) {
    case TypeInfo::kString:
    case TypeInfo::kBinary:
      Fail(ConnectionError::kBadMessagePack, start,
           StringWithFormat("%s of %zu bytes, %zu left",
                            type.shape == TypeInfo::kString ? "string" : "binary", n, left));
      return;
    case TypeInfo::kFixExtension:
    case TypeInfo::kExtension:
      if (type.shape == TypeInfo::kFixExtension) n = std::size_t{1} << (b - 0xd4);
      if (left < 1) {
        Truncated(start, "extension type", 1, left);
      } else {
        Fail(ConnectionError::kBadMessagePack, start,
             StringWithFormat("extension of %zu bytes, %zu left", n, left - 1));
      }
      return;
    default:  // a number, array or map whose header is whole is never cut short
      Truncated(start, "a value", 1, left + width);
      return;
  }
}

}  // namespace

void AppendMsgPack(std::string& out, const Value& value) {
  StringSink sink(out);
  Packer packer(sink);
  Encode(sink, packer, value);
}

std::string EncodeMsgPack(const Value& value) {
  std::string out;
  AppendMsgPack(out, value);
  return out;
}

std::variant<Value, protocol::RequestProblem> DecodeMsgPack(std::string_view body) {
  try {
    ValueBuilder builder(body);
    std::size_t end = 0;
    if (msgpack::parse(body.data(), body.size(), end, builder) && builder.CheckEnd(end)) {
      return builder.TakeValue();
    }
    return builder.TakeProblem();
  } catch (const std::bad_alloc&) {
    return RequestProblem{ConnectionError::kBadMessagePack, "MessagePack body too large to decode"};
  }
}

}  // namespace qn
