#pragma once

#include <cctype>
#include <optional>
#include <string>
#include <string_view>

#include "common/Value.h"
#include "platform/defaults.h"

namespace qn {

// The boolean reading of a stored value, as DefaultsSuite::BoolForKey describes it.
// Thread-safe.
inline bool DefaultsBoolValue(const Value& value) {
  auto equals_ignoring_case = [](std::string_view a, std::string_view b) {
    if (a.size() != b.size()) return false;
    for (std::size_t i = 0; i < a.size(); ++i) {
      if (std::tolower(static_cast<unsigned char>(a[i])) !=
          std::tolower(static_cast<unsigned char>(b[i]))) {
        return false;
      }
    }
    return true;
  };
  // Whether the text starts (after blanks and a sign) with a number that is not zero.
  auto starts_with_non_zero_number = [](std::string_view s) {
    std::size_t i = 0;
    while (i < s.size() && std::isspace(static_cast<unsigned char>(s[i]))) ++i;
    if (i < s.size() && (s[i] == '+' || s[i] == '-')) ++i;
    for (; i < s.size() && std::isdigit(static_cast<unsigned char>(s[i])); ++i) {
      if (s[i] != '0') return true;
    }
    return false;
  };
  if (const bool* b = value.as_bool()) return *b;
  if (value.is_number()) return value.as_double().value_or(0) != 0;
  if (const std::string* s = value.as_string()) {
    return equals_ignoring_case(*s, "YES") || equals_ignoring_case(*s, "true") ||
           starts_with_non_zero_number(*s);
  }
  return false;
}

// A suite over a snapshot of its values, read the way every Defaults implementation reads
// them (the Linux suites and the test fake alike). Thread-compatible.
class SnapshotDefaultsSuite final : public DefaultsSuite {
 public:
  explicit SnapshotDefaultsSuite(Dictionary values) : values_(std::move(values)) {}

  std::optional<Value> ObjectForKey(const std::string& key) const override {
    if (const Value* v = values_.Find(key)) return *v;
    return std::nullopt;
  }

  std::optional<std::string> StringForKey(const std::string& key) const override {
    const Value* v = values_.Find(key);
    if (v == nullptr) return std::nullopt;
    if (const std::string* s = v->as_string()) return *s;
    if (v->is_number()) return v->Description();
    return std::nullopt;
  }

  bool BoolForKey(const std::string& key) const override {
    const Value* v = values_.Find(key);
    return v != nullptr && DefaultsBoolValue(*v);
  }

 private:
  const Dictionary values_;
};

}  // namespace qn
