#pragma once

#include <chrono>
#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/log.h"

namespace qn::testing {

// A Log that keeps every line, for tests to search. Debug (level 5) is off for every scope
// until EnableDebug. Set QN_TEST_LOG=1 to also echo lines to stderr. Thread-safe.
class LogCapture final : public Log {
 public:
  struct Line {
    std::string scope;  // the scope's code string, "" for the default log
    LogLevel level;
    std::string text;
  };

  std::shared_ptr<const LogScope> RegisterScope(bool enabled, std::uint64_t code,
                                                std::string code_string, std::string subsystem,
                                                std::string category, std::uint32_t flags) override;
  bool LogEnabled(const LogScope* scope, int level) const override;
  void Write(const LogScope* scope, LogLevel level, const char* file, int line,
             const char* function, std::string_view message) override;

  // "all" or a scope code string ("qnrr").
  void EnableDebug(const std::string& code_string);

  std::vector<Line> Lines() const;
  // Number of lines whose text contains `needle`.
  int Count(std::string_view needle) const;
  bool Contains(std::string_view needle) const { return Count(needle) > 0; }
  // Texts of the lines that contain `needle`, in order.
  std::vector<std::string> Matching(std::string_view needle) const;
  void Clear();

 private:
  mutable std::mutex mu_;
  std::vector<Line> lines_;
  std::map<std::uint64_t, std::shared_ptr<const LogScope>> scopes_;
  std::set<std::string> debug_;
  bool echo_ = false;
  bool echo_checked_ = false;
};

}  // namespace qn::testing
