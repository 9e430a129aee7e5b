#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <unordered_map>
#include <utility>
#include <variant>
#include <vector>

namespace qn {

class Value;
class Dictionary;
using Array = std::vector<Value>;

// Raw bytes ("data" in a property list).
struct Data {
  std::vector<std::uint8_t> bytes;
  bool operator==(const Data&) const = default;
};

// A point in wall-clock time, in seconds since the Unix epoch.
struct Date {
  double seconds_since_1970 = 0;
  static Date Now();
  bool operator==(const Date&) const = default;
};

// A property-list value: null, bool, signed/unsigned 64-bit integer, double, string, data,
// date, array or dictionary. Arrays and dictionaries are held by reference to immutable
// storage, so copying a Value is cheap and a payload can be handed to several sinks without
// being copied. Build a collection as a plain Array / Dictionary, then wrap it.
//
// Integers: any integer that fits int64 is stored as int64; only values above INT64_MAX
// are stored as uint64. Numbers compare by numeric value (1 == 1u == 1.0); bools are not
// numbers for comparison.
//
// Not thread-safe to mutate (it has no mutators); safe to read from any thread.
class Value {
 public:
  enum class Kind {
    kNull,
    kBool,
    kInt,
    kUInt,
    kDouble,
    kString,
    kData,
    kDate,
    kArray,
    kDictionary
  };

  Value() = default;
  Value(std::nullptr_t) {}
  Value(bool b) : v_(b) {}
  template <typename T,
            std::enable_if_t<std::is_integral_v<T> && !std::is_same_v<T, bool>, int> = 0>
  Value(T n) {
    if constexpr (std::is_signed_v<T>) {
      v_ = static_cast<std::int64_t>(n);
    } else if (static_cast<std::uint64_t>(n) <= static_cast<std::uint64_t>(INT64_MAX)) {
      v_ = static_cast<std::int64_t>(n);
    } else {
      v_ = static_cast<std::uint64_t>(n);
    }
  }
  Value(double d) : v_(d) {}
  Value(float f) : v_(static_cast<double>(f)) {}
  Value(std::string s) : v_(std::move(s)) {}
  Value(std::string_view s) : v_(std::string(s)) {}
  Value(const char* s) : v_(std::string(s)) {}
  Value(Data d) : v_(std::move(d)) {}
  Value(Date d) : v_(d) {}
  Value(Array a);
  Value(Dictionary d);
  Value(std::shared_ptr<const Array> a);
  Value(std::shared_ptr<const Dictionary> d);

  Kind kind() const { return static_cast<Kind>(v_.index()); }
  bool is_null() const { return kind() == Kind::kNull; }
  bool is_bool() const { return kind() == Kind::kBool; }
  bool is_integer() const { return kind() == Kind::kInt || kind() == Kind::kUInt; }
  bool is_number() const { return is_integer() || kind() == Kind::kDouble; }
  bool is_string() const { return kind() == Kind::kString; }
  bool is_array() const { return kind() == Kind::kArray; }
  bool is_dictionary() const { return kind() == Kind::kDictionary; }

  // Typed access. Each returns nullptr / nullopt when the value is of another kind.
  const bool* as_bool() const { return std::get_if<bool>(&v_); }
  const std::string* as_string() const { return std::get_if<std::string>(&v_); }
  const Data* as_data() const { return std::get_if<Data>(&v_); }
  const Date* as_date() const { return std::get_if<Date>(&v_); }
  const Array* as_array() const;
  const Dictionary* as_dictionary() const;
  std::shared_ptr<const Array> shared_array() const;
  std::shared_ptr<const Dictionary> shared_dictionary() const;
  // An integer that fits the requested type (doubles are not converted).
  std::optional<std::int64_t> as_int64() const;
  std::optional<std::uint64_t> as_uint64() const;
  // Any number (bools count as 0/1 here, as a settings store reads them).
  std::optional<double> as_double() const;

  // The printed form: a number as its decimal digits, a string as itself, data as <hex>,
  // a date as "yyyy-MM-dd HH:mm:ss +0000", arrays and dictionaries in a stable multi-line
  // form ("(\n    a,\n    b\n)" and "{\n    key = value;\n}").
  std::string Description() const;

  bool operator==(const Value& other) const;
  std::size_t Hash() const;

  // Roughly the bytes the value takes in memory (strings and data by their length, every
  // element and entry by a fixed overhead). For limits, not for accounting to the byte.
  std::size_t ApproximateBytes() const;

 private:
  friend class Dictionary;
  void Describe(std::string& out, int indent, bool nested) const;

  std::variant<std::monostate, bool, std::int64_t, std::uint64_t, double, std::string, Data, Date,
               std::shared_ptr<const Array>, std::shared_ptr<const Dictionary>>
      v_;
};

struct ValueHash {
  std::size_t operator()(const Value& v) const { return v.Hash(); }
};

// A dictionary whose keys may be any Value, kept in insertion order and looked up by value.
// Replacing the value of an existing key keeps the key's position.
// Not thread-safe; guard it where it is shared.
class Dictionary {
 public:
  using Entry = std::pair<Value, Value>;

  Dictionary() = default;
  Dictionary(std::initializer_list<Entry> entries);

  std::size_t size() const { return entries_.size(); }
  bool empty() const { return entries_.empty(); }
  auto begin() const { return entries_.begin(); }
  auto end() const { return entries_.end(); }

  // The value stored under key, or nullptr.
  const Value* Find(const Value& key) const;
  const Value* Find(std::string_view key) const;
  const Value* Find(const std::string& key) const { return Find(std::string_view(key)); }
  const Value* Find(const char* key) const { return Find(std::string_view(key)); }
  bool Contains(const Value& key) const { return Find(key) != nullptr; }
  bool Contains(std::string_view key) const { return Find(key) != nullptr; }
  bool Contains(const std::string& key) const { return Find(key) != nullptr; }
  bool Contains(const char* key) const { return Find(key) != nullptr; }

  // Stores value under key: replaces in place when the key exists, else appends.
  void Set(Value key, Value value);
  // Removes key; returns whether it was there.
  bool Erase(const Value& key);
  // Adds every entry of other, in its order (later values replace earlier ones).
  void Merge(const Dictionary& other);
  // Makes room for n entries in all (a hint; does not change the contents).
  void Reserve(std::size_t n);

  bool operator==(const Dictionary& other) const;  // same entries, order ignored

 private:
  static constexpr std::size_t kIndexThreshold = 16;
  void Reindex();

  std::vector<Entry> entries_;
  std::unordered_map<Value, std::size_t, ValueHash> index_;  // used once size >= threshold
};

}  // namespace qn
