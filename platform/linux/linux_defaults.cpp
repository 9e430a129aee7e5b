#include "platform/linux/linux_defaults.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <functional>

#include "common/Files.h"
#include "common/Json.h"
#include "platform/defaults_suite.h"
#include "platform/linux/small_file.h"

namespace qn {
namespace {

constexpr std::size_t kMaxSuiteBytes = 1 << 20;
constexpr std::size_t kMaxSuiteNameBytes = 200;

Error DefaultsError(DefaultsErrorCode code, std::string description) {
  return Error{kDefaultsErrorDomain, static_cast<std::int64_t>(code), std::move(description)};
}

std::optional<Error> CheckSuiteName(const std::string& suite) {
  if (suite.empty() || suite.size() > kMaxSuiteNameBytes || suite.front() == '.' ||
      suite.find('/') != std::string::npos || suite.find('\0') != std::string::npos) {
    return DefaultsError(DefaultsErrorCode::kInvalidSuiteName,
                         "invalid defaults suite name '" + suite + "'");
  }
  return std::nullopt;
}

bool IsMissingFile(const Error& error) { return error.domain == "posix" && error.code == ENOENT; }

// Reads the suite's file: a missing file is reported as ENOENT.
std::optional<Error> ReadSuiteFile(const std::string& path, Dictionary& out) {
  std::string text;
  if (auto error = ReadSmallFile(path, kMaxSuiteBytes, text)) return error;
  Value parsed;
  if (auto error = ParseJson(text, parsed)) {
    return DefaultsError(DefaultsErrorCode::kMalformedSuite,
                         path + " is not a JSON object: " + error->Description());
  }
  const Dictionary* values = parsed.as_dictionary();
  if (values == nullptr) {
    return DefaultsError(DefaultsErrorCode::kMalformedSuite, path + " is not a JSON object");
  }
  out = *values;
  return std::nullopt;
}

class LinuxDefaults final : public Defaults {
 public:
  explicit LinuxDefaults(LinuxDefaultsOptions options) : options_(std::move(options)) {}

  std::unique_ptr<DefaultsSuite> OpenSuite(const std::string& suite_name) override {
    Dictionary values;
    std::optional<Error> error = CheckSuiteName(suite_name);
    if (!error) error = ReadSuiteFile(DefaultsSuitePath(options_.state_dir, suite_name), values);
    if (error) {
      if (options_.log) {
        QN_LOG(*options_.log, nullptr, IsMissingFile(*error) ? LogLevel::kDebug : LogLevel::kError,
               "%s:%d:%s: defaults suite %s reads as empty: %s", suite_name, error->Description());
      }
      values = Dictionary();
    }
    return std::make_unique<SnapshotDefaultsSuite>(std::move(values));
  }

 private:
  const LinuxDefaultsOptions options_;
};

// Runs `change` on the suite's values under the suite's lock and writes the result back.
std::optional<Error> ChangeSuite(const std::string& state_dir, const std::string& suite,
                                 const std::function<bool(Dictionary&)>& change) {
  if (auto error = CheckSuiteName(suite)) return error;
  const std::string dir = state_dir + "/defaults";
  if (auto error = CreateDirectories(dir, 0755)) return error;

  // Writers of one suite take turns, so that two concurrent writes both land.
  const std::string lock_path = dir + "/." + suite + ".lock";
  const int lock_fd = ::open(lock_path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644);
  if (lock_fd < 0) return ErrnoError("open " + lock_path, errno);
  while (::flock(lock_fd, LOCK_EX) != 0) {
    if (errno != EINTR) {
      const int saved = errno;
      ::close(lock_fd);
      return ErrnoError("lock " + lock_path, saved);
    }
  }

  std::optional<Error> result;
  const std::string path = DefaultsSuitePath(state_dir, suite);
  Dictionary values;
  if (auto error = ReadSuiteFile(path, values); error && !IsMissingFile(*error)) {
    result = error;
  } else if (change(values)) {
    std::string text;
    if (auto json_error = ToJson(Value(values), JsonStyle::kPretty, text)) {
      result = json_error;
    } else {
      text.push_back('\n');
      result = WriteFileAtomically(path, text);
    }
  }
  ::close(lock_fd);  // releases the lock
  return result;
}

}  // namespace

std::string DefaultsSuitePath(const std::string& state_dir, const std::string& suite) {
  return state_dir + "/defaults/" + suite + ".json";
}

std::optional<Error> ReadSuite(const std::string& state_dir, const std::string& suite,
                               Dictionary& out) {
  if (auto error = CheckSuiteName(suite)) return error;
  Dictionary values;
  if (auto error = ReadSuiteFile(DefaultsSuitePath(state_dir, suite), values)) {
    if (IsMissingFile(*error)) {
      out = Dictionary();
      return std::nullopt;
    }
    return error;
  }
  out = std::move(values);
  return std::nullopt;
}

std::optional<Error> WriteDefault(const std::string& state_dir, const std::string& suite,
                                  const std::string& key, const Value& value) {
  return ChangeSuite(state_dir, suite, [&](Dictionary& values) {
    values.Set(key, value);
    return true;
  });
}

std::optional<Error> DeleteDefault(const std::string& state_dir, const std::string& suite,
                                   const std::string& key) {
  return ChangeSuite(state_dir, suite, [&](Dictionary& values) { return values.Erase(key); });
}

std::shared_ptr<Defaults> NewLinuxDefaults(LinuxDefaultsOptions options) {
  return std::make_shared<LinuxDefaults>(std::move(options));
}

}  // namespace qn
