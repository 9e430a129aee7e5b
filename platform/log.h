#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "common/Format.h"

namespace qn {

// Log levels of the service. Debug lines of a scope are written only when level 5 is
// enabled for that scope (see Log::LogEnabled).
enum class LogLevel { kDefault, kInfo, kDebug, kError };

// A registered logging scope: what QNLog::RegisterScope hands back. Lines written to a
// scope carry its code; a null scope means the process default log.
struct LogScope {
  std::uint64_t code = 0;   // the four-character code as a number, 'qnrr' = 0x716E7272
  std::string code_string;  // "qnrr"
  std::string subsystem;    // "com.norvel.quenta"
  std::string category;     // "reporting_session_verbose"
};

// The logging facility (QNLog and the platform log). Safe to call from any thread.
class Log {
 public:
  virtual ~Log() = default;

  // Registers a scope, or returns the one already registered under `code`, so calling it
  // once per object instead of once per process is harmless. Never returns null on Linux;
  // a null result means "use the default log".
  virtual std::shared_ptr<const LogScope> RegisterScope(bool enabled, std::uint64_t code,
                                                        std::string code_string,
                                                        std::string subsystem,
                                                        std::string category,
                                                        std::uint32_t flags) = 0;

  // Whether `level` (5 = debug) is enabled for the scope. Levels below 5 are always on.
  virtual bool LogEnabled(const LogScope* scope, int level) const = 0;

  // Writes one complete line. `scope` may be null (default log). `file`, `line` and
  // `function` locate the call site for structured sinks; `message` is the whole text,
  // prefix included.
  virtual void Write(const LogScope* scope, LogLevel level, const char* file, int line,
                     const char* function, std::string_view message) = 0;
};

// The source file's name without directories (LogFilenameOnly).
constexpr const char* LogFilenameOnly(const char* path) {
  const char* base = path;
  for (const char* p = path; *p; ++p) {
    if (*p == '/') base = p + 1;
  }
  return base;
}

namespace log_detail {
template <typename... Args>
void Emit(Log& log, const LogScope* scope, LogLevel level, const char* file, int line,
          const char* function, std::string_view format, const Args&... args) {
  if (level == LogLevel::kDebug && !log.LogEnabled(scope, 5)) return;
  log.Write(scope, level, file, line, function,
            StringWithFormat(format, LogFilenameOnly(file), line, function, args...));
}
}  // namespace log_detail

}  // namespace qn

// Writes a line whose format starts with "%s:%d:%s: ": the macro supplies the source
// file's base name, the line and the function's full name as the first three arguments.
//   QN_LOG(log, scope, qn::LogLevel::kInfo, "%s:%d:%s: created reporting session for ID: %lli", id);
// `log` is a qn::Log&, `scope` a const qn::LogScope* (null = default log). Debug lines are
// skipped, their arguments not even evaluated, unless level 5 is enabled for the scope.
#define QN_LOG(log, scope, level, format, ...) \
  QN_LOG_AS(__PRETTY_FUNCTION__, log, scope, level, format __VA_OPT__(, ) __VA_ARGS__)

// The same with an explicit function name, for lines whose function part is fixed.
#define QN_LOG_AS(function, log, scope, level, format, ...)                                  \
  do {                                                                                      \
    ::qn::Log& qn_log_ = (log);                                                             \
    const ::qn::LogScope* qn_scope_ = (scope);                                              \
    const ::qn::LogLevel qn_level_ = (level);                                               \
    if (qn_level_ != ::qn::LogLevel::kDebug || qn_log_.LogEnabled(qn_scope_, 5)) {          \
      ::qn::log_detail::Emit(qn_log_, qn_scope_, qn_level_, __FILE__, __LINE__, (function), \
                             (format)__VA_OPT__(, ) __VA_ARGS__);                           \
    }                                                                                       \
  } while (0)
