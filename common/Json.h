#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "common/Error.h"
#include "common/Value.h"

namespace qn {

// JSON text of Values and Values of JSON text. Maps keep their order in both directions.
// Thread-safe: the functions keep no state.

inline constexpr const char* kJsonErrorDomain = "com.norvel.quenta.json";
enum class JsonErrorCode : std::int64_t {
  kInvalidValue = 1,  // the value has no JSON form (strict serialisation)
  kParse = 2,         // the text is not JSON
  kTooDeep = 3,       // the text nests deeper than kMaxJsonDepth
};
inline constexpr int kMaxJsonDepth = 64;  // nesting of arrays and objects when parsing
// Nesting of arrays and objects when writing: a value nested deeper is written as null
// (lenient) or rejected (strict) rather than risking the stack.
inline constexpr int kMaxJsonWriteDepth = 512;

enum class JsonStyle {
  kCompact,  // no whitespace: {"a":1,"b":[1,2]}
  kPretty,   // two-space indentation, one entry per line, "key": value
};

// Strict serialisation, as a platform JSON serialiser does it: dictionary keys must be
// strings; data, dates, NaN and infinities have no JSON form; strings must be valid UTF-8;
// nesting may not go deeper than kMaxJsonWriteDepth.
// A top-level scalar is allowed. On success stores the text in `out` and returns nullopt;
// on failure leaves `out` as it was and returns an error (domain kJsonErrorDomain, code
// kInvalidValue) whose description says what was rejected and at which key path, e.g.
// "JSON cannot hold data (at payload.samples[2])".
std::optional<Error> ToJson(const Value& value, JsonStyle style, std::string& out);

// Lenient serialisation for the store and logs; never fails. A non-string key becomes its
// printed form (Value::Description); when that repeats a key already written in the same
// map, the later entry is left out. Data becomes a base64 string, a date an ISO-8601 UTC
// string with milliseconds ("2024-01-15T14:30:05.123Z"), NaN, infinities and values nested
// deeper than kMaxJsonWriteDepth null; invalid UTF-8 is replaced by U+FFFD.
std::string ToJsonLenient(const Value& value, JsonStyle style = JsonStyle::kCompact);

// Appends the compact lenient text of `value` to `out` (the same bytes ToJsonLenient
// returns). A caller that writes many values keeps one string and clears it between them,
// so that writing allocates nothing once the string has grown.
void AppendJsonLenient(std::string& out, const Value& value);

// Parses one JSON text (surrounding whitespace allowed) into `out`: objects become
// Dictionaries in their order (a repeated key keeps its first position and last value),
// integers int64 (uint64 above INT64_MAX), other numbers double. On failure leaves `out` as
// it was and returns an error: kParse with the parser's message, or kTooDeep when arrays and
// objects nest deeper than kMaxJsonDepth.
std::optional<Error> ParseJson(std::string_view text, Value& out);

}  // namespace qn
