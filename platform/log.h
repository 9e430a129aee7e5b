#pragma once

#include <cstddef>
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
                                                        std::string subsystem, std::string category,
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

constexpr bool At(std::string_view text, std::size_t i, std::string_view word) {
  return text.substr(i, word.size()) == word;
}

// A component of a qualified name that names a namespace: the project's namespaces are lower
// case and its classes capitalised; the compilers print an unnamed namespace as
// "{anonymous}" or "(anonymous namespace)".
constexpr bool IsNamespace(std::string_view component) {
  return component.empty() || component == "{anonymous}" || component == "(anonymous namespace)" ||
         (component[0] >= 'a' && component[0] <= 'z');
}

// Hands to `put`, piece by piece, the name by which a reader calls the function that a
// __PRETTY_FUNCTION__ text describes: "Class::method" for a member, the bare name for a free
// function. Return type, namespaces, template arguments and parameters are left out; in a
// lambda's text the outermost function, the one that made the lambda, is named. A text that
// names no function (a lambda outside any) is kept whole. Both GCC's and Clang's forms are
// read.
template <typename Put>
constexpr void ReadableFunctionName(std::string_view pretty, Put put) {
  // The outermost function's qualified name ends at the first '(' outside template
  // arguments, not counting "(anonymous namespace)" and an operator's own symbol.
  std::size_t begin = 0;
  std::size_t end = std::string_view::npos;
  std::size_t depth = 0;
  for (std::size_t i = 0; i < pretty.size() && end == std::string_view::npos; ++i) {
    const char c = pretty[i];
    if (At(pretty, i, "(anonymous namespace)")) {
      i += std::string_view("(anonymous namespace)").size() - 1;
    } else if (depth == 0 && At(pretty, i, "operator") &&
               (i == 0 || pretty[i - 1] == ':' || pretty[i - 1] == ' ')) {
      i += std::string_view("operator").size();
      if (At(pretty, i, "()")) i += 2;
      end = pretty.find('(', i);
    } else if (c == '<') {
      ++depth;
    } else if (c == '>' && depth > 0) {
      --depth;
    } else if (depth == 0 && (c == ' ' || c == '*' || c == '&')) {
      begin = i + 1;  // what came before was the return type
    } else if (depth == 0 && c == '(') {
      end = i;
    }
  }
  if (end == std::string_view::npos) {
    put(pretty);
    return;
  }

  // Its components, namespaces dropped from the front, template arguments left out.
  const std::string_view name = pretty.substr(begin, end - begin);
  bool first = true;  // nothing put yet: namespaces are still dropped
  std::size_t start = 0;
  while (start <= name.size()) {
    if (At(name, start, "operator")) {  // always the last component
      if (!first) put("::");
      put(name.substr(start));
      break;
    }
    std::size_t stop = start;
    for (std::size_t level = 0; stop < name.size(); ++stop) {
      if (At(name, stop, "(anonymous namespace)")) {
        stop += std::string_view("(anonymous namespace)").size() - 1;
      } else if (name[stop] == '<') {
        ++level;
      } else if (name[stop] == '>' && level > 0) {
        --level;
      } else if (level == 0 && At(name, stop, "::")) {
        break;
      }
    }
    const std::string_view component = name.substr(start, stop - start);
    const bool last = stop >= name.size();
    if (!(first && !last && IsNamespace(component))) {
      if (!first) put("::");
      first = false;
      put(component.substr(0, component.find('<')));
    }
    start = stop + 2;
  }
}

constexpr std::size_t ReadableFunctionNameLength(std::string_view pretty) {
  std::size_t length = 0;
  ReadableFunctionName(pretty, [&](std::string_view part) { length += part.size(); });
  return length;
}

// A function's readable name, made at compile time from its __PRETTY_FUNCTION__.
// REQUIRES: N is ReadableFunctionNameLength(pretty) + 1.
template <std::size_t N>
struct FunctionName {
  char text[N] = {};
  constexpr explicit FunctionName(std::string_view pretty) {
    std::size_t length = 0;
    ReadableFunctionName(pretty, [&](std::string_view part) {
      for (char c : part) text[length++] = c;
    });
  }
};

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
// file's base name, the line and the function's readable name (ReadableFunctionName:
// "QNReportingServerInstance::initWithPID", also for a line inside a lambda of that method)
// as the first three arguments; structured sinks get the same name.
//   QN_LOG(log, scope, qn::LogLevel::kInfo, "%s:%d:%s: session created for reporter %lli", id);
// `log` is a qn::Log&, `scope` a const qn::LogScope* (null = default log). Debug lines are
// skipped, their arguments not even evaluated, unless level 5 is enabled for the scope.
#define QN_LOG(log, scope, level, format, ...)                                          \
  do {                                                                                  \
    static constexpr std::string_view qn_pretty_ = __PRETTY_FUNCTION__;                 \
    static constexpr ::qn::log_detail::FunctionName<                                    \
        ::qn::log_detail::ReadableFunctionNameLength(qn_pretty_) + 1>                   \
        qn_function_{qn_pretty_};                                                       \
    QN_LOG_AS(qn_function_.text, log, scope, level, format __VA_OPT__(, ) __VA_ARGS__); \
  } while (0)

// The same with an explicit function name, for lines whose function part is fixed.
#define QN_LOG_AS(function, log, scope, level, format, ...)                                 \
  do {                                                                                      \
    ::qn::Log& qn_log_ = (log);                                                             \
    const ::qn::LogScope* qn_scope_ = (scope);                                              \
    const ::qn::LogLevel qn_level_ = (level);                                               \
    if (qn_level_ != ::qn::LogLevel::kDebug || qn_log_.LogEnabled(qn_scope_, 5)) {          \
      ::qn::log_detail::Emit(qn_log_, qn_scope_, qn_level_, __FILE__, __LINE__, (function), \
                             (format)__VA_OPT__(, ) __VA_ARGS__);                           \
    }                                                                                       \
  } while (0)
