#pragma once

#include <string>

#include "common/Value.h"

namespace qn {

// Appends the JSON text of `value` to `out`, the compact way (no blanks), without clearing
// `out` first, so that a caller can reuse one buffer for many rows. It never fails: values
// JSON cannot hold are written in a lenient form:
//   - a date or data value as a string holding its printed form (Value::Description());
//   - a dictionary key that is not a string as the string of its printed form;
//   - a NaN or infinite double as null;
//   - bytes of a string that are not valid UTF-8 as U+FFFD.
// A double always carries a fraction or exponent (2.0 is written "2.0"), so that a reader
// can tell it from an integer. Dictionaries keep their insertion order.
// Thread-safe (no shared state).
void AppendJson(std::string& out, const Value& value);

// The same into a new string.
std::string StoreJsonText(const Value& value);

}  // namespace qn
