#include "tests/fakes/LogCapture.h"

#include <cstdio>
#include <cstdlib>

namespace qn::testing {

std::shared_ptr<const LogScope> LogCapture::RegisterScope(bool, std::uint64_t code,
                                                          std::string code_string,
                                                          std::string subsystem,
                                                          std::string category, std::uint32_t) {
  std::lock_guard lock(mu_);
  auto& scope = scopes_[code];
  if (!scope) {
    scope = std::make_shared<const LogScope>(
        LogScope{code, std::move(code_string), std::move(subsystem), std::move(category)});
  }
  return scope;
}

bool LogCapture::LogEnabled(const LogScope* scope, int level) const {
  if (level < 5) return true;
  std::lock_guard lock(mu_);
  return debug_.count("all") || (scope && debug_.count(scope->code_string));
}

void LogCapture::Write(const LogScope* scope, LogLevel level, const char*, int, const char*,
                       std::string_view message) {
  std::lock_guard lock(mu_);
  if (!echo_checked_) {
    const char* env = std::getenv("QN_TEST_LOG");
    echo_ = env && *env == '1';
    echo_checked_ = true;
  }
  if (echo_) std::fprintf(stderr, "%.*s\n", static_cast<int>(message.size()), message.data());
  lines_.push_back(Line{scope ? scope->code_string : "", level, std::string(message)});
}

void LogCapture::EnableDebug(const std::string& code_string) {
  std::lock_guard lock(mu_);
  debug_.insert(code_string);
}

std::vector<LogCapture::Line> LogCapture::Lines() const {
  std::lock_guard lock(mu_);
  return lines_;
}

int LogCapture::Count(std::string_view needle) const {
  std::lock_guard lock(mu_);
  int n = 0;
  for (const auto& l : lines_) n += l.text.find(needle) != std::string::npos;
  return n;
}

std::vector<std::string> LogCapture::Matching(std::string_view needle) const {
  std::lock_guard lock(mu_);
  std::vector<std::string> out;
  for (const auto& l : lines_) {
    if (l.text.find(needle) != std::string::npos) out.push_back(l.text);
  }
  return out;
}

void LogCapture::Clear() {
  std::lock_guard lock(mu_);
  lines_.clear();
}

}  // namespace qn::testing
