#pragma once

#include <memory>
#include <optional>
#include <string>

#include "common/Error.h"
#include "common/Value.h"
#include "platform/defaults.h"
#include "platform/log.h"

namespace qn {

inline constexpr const char* kDefaultsErrorDomain = "com.norvel.quenta.defaults";
enum class DefaultsErrorCode : std::int64_t {
  kInvalidSuiteName = 1,  // empty, with '/', starting with '.', or longer than 200 bytes
  kMalformedSuite = 2,    // the suite's file is not a JSON object
};

struct LinuxDefaultsOptions {
  // The daemon's state folder; suites live in <state_dir>/defaults/<suite>.json.
  std::string state_dir;
  // Where unreadable suites are reported; may be null.
  std::shared_ptr<Log> log;
};

// User-defaults suites as JSON objects on disk. OpenSuite reads the file each time it is
// called (the suite is a snapshot). A missing suite reads as empty and is logged at debug
// level; an unreadable or malformed one reads as empty and is logged at error level.
// Safe from any thread.
std::shared_ptr<Defaults> NewLinuxDefaults(LinuxDefaultsOptions options);

// <state_dir>/defaults/<suite>.json.
std::string DefaultsSuitePath(const std::string& state_dir, const std::string& suite);

// The suite's values in `out` (empty when the suite has no file). Errors: an invalid suite
// name, an unreadable file (posix domain), a file that is not a JSON object.
std::optional<Error> ReadSuite(const std::string& state_dir, const std::string& suite,
                               Dictionary& out);

// Sets `key` to `value` in the suite, creating the folder and the file as needed. The
// change is atomic (temporary file, fsync, rename) and serialised with other writers of
// the suite by an advisory lock. Fails without changing anything when the suite's file is
// malformed or `value` has no JSON form (data, dates, non-string keys).
std::optional<Error> WriteDefault(const std::string& state_dir, const std::string& suite,
                                  const std::string& key, const Value& value);

// Removes `key` from the suite; succeeds when it was not there.
std::optional<Error> DeleteDefault(const std::string& state_dir, const std::string& suite,
                                   const std::string& key);

}  // namespace qn
