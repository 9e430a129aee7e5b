#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <string_view>

#include "common/Value.h"

namespace qn {

// The JSON text of values as the reporting store writes them: exactly the compact text of
// ToJsonLenient (common/Json.h), written into a reusable buffer. In short: no blanks,
// dictionaries in insertion order, data as base64, dates as ISO-8601 UTC strings with
// milliseconds, a non-string key as its printed form (a repeated one left out), NaN and
// infinities as null, invalid UTF-8 as U+FFFD, integral doubles with ".0". One difference:
// nesting deeper than 512 levels is written as null instead of risking the stack.

// A reusable output buffer: the store's writer keeps one per column and clears it for each
// row, so that writing a row's JSON allocates nothing once the buffer has grown.
// Not thread-safe (one owner).
class JsonBuffer {
 public:
  // Empties the buffer, keeping its memory.
  void Clear() { size_ = 0; }
  // Appends the JSON text of `value`.
  void Append(const Value& value);
  // The text so far; valid until the next Append or Clear.
  std::string_view view() const { return std::string_view(data_.get(), size_); }

 private:
  friend class JsonWriter;
  // Makes room for `n` more bytes and returns where they go. The caller then calls
  // Commit with the number of bytes it wrote there.
  char* Reserve(std::size_t n) {
    if (capacity_ - size_ < n) Grow(n);
    return data_.get() + size_;
  }
  void Commit(std::size_t n) { size_ += n; }
  void Grow(std::size_t n);

  std::unique_ptr<char[]> data_;
  std::size_t size_ = 0;
  std::size_t capacity_ = 0;
};

// Appends the JSON text of `value` to `out` (without clearing it).
void AppendJson(std::string& out, const Value& value);

// The JSON text of `value`.
std::string StoreJsonText(const Value& value);

}  // namespace qn
