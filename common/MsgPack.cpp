#include "common/MsgPack.h"

#include <cmath>
#include <cstdint>
#include <cstring>
#include <new>

#include "common/Format.h"

namespace qn {

namespace {

using protocol::ConnectionError;
using protocol::RequestProblem;

constexpr std::int8_t kTimestampExtType = -1;
constexpr std::uint32_t kNanosPerSecond = 1'000'000'000;

// --- Encoding ---------------------------------------------------------------------------

template <typename T>
void PutBigEndian(std::string& out, T value) {
  using U = std::make_unsigned_t<T>;
  U u = static_cast<U>(value);
  char bytes[sizeof(U)];
  for (std::size_t i = 0; i < sizeof(U); ++i) {
    bytes[sizeof(U) - 1 - i] = static_cast<char>(u & 0xff);
    u = static_cast<U>(u >> 8);
  }
  out.append(bytes, sizeof(U));
}

void PutByte(std::string& out, std::uint8_t b) { out.push_back(static_cast<char>(b)); }

void PutUnsigned(std::string& out, std::uint64_t u) {
  if (u < 0x80) {
    PutByte(out, static_cast<std::uint8_t>(u));
  } else if (u <= 0xff) {
    PutByte(out, 0xcc);
    PutByte(out, static_cast<std::uint8_t>(u));
  } else if (u <= 0xffff) {
    PutByte(out, 0xcd);
    PutBigEndian(out, static_cast<std::uint16_t>(u));
  } else if (u <= 0xffffffff) {
    PutByte(out, 0xce);
    PutBigEndian(out, static_cast<std::uint32_t>(u));
  } else {
    PutByte(out, 0xcf);
    PutBigEndian(out, u);
  }
}

void PutSigned(std::string& out, std::int64_t i) {
  if (i >= 0) {
    PutUnsigned(out, static_cast<std::uint64_t>(i));
  } else if (i >= -32) {
    PutByte(out, static_cast<std::uint8_t>(i));  // negative fixint 0xe0..0xff
  } else if (i >= INT8_MIN) {
    PutByte(out, 0xd0);
    PutBigEndian(out, static_cast<std::int8_t>(i));
  } else if (i >= INT16_MIN) {
    PutByte(out, 0xd1);
    PutBigEndian(out, static_cast<std::int16_t>(i));
  } else if (i >= INT32_MIN) {
    PutByte(out, 0xd2);
    PutBigEndian(out, static_cast<std::int32_t>(i));
  } else {
    PutByte(out, 0xd3);
    PutBigEndian(out, i);
  }
}

// A header with a length or count: the fixed form when `fix_limit` allows it (fix_base | n),
// else the 8-bit (when `byte8` is non-zero), 16-bit or 32-bit form.
void PutSized(std::string& out, std::size_t n, std::uint8_t fix_base, std::size_t fix_limit,
              std::uint8_t byte8, std::uint8_t byte16, std::uint8_t byte32) {
  if (n < fix_limit) {
    PutByte(out, static_cast<std::uint8_t>(fix_base | n));
  } else if (byte8 != 0 && n <= 0xff) {
    PutByte(out, byte8);
    PutByte(out, static_cast<std::uint8_t>(n));
  } else if (n <= 0xffff) {
    PutByte(out, byte16);
    PutBigEndian(out, static_cast<std::uint16_t>(n));
  } else {
    PutByte(out, byte32);
    PutBigEndian(out, static_cast<std::uint32_t>(n));
  }
}

void PutDate(std::string& out, double seconds) {
  if (!std::isfinite(seconds)) seconds = 0;
  double whole = std::floor(seconds);
  std::int64_t sec = 0;
  std::uint32_t nsec = 0;
  if (whole < -9223372036854775808.0) {
    sec = INT64_MIN;
  } else if (whole >= 9223372036854775808.0) {
    sec = INT64_MAX;
  } else {
    sec = static_cast<std::int64_t>(whole);
    nsec = static_cast<std::uint32_t>(std::llround((seconds - whole) * 1e9));
    if (nsec >= kNanosPerSecond) {
      nsec = 0;
      if (sec < INT64_MAX) ++sec;
    }
  }
  if (sec >= 0 && (sec >> 34) == 0) {
    if (nsec == 0 && sec <= 0xffffffff) {
      PutByte(out, 0xd6);  // fixext 4: timestamp 32
      PutByte(out, static_cast<std::uint8_t>(kTimestampExtType));
      PutBigEndian(out, static_cast<std::uint32_t>(sec));
    } else {
      PutByte(out, 0xd7);  // fixext 8: timestamp 64
      PutByte(out, static_cast<std::uint8_t>(kTimestampExtType));
      PutBigEndian(out, (static_cast<std::uint64_t>(nsec) << 34) | static_cast<std::uint64_t>(sec));
    }
  } else {
    PutByte(out, 0xc7);  // ext 8 with 12 bytes: timestamp 96
    PutByte(out, 12);
    PutByte(out, static_cast<std::uint8_t>(kTimestampExtType));
    PutBigEndian(out, nsec);
    PutBigEndian(out, sec);
  }
}

void Encode(std::string& out, const Value& value) {
  switch (value.kind()) {
    case Value::Kind::kNull:
      PutByte(out, 0xc0);
      break;
    case Value::Kind::kBool:
      PutByte(out, *value.as_bool() ? 0xc3 : 0xc2);
      break;
    case Value::Kind::kInt:
      PutSigned(out, *value.as_int64());
      break;
    case Value::Kind::kUInt:
      PutUnsigned(out, *value.as_uint64());
      break;
    case Value::Kind::kDouble: {
      double d = *value.as_double();
      std::uint64_t bits = 0;
      std::memcpy(&bits, &d, sizeof bits);
      PutByte(out, 0xcb);
      PutBigEndian(out, bits);
      break;
    }
    case Value::Kind::kString: {
      const std::string& s = *value.as_string();
      PutSized(out, s.size(), 0xa0, 32, 0xd9, 0xda, 0xdb);
      out.append(s);
      break;
    }
    case Value::Kind::kData: {
      const auto& bytes = value.as_data()->bytes;
      PutSized(out, bytes.size(), 0, 0, 0xc4, 0xc5, 0xc6);
      out.append(reinterpret_cast<const char*>(bytes.data()), bytes.size());
      break;
    }
    case Value::Kind::kDate:
      PutDate(out, value.as_date()->seconds_since_1970);
      break;
    case Value::Kind::kArray: {
      const Array& array = *value.as_array();
      PutSized(out, array.size(), 0x90, 16, 0, 0xdc, 0xdd);
      for (const Value& element : array) Encode(out, element);
      break;
    }
    case Value::Kind::kDictionary: {
      const Dictionary& dictionary = *value.as_dictionary();
      PutSized(out, dictionary.size(), 0x80, 16, 0, 0xde, 0xdf);
      for (const auto& [key, element] : dictionary) {
        Encode(out, key);
        Encode(out, element);
      }
      break;
    }
  }
}

// --- Decoding ---------------------------------------------------------------------------

// Recursive descent over the byte range. Every read is bounds-checked; every count is
// checked against the bytes that remain (each element takes at least one byte) before
// anything is allocated for it.
class Decoder {
 public:
  explicit Decoder(std::string_view body)
      : begin_(reinterpret_cast<const std::uint8_t*>(body.data())),
        p_(begin_),
        end_(begin_ + body.size()) {}

  bool DecodeAll(Value& out) {
    if (!DecodeValue(out, 0)) return false;
    if (p_ != end_) {
      return Fail(ConnectionError::kBadMessagePack, Offset(),
                  StringWithFormat("%zu trailing bytes after the value", Remaining()));
    }
    return true;
  }

  RequestProblem TakeProblem() { return std::move(problem_); }

 private:
  std::size_t Offset() const { return static_cast<std::size_t>(p_ - begin_); }
  std::size_t Remaining() const { return static_cast<std::size_t>(end_ - p_); }

  bool Fail(ConnectionError code, std::size_t offset, const std::string& what) {
    problem_.code = code;
    problem_.message = StringWithFormat(
        "%s at byte %zu: %s",
        code == ConnectionError::kTooDeep ? "MessagePack too deep" : "bad MessagePack", offset,
        what);
    return false;
  }

  bool Truncated(std::size_t offset, const char* what, std::size_t needed) {
    return Fail(ConnectionError::kBadMessagePack, offset,
                StringWithFormat("%s needs %zu bytes, %zu left", what, needed, Remaining()));
  }

  // Reads a big-endian T. REQUIRES: Remaining() >= sizeof(T).
  template <typename T>
  T Read() {
    using U = std::make_unsigned_t<T>;
    U u = 0;
    for (std::size_t i = 0; i < sizeof(U); ++i) u = static_cast<U>((u << 8) | p_[i]);
    p_ += sizeof(U);
    return static_cast<T>(u);
  }

  // Reads a T into out after checking that it is there.
  template <typename T>
  bool ReadChecked(std::size_t start, const char* what, T& out) {
    if (Remaining() < sizeof(T)) return Truncated(start, what, sizeof(T));
    out = Read<T>();
    return true;
  }

  // Reads the 8/16/32-bit length that follows a header byte.
  bool ReadLength(std::size_t start, const char* what, int width, std::size_t& out) {
    switch (width) {
      case 1: {
        std::uint8_t n = 0;
        if (!ReadChecked(start, what, n)) return false;
        out = n;
        return true;
      }
      case 2: {
        std::uint16_t n = 0;
        if (!ReadChecked(start, what, n)) return false;
        out = n;
        return true;
      }
      default: {
        std::uint32_t n = 0;
        if (!ReadChecked(start, what, n)) return false;
        out = n;
        return true;
      }
    }
  }

  bool DecodeBytes(std::size_t start, std::size_t n, bool is_string, Value& out) {
    if (n > Remaining()) {
      return Fail(ConnectionError::kBadMessagePack, start,
                  StringWithFormat("%s of %zu bytes, %zu left", is_string ? "string" : "binary", n,
                                   Remaining()));
    }
    const char* data = reinterpret_cast<const char*>(p_);
    p_ += n;
    if (is_string) {
      out = Value(std::string(data, n));
    } else {
      out = Value(Data{std::vector<std::uint8_t>(p_ - n, p_)});
    }
    return true;
  }

  bool DecodeArray(std::size_t start, std::size_t n, int depth, Value& out) {
    if (depth >= protocol::kMaxDepth) {
      return Fail(ConnectionError::kTooDeep, start,
                  StringWithFormat("more than %d levels of arrays and maps", protocol::kMaxDepth));
    }
    if (n > Remaining()) {
      return Fail(ConnectionError::kBadMessagePack, start,
                  StringWithFormat("array of %zu elements, %zu bytes left", n, Remaining()));
    }
    Array array;
    array.reserve(n);
    for (std::size_t i = 0; i < n; ++i) {
      array.emplace_back();
      if (!DecodeValue(array.back(), depth + 1)) return false;
    }
    out = Value(std::move(array));
    return true;
  }

  bool DecodeMap(std::size_t start, std::size_t n, int depth, Value& out) {
    if (depth >= protocol::kMaxDepth) {
      return Fail(ConnectionError::kTooDeep, start,
                  StringWithFormat("more than %d levels of arrays and maps", protocol::kMaxDepth));
    }
    if (n > Remaining() / 2) {
      return Fail(ConnectionError::kBadMessagePack, start,
                  StringWithFormat("map of %zu entries, %zu bytes left", n, Remaining()));
    }
    Dictionary dictionary;
    dictionary.Reserve(n);
    for (std::size_t i = 0; i < n; ++i) {
      Value key;
      Value value;
      if (!DecodeValue(key, depth + 1) || !DecodeValue(value, depth + 1)) return false;
      dictionary.Set(std::move(key), std::move(value));
    }
    out = Value(std::move(dictionary));
    return true;
  }

  bool DecodeExtension(std::size_t start, std::size_t n, Value& out) {
    std::int8_t type = 0;
    if (!ReadChecked(start, "extension type", type)) return false;
    if (n > Remaining()) {
      return Fail(ConnectionError::kBadMessagePack, start,
                  StringWithFormat("extension of %zu bytes, %zu left", n, Remaining()));
    }
    if (type != kTimestampExtType) {
      return Fail(ConnectionError::kBadMessagePack, start,
                  StringWithFormat("unsupported extension type %d", static_cast<int>(type)));
    }
    std::int64_t sec = 0;
    std::uint32_t nsec = 0;
    switch (n) {
      case 4:
        sec = Read<std::uint32_t>();
        nsec = 0;
        break;
      case 8: {
        std::uint64_t packed = Read<std::uint64_t>();
        nsec = static_cast<std::uint32_t>(packed >> 34);
        sec = static_cast<std::int64_t>(packed & 0x3ffffffffULL);
        break;
      }
      case 12:
        nsec = Read<std::uint32_t>();
        sec = Read<std::int64_t>();
        break;
      default:
        return Fail(ConnectionError::kBadMessagePack, start,
                    StringWithFormat("timestamp of %zu bytes", n));
    }
    if (nsec >= kNanosPerSecond) {
      return Fail(ConnectionError::kBadMessagePack, start,
                  StringWithFormat("timestamp with %u nanoseconds", nsec));
    }
    out = Value(Date{static_cast<double>(sec) + static_cast<double>(nsec) / 1e9});
    return true;
  }

  bool DecodeValue(Value& out, int depth) {
    const std::size_t start = Offset();
    if (p_ == end_) return Truncated(start, "a value", 1);
    const std::uint8_t b = *p_++;
    if (b <= 0x7f) {
      out = Value(static_cast<std::int64_t>(b));
      return true;
    }
    if (b >= 0xe0) {
      out = Value(static_cast<std::int64_t>(static_cast<std::int8_t>(b)));
      return true;
    }
    if (b <= 0x8f) return DecodeMap(start, b & 0x0f, depth, out);
    if (b <= 0x9f) return DecodeArray(start, b & 0x0f, depth, out);
    if (b <= 0xbf) return DecodeBytes(start, b & 0x1f, true, out);

    std::size_t n = 0;
    switch (b) {
      case 0xc0:
        out = Value();
        return true;
      case 0xc1:
        return Fail(ConnectionError::kBadMessagePack, start, "reserved byte 0xc1");
      case 0xc2:
        out = Value(false);
        return true;
      case 0xc3:
        out = Value(true);
        return true;
      case 0xc4:
      case 0xc5:
      case 0xc6:
        if (!ReadLength(start, "binary length", 1 << (b - 0xc4), n)) return false;
        return DecodeBytes(start, n, false, out);
      case 0xc7:
      case 0xc8:
      case 0xc9:
        if (!ReadLength(start, "extension length", 1 << (b - 0xc7), n)) return false;
        return DecodeExtension(start, n, out);
      case 0xca: {
        std::uint32_t bits = 0;
        if (!ReadChecked(start, "float32", bits)) return false;
        float f = 0;
        std::memcpy(&f, &bits, sizeof f);
        out = Value(static_cast<double>(f));
        return true;
      }
      case 0xcb: {
        std::uint64_t bits = 0;
        if (!ReadChecked(start, "float64", bits)) return false;
        double d = 0;
        std::memcpy(&d, &bits, sizeof d);
        out = Value(d);
        return true;
      }
      case 0xcc: {
        std::uint8_t u = 0;
        if (!ReadChecked(start, "uint8", u)) return false;
        out = Value(u);
        return true;
      }
      case 0xcd: {
        std::uint16_t u = 0;
        if (!ReadChecked(start, "uint16", u)) return false;
        out = Value(u);
        return true;
      }
      case 0xce: {
        std::uint32_t u = 0;
        if (!ReadChecked(start, "uint32", u)) return false;
        out = Value(u);
        return true;
      }
      case 0xcf: {
        std::uint64_t u = 0;
        if (!ReadChecked(start, "uint64", u)) return false;
        out = Value(u);
        return true;
      }
      case 0xd0: {
        std::int8_t i = 0;
        if (!ReadChecked(start, "int8", i)) return false;
        out = Value(i);
        return true;
      }
      case 0xd1: {
        std::int16_t i = 0;
        if (!ReadChecked(start, "int16", i)) return false;
        out = Value(i);
        return true;
      }
      case 0xd2: {
        std::int32_t i = 0;
        if (!ReadChecked(start, "int32", i)) return false;
        out = Value(i);
        return true;
      }
      case 0xd3: {
        std::int64_t i = 0;
        if (!ReadChecked(start, "int64", i)) return false;
        out = Value(i);
        return true;
      }
      case 0xd4:
      case 0xd5:
      case 0xd6:
      case 0xd7:
      case 0xd8:
        return DecodeExtension(start, std::size_t{1} << (b - 0xd4), out);
      case 0xd9:
      case 0xda:
      case 0xdb:
        if (!ReadLength(start, "string length", 1 << (b - 0xd9), n)) return false;
        return DecodeBytes(start, n, true, out);
      case 0xdc:
      case 0xdd:
        if (!ReadLength(start, "array count", b == 0xdc ? 2 : 4, n)) return false;
        return DecodeArray(start, n, depth, out);
      case 0xde:
      case 0xdf:
        if (!ReadLength(start, "map count", b == 0xde ? 2 : 4, n)) return false;
        return DecodeMap(start, n, depth, out);
      default:
        break;
    }
    return Fail(ConnectionError::kBadMessagePack, start, "unknown type byte");  // unreachable
  }

  const std::uint8_t* begin_;
  const std::uint8_t* p_;
  const std::uint8_t* end_;
  RequestProblem problem_{ConnectionError::kBadMessagePack, {}};
};

}  // namespace

void AppendMsgPack(std::string& out, const Value& value) { Encode(out, value); }

std::string EncodeMsgPack(const Value& value) {
  std::string out;
  Encode(out, value);
  return out;
}

std::variant<Value, protocol::RequestProblem> DecodeMsgPack(std::string_view body) {
  try {
    Decoder decoder(body);
    Value value;
    if (decoder.DecodeAll(value)) return value;
    return decoder.TakeProblem();
  } catch (const std::bad_alloc&) {
    return RequestProblem{ConnectionError::kBadMessagePack, "MessagePack body too large to decode"};
  }
}

}  // namespace qn
