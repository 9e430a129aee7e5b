#pragma once

#include <cstdio>
#include <cstdlib>
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
// until EnableDebug. QN_TEST_LOG=1 also echoes the lines to stderr. Thread-safe.
class LogCapture final : public Log {
 public:
  struct Line {
    std::string scope;  // the scope's code string, "" for the default log
    LogLevel level;
    std::string text;
  };

  std::shared_ptr<const LogScope> RegisterScope(bool, std::uint64_t code, std::string code_string,
                                                std::string subsystem, std::string category,
                                                std::uint32_t) override {
    std::lock_guard lock(mu_);
    auto& scope = scopes_[code];
    if (!scope)
      scope = std::make_shared<const LogScope>(LogScope{code, code_string, subsystem, category});
    return scope;
  }
  bool LogEnabled(const LogScope* scope, int level) const override {
    std::lock_guard lock(mu_);
    return level < 5 || debug_.count("all") || (scope && debug_.count(scope->code_string));
  }
  void Write(const LogScope* scope, LogLevel level, const char*, int, const char*,
             std::string_view message) override {
    static const bool echo = std::getenv("QN_TEST_LOG") && *std::getenv("QN_TEST_LOG") == '1';
    std::lock_guard lock(mu_);
    if (echo) std::fprintf(stderr, "%.*s\n", static_cast<int>(message.size()), message.data());
    lines_.push_back(Line{scope ? scope->code_string : "", level, std::string(message)});
  }

  // "all" or a scope code string ("qnrr").
  void EnableDebug(const std::string& code_string) {
    std::lock_guard lock(mu_);
    debug_.insert(code_string);
  }
  std::vector<Line> Lines() const {
    std::lock_guard lock(mu_);
    return lines_;
  }
  // The texts of the lines that contain `needle`, in order.
  std::vector<std::string> Matching(std::string_view needle) const {
    std::vector<std::string> out;
    for (const auto& l : Lines()) {
      if (l.text.find(needle) != std::string::npos) out.push_back(l.text);
    }
    return out;
  }
  int Count(std::string_view needle) const { return static_cast<int>(Matching(needle).size()); }
  bool Contains(std::string_view needle) const { return Count(needle) > 0; }
  void Clear() {
    std::lock_guard lock(mu_);
    lines_.clear();
  }

 private:
  mutable std::mutex mu_;
  std::vector<Line> lines_;
  std::map<std::uint64_t, std::shared_ptr<const LogScope>> scopes_;
  std::set<std::string> debug_;
};

}  // namespace qn::testing
