#pragma once

#include <memory>
#include <optional>
#include <string>

#include "common/Value.h"

namespace qn {

// One user-defaults suite, read as it was when the suite was opened. Thread-compatible.
class DefaultsSuite {
 public:
  virtual ~DefaultsSuite() = default;
  // The stored value under key, or nullopt.
  virtual std::optional<Value> ObjectForKey(const std::string& key) const = 0;
  // The value as a string: a string as itself, a number as its decimal digits; else nullopt.
  virtual std::optional<std::string> StringForKey(const std::string& key) const = 0;
  // The boolean reading of a settings store: true/false; a number is true when non-zero;
  // a string is true when it is "YES", "true" or "1" (case-insensitive) or starts with a
  // non-zero number; anything else (and absent) is false.
  virtual bool BoolForKey(const std::string& key) const = 0;
};

// User-defaults suites by name. Safe to call from any thread.
class Defaults {
 public:
  virtual ~Defaults() = default;
  // Opens (reads) the suite. A missing or unreadable suite reads as empty; the reason is
  // logged by the implementation. Never returns null.
  virtual std::unique_ptr<DefaultsSuite> OpenSuite(const std::string& suite_name) = 0;
};

}  // namespace qn
