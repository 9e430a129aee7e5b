#include "common/Value.h"

#include <cctype>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <functional>
#include <random>

namespace qn {

Date Date::Now() {
  using namespace std::chrono;
  return Date{duration<double>(system_clock::now().time_since_epoch()).count()};
}

Value::Value(Array a) : v_(std::make_shared<const Array>(std::move(a))) {}
Value::Value(Dictionary d) : v_(std::make_shared<const Dictionary>(std::move(d))) {}
Value::Value(std::shared_ptr<const Array> a) {
  if (a) v_ = std::move(a);
}
Value::Value(std::shared_ptr<const Dictionary> d) {
  if (d) v_ = std::move(d);
}

const Array* Value::as_array() const {
  auto p = std::get_if<std::shared_ptr<const Array>>(&v_);
  return p ? p->get() : nullptr;
}

const Dictionary* Value::as_dictionary() const {
  auto p = std::get_if<std::shared_ptr<const Dictionary>>(&v_);
  return p ? p->get() : nullptr;
}

std::shared_ptr<const Array> Value::shared_array() const {
  auto p = std::get_if<std::shared_ptr<const Array>>(&v_);
  return p ? *p : nullptr;
}

std::shared_ptr<const Dictionary> Value::shared_dictionary() const {
  auto p = std::get_if<std::shared_ptr<const Dictionary>>(&v_);
  return p ? *p : nullptr;
}

std::optional<std::int64_t> Value::as_int64() const {
  if (auto i = std::get_if<std::int64_t>(&v_)) return *i;
  return std::nullopt;  // a uint64 alternative is always above INT64_MAX
}

std::optional<std::uint64_t> Value::as_uint64() const {
  if (auto i = std::get_if<std::int64_t>(&v_)) {
    if (*i >= 0) return static_cast<std::uint64_t>(*i);
    return std::nullopt;
  }
  if (auto u = std::get_if<std::uint64_t>(&v_)) return *u;
  return std::nullopt;
}

std::optional<double> Value::as_double() const {
  switch (kind()) {
    case Kind::kBool:
      return *as_bool() ? 1.0 : 0.0;
    case Kind::kInt:
      return static_cast<double>(std::get<std::int64_t>(v_));
    case Kind::kUInt:
      return static_cast<double>(std::get<std::uint64_t>(v_));
    case Kind::kDouble:
      return std::get<double>(v_);
    default:
      return std::nullopt;
  }
}

namespace {

void AppendDouble(std::string& out, double d) {
  if (std::isnan(d)) {
    out += "nan";
    return;
  }
  if (std::isinf(d)) {
    out += d > 0 ? "inf" : "-inf";
    return;
  }
  char buf[64];
  auto r = std::to_chars(buf, buf + sizeof buf, d);
  out.append(buf, r.ptr);
}

// Strings inside collections are quoted unless they are a plain word, so that the printed
// form of a collection stays unambiguous.
bool IsPlainWord(const std::string& s) {
  if (s.empty()) return false;
  for (unsigned char c : s) {
    if (!(std::isalnum(c) || c == '_' || c == '.' || c == '/' || c == '-')) return false;
  }
  return true;
}

void AppendQuoted(std::string& out, const std::string& s) {
  out += '"';
  for (char c : s) {
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
      default:
        out += c;
    }
  }
  out += '"';
}

void Indent(std::string& out, int indent) { out.append(static_cast<std::size_t>(indent) * 4, ' '); }

}  // namespace

void Value::Describe(std::string& out, int indent, bool nested) const {
  switch (kind()) {
    case Kind::kNull:
      out += "<null>";
      break;
    case Kind::kBool:
      out += *as_bool() ? "1" : "0";
      break;
    case Kind::kInt:
      out += std::to_string(std::get<std::int64_t>(v_));
      break;
    case Kind::kUInt:
      out += std::to_string(std::get<std::uint64_t>(v_));
      break;
    case Kind::kDouble:
      AppendDouble(out, std::get<double>(v_));
      break;
    case Kind::kString: {
      const std::string& s = std::get<std::string>(v_);
      if (nested && !IsPlainWord(s)) {
        AppendQuoted(out, s);
      } else {
        out += s;
      }
      break;
    }
    case Kind::kData: {
      static const char* kHex = "0123456789abcdef";
      out += '<';
      for (std::uint8_t b : as_data()->bytes) {
        out += kHex[b >> 4];
        out += kHex[b & 15];
      }
      out += '>';
      break;
    }
    case Kind::kDate: {
      // A date without a calendar form (NaN, infinite, far beyond any year) prints its seconds.
      const double seconds = as_date()->seconds_since_1970;
      std::tm tm{};
      char buf[64];
      if (std::isfinite(seconds) && std::fabs(seconds) < 1e14) {
        std::time_t t = static_cast<std::time_t>(std::floor(seconds));
        if (gmtime_r(&t, &tm) && std::strftime(buf, sizeof buf, "%Y-%m-%d %H:%M:%S +0000", &tm)) {
          out += buf;
          break;
        }
      }
      AppendDouble(out, seconds);
      break;
    }
    case Kind::kArray: {
      const Array& a = *as_array();
      out += "(\n";
      for (std::size_t i = 0; i < a.size(); ++i) {
        Indent(out, indent + 1);
        a[i].Describe(out, indent + 1, true);
        out += i + 1 < a.size() ? ",\n" : "\n";
      }
      Indent(out, indent);
      out += ')';
      break;
    }
    case Kind::kDictionary: {
      out += "{\n";
      for (const auto& [k, v] : *as_dictionary()) {
        Indent(out, indent + 1);
        k.Describe(out, indent + 1, true);
        out += " = ";
        v.Describe(out, indent + 1, true);
        out += ";\n";
      }
      Indent(out, indent);
      out += '}';
      break;
    }
  }
}

std::string Value::Description() const {
  std::string out;
  Describe(out, 0, false);
  return out;
}

namespace {

constexpr double kTwoTo63 = 9223372036854775808.0;
constexpr double kTwoTo64 = 18446744073709551616.0;

// Exact comparisons of an integer with a double: equal only when the double is integral
// and has exactly that value (no rounding of the integer to double).
bool EqualsDouble(std::int64_t i, double d) {
  return d >= -kTwoTo63 && d < kTwoTo63 && d == std::trunc(d) && static_cast<std::int64_t>(d) == i;
}
bool EqualsDouble(std::uint64_t u, double d) {
  return d >= 0 && d < kTwoTo64 && d == std::trunc(d) && static_cast<std::uint64_t>(d) == u;
}

}  // namespace

bool Value::operator==(const Value& other) const {
  if (is_number() && other.is_number()) {
    const Value& a = kind() == Kind::kDouble ? other : *this;  // a double is b's, if any
    const Value& b = kind() == Kind::kDouble ? *this : other;
    if (b.kind() != Kind::kDouble) return v_ == other.v_;  // int64 and uint64 never overlap
    const double d = std::get<double>(b.v_);
    switch (a.kind()) {
      case Kind::kInt:
        return EqualsDouble(std::get<std::int64_t>(a.v_), d);
      case Kind::kUInt:
        return EqualsDouble(std::get<std::uint64_t>(a.v_), d);
      default: {
        // NaN equals NaN here, so that a NaN key can be found and replaced like any other.
        const double e = std::get<double>(a.v_);
        return e == d || (std::isnan(e) && std::isnan(d));
      }
    }
  }
  if (kind() != other.kind()) return false;
  switch (kind()) {
    case Kind::kString:  // the common case of key lookups: no variant visit
      return std::get<std::string>(v_) == std::get<std::string>(other.v_);
    case Kind::kArray:
      return as_array() == other.as_array() || *as_array() == *other.as_array();
    case Kind::kDictionary:
      return as_dictionary() == other.as_dictionary() || *as_dictionary() == *other.as_dictionary();
    case Kind::kDate: {
      const double x = as_date()->seconds_since_1970, y = other.as_date()->seconds_since_1970;
      return x == y || (std::isnan(x) && std::isnan(y));
    }
    default:
      return v_ == other.v_;
  }
}

namespace {

// Hashing is keyed with a random per-process key (SipHash-1-3), so that a client cannot
// choose dictionary keys that all land in one bucket of an index and turn lookups linear.
struct HashKey {
  std::uint64_t k0, k1;
};

const HashKey& ProcessHashKey() {
  static const HashKey key = [] {
    std::random_device random;
    auto word = [&random] {
      return (static_cast<std::uint64_t>(random()) << 32) ^ static_cast<std::uint64_t>(random());
    };
    return HashKey{word(), word()};
  }();
  return key;
}

constexpr std::uint64_t Rotl(std::uint64_t x, int b) { return (x << b) | (x >> (64 - b)); }

struct SipState {
  std::uint64_t v0, v1, v2, v3;
  void Round() {
    v0 += v1;
    v1 = Rotl(v1, 13);
    v1 ^= v0;
    v0 = Rotl(v0, 32);
    v2 += v3;
    v3 = Rotl(v3, 16);
    v3 ^= v2;
    v0 += v3;
    v3 = Rotl(v3, 21);
    v3 ^= v0;
    v2 += v1;
    v1 = Rotl(v1, 17);
    v1 ^= v2;
    v2 = Rotl(v2, 32);
  }
  void Absorb(std::uint64_t m) {
    v3 ^= m;
    Round();
    v0 ^= m;
  }
};

std::uint64_t SipHash13(const unsigned char* data, std::size_t size) {
  const HashKey& key = ProcessHashKey();
  SipState s{key.k0 ^ 0x736f6d6570736575ULL, key.k1 ^ 0x646f72616e646f6dULL,
             key.k0 ^ 0x6c7967656e657261ULL, key.k1 ^ 0x7465646279746573ULL};
  std::size_t i = 0;
  for (; i + 8 <= size; i += 8) {
    std::uint64_t m = 0;
    for (int b = 7; b >= 0; --b) m = (m << 8) | data[i + static_cast<std::size_t>(b)];
    s.Absorb(m);
  }
  std::uint64_t last = static_cast<std::uint64_t>(size & 0xff) << 56;
  for (std::size_t b = 0; i + b < size; ++b) last |= std::uint64_t{data[i + b]} << (8 * b);
  s.Absorb(last);
  s.v2 ^= 0xff;
  s.Round();
  s.Round();
  s.Round();
  return s.v0 ^ s.v1 ^ s.v2 ^ s.v3;
}

std::uint64_t HashWord(std::uint64_t word, std::uint64_t kind_tag) {
  unsigned char bytes[16];
  for (int b = 0; b < 8; ++b) {
    bytes[b] = static_cast<unsigned char>(word >> (8 * b));
    bytes[8 + b] = static_cast<unsigned char>(kind_tag >> (8 * b));
  }
  return SipHash13(bytes, sizeof bytes);
}

// Integers and the doubles equal to them share a tag, so that 1.0 finds the key 1.
constexpr std::uint64_t kNumberTag = 1, kDoubleTag = 2, kBoolTag = 3, kDateTag = 4, kDataTag = 5;

std::uint64_t HashDoubleBits(double d, std::uint64_t tag) {
  if (std::isnan(d)) return HashWord(0x7ff8000000000000ULL, tag);  // every NaN alike
  if (d == 0) d = 0;                                               // -0.0 like 0.0
  std::uint64_t bits;
  std::memcpy(&bits, &d, sizeof bits);
  return HashWord(bits, tag);
}

// Combines keyed hashes (the inputs are already unpredictable without the key).
std::uint64_t Combine(std::uint64_t h, std::uint64_t next) {
  h ^= next + 0x9e3779b97f4a7c15ULL + (h << 6) + (h >> 2);
  h ^= h >> 33;
  h *= 0xff51afd7ed558ccdULL;
  h ^= h >> 33;
  return h;
}

}  // namespace

std::size_t Value::Hash() const {
  switch (kind()) {
    case Kind::kNull:
      return HashWord(0, 0);
    case Kind::kBool:
      return HashWord(*as_bool() ? 1 : 0, kBoolTag);
    case Kind::kInt:
      return HashWord(static_cast<std::uint64_t>(std::get<std::int64_t>(v_)), kNumberTag);
    case Kind::kUInt:
      return HashWord(std::get<std::uint64_t>(v_), kNumberTag);
    case Kind::kDouble: {
      const double d = std::get<double>(v_);
      if (d == std::trunc(d)) {
        if (d >= -kTwoTo63 && d < kTwoTo63) {
          return HashWord(static_cast<std::uint64_t>(static_cast<std::int64_t>(d)), kNumberTag);
        }
        if (d >= 0 && d < kTwoTo64) return HashWord(static_cast<std::uint64_t>(d), kNumberTag);
      }
      return HashDoubleBits(d, kDoubleTag);
    }
    case Kind::kString: {
      const std::string& s = std::get<std::string>(v_);
      return SipHash13(reinterpret_cast<const unsigned char*>(s.data()), s.size());
    }
    case Kind::kData: {
      const auto& b = as_data()->bytes;
      return Combine(SipHash13(b.data(), b.size()), kDataTag);
    }
    case Kind::kDate:
      return HashDoubleBits(as_date()->seconds_since_1970, kDateTag);
    case Kind::kArray: {
      std::uint64_t h = HashWord(as_array()->size(), 0xa77a);
      for (const Value& v : *as_array()) h = Combine(h, v.Hash());
      return h;
    }
    case Kind::kDictionary: {
      // Order-independent, like equality.
      std::uint64_t h = HashWord(as_dictionary()->size(), 0xd1c7);
      for (const auto& [k, v] : *as_dictionary()) h += Combine(k.Hash(), v.Hash());
      return h;
    }
  }
  return 0;
}

Dictionary::Dictionary(std::initializer_list<Entry> entries) {
  for (const auto& [k, v] : entries) Set(k, v);
}

const Value* Dictionary::Find(const Value& key) const {
  if (!index_.empty()) {
    auto it = index_.find(key);
    return it == index_.end() ? nullptr : &entries_[it->second].second;
  }
  if (const std::string* text = key.as_string()) return Find(*text);
  for (const auto& e : entries_) {
    if (e.first == key) return &e.second;
  }
  return nullptr;
}

// Keys are nearly always strings: a small dictionary compares them without making a Value.
const Value* Dictionary::Find(std::string_view key) const {
  if (!index_.empty()) return Find(Value(key));
  for (const auto& e : entries_) {
    if (const std::string* text = e.first.as_string(); text && *text == key) return &e.second;
  }
  return nullptr;
}

void Dictionary::Set(Value key, Value value) {
  if (const Value* existing = Find(key)) {
    const_cast<Value&>(*existing) = std::move(value);
    return;
  }
  entries_.emplace_back(std::move(key), std::move(value));
  if (entries_.size() == kIndexThreshold) {
    Reindex();
  } else if (!index_.empty()) {
    index_.emplace(entries_.back().first, entries_.size() - 1);
  }
}

bool Dictionary::Erase(const Value& key) {
  for (auto it = entries_.begin(); it != entries_.end(); ++it) {
    if (it->first == key) {
      entries_.erase(it);
      Reindex();
      return true;
    }
  }
  return false;
}

void Dictionary::Merge(const Dictionary& other) {
  for (const auto& [k, v] : other) Set(k, v);
}

void Dictionary::Reserve(std::size_t n) {
  entries_.reserve(n);
  if (n >= kIndexThreshold) index_.reserve(n);
}

void Dictionary::Reindex() {
  index_.clear();
  if (entries_.size() < kIndexThreshold) return;
  for (std::size_t i = 0; i < entries_.size(); ++i) index_.emplace(entries_[i].first, i);
}

bool Dictionary::operator==(const Dictionary& other) const {
  if (size() != other.size()) return false;
  for (const auto& [k, v] : entries_) {
    const Value* o = other.Find(k);
    if (!o || !(*o == v)) return false;
  }
  return true;
}

std::size_t Value::ApproximateBytes() const {
  constexpr std::size_t kOverhead = sizeof(Value);
  if (const auto* text = as_string()) return kOverhead + text->size();
  if (const auto* data = as_data()) return kOverhead + data->bytes.size();
  std::size_t total = kOverhead;
  if (const auto* items = as_array()) {
    for (const Value& item : *items) total += item.ApproximateBytes();
  } else if (const auto* entries = as_dictionary()) {
    for (const auto& [key, value] : *entries)
      total += key.ApproximateBytes() + value.ApproximateBytes();
  }
  return total;
}

}  // namespace qn
