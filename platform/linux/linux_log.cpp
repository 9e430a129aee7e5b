#include "platform/linux/linux_log.h"

#include <sys/stat.h>
#include <sys/uio.h>
#include <syslog.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <mutex>
#include <set>
#include <string_view>

namespace qn {
namespace {

constexpr const char* kJournalSocket = "/run/systemd/journal/socket";

int JournalPriority(LogLevel level) {
  switch (level) {
    case LogLevel::kDefault:
      return LOG_NOTICE;
    case LogLevel::kInfo:
      return LOG_INFO;
    case LogLevel::kDebug:
      return LOG_DEBUG;
    case LogLevel::kError:
      return LOG_ERR;
  }
  return LOG_NOTICE;
}

// The set of scope codes from the --debug argument.
std::set<std::string, std::less<>> ParseDebugScopes(std::string_view text) {
  std::set<std::string, std::less<>> scopes;
  std::size_t i = 0;
  while (i < text.size()) {
    while (i < text.size() && (text[i] == ',' || text[i] == ' ' || text[i] == '\t')) ++i;
    std::size_t j = i;
    while (j < text.size() && text[j] != ',' && text[j] != ' ' && text[j] != '\t') ++j;
    if (j > i) scopes.emplace(text.substr(i, j - i));
    i = j;
  }
  return scopes;
}

class LinuxLog final : public Log {
 public:
  explicit LinuxLog(LinuxLogOptions options)
      : fd_(options.fd),
        identifier_field_("SYSLOG_IDENTIFIER=" + options.identifier),
        debug_scopes_(ParseDebugScopes(options.debug_scopes)),
        debug_all_(debug_scopes_.count("all") > 0) {
    switch (options.sink) {
      case LinuxLogOptions::Sink::kJournal:
        // The journal drops entries silently when it is not running; keep them instead.
        journal_ = ::access(kJournalSocket, F_OK) == 0;
        break;
      case LinuxLogOptions::Sink::kStream:
        journal_ = false;
        break;
      case LinuxLogOptions::Sink::kAuto:
        journal_ = IsJournalStream(fd_, std::getenv("JOURNAL_STREAM"));
        break;
    }
  }

  std::shared_ptr<const LogScope> RegisterScope(bool /*enabled*/, std::uint64_t code,
                                                std::string code_string, std::string subsystem,
                                                std::string category,
                                                std::uint32_t /*flags*/) override {
    std::lock_guard lock(scopes_mu_);
    auto& scope = scopes_[code];
    if (!scope) {
      scope = std::make_shared<const LogScope>(
          LogScope{code, std::move(code_string), std::move(subsystem), std::move(category)});
    }
    return scope;
  }

  bool LogEnabled(const LogScope* scope, int level) const override {
    if (level < 5) return true;
    if (debug_all_) return true;
    return scope != nullptr && debug_scopes_.count(scope->code_string) > 0;
  }

  void Write(const LogScope* scope, LogLevel level, const char* file, int line,
             const char* function, std::string_view message) override {
    if (journal_ && WriteJournal(scope, level, file, line, function, message)) return;
    WriteStream(message);
  }

 private:
  bool WriteJournal(const LogScope* scope, LogLevel level, const char* file, int line,
                    const char* function, std::string_view message) {
    std::string message_field = "MESSAGE=";
    message_field.append(message);
    const std::string priority_field = "PRIORITY=" + std::to_string(JournalPriority(level));
    const std::string file_field = std::string("CODE_FILE=") + (file ? file : "");
    const std::string line_field = "CODE_LINE=" + std::to_string(line);
    std::string scope_field;
    iovec fields[4];
    int n = 0;
    auto add = [&](const std::string& s) {
      fields[n].iov_base = const_cast<char*>(s.data());
      fields[n].iov_len = s.size();
      ++n;
    };
    add(message_field);
    add(priority_field);
    add(identifier_field_);
    if (scope != nullptr) {
      scope_field = "QN_SCOPE=" + scope->code_string;
      add(scope_field);
    }
    return sd_journal_sendv_with_location(file_field.c_str(), line_field.c_str(),
                                          function ? function : "", fields, n) >= 0;
  }

  void WriteStream(std::string_view message) {
    std::string out;
    out.reserve(message.size() + 1);
    out.append(message);
    out.push_back('\n');
    std::lock_guard lock(write_mu_);
    std::size_t done = 0;
    while (done < out.size()) {
      const ssize_t n = ::write(fd_, out.data() + done, out.size() - done);
      if (n < 0) {
        if (errno == EINTR) continue;
        return;  // nowhere to report it
      }
      done += static_cast<std::size_t>(n);
    }
  }

  const int fd_;
  const std::string identifier_field_;
  const std::set<std::string, std::less<>> debug_scopes_;
  const bool debug_all_;
  bool journal_ = false;

  std::mutex scopes_mu_;
  std::map<std::uint64_t, std::shared_ptr<const LogScope>> scopes_;  // guarded by scopes_mu_
  std::mutex write_mu_;                                              // one stream line at a time
};

}  // namespace

bool IsJournalStream(int fd, const char* journal_stream) {
  if (journal_stream == nullptr) return false;
  unsigned long long device = 0;
  unsigned long long inode = 0;
  int consumed = 0;
  if (std::sscanf(journal_stream, "%llu:%llu%n", &device, &inode, &consumed) != 2 ||
      journal_stream[consumed] != '\0') {
    return false;
  }
  struct stat st;
  if (fstat(fd, &st) != 0) return false;
  return static_cast<unsigned long long>(st.st_dev) == device &&
         static_cast<unsigned long long>(st.st_ino) == inode;
}

std::shared_ptr<Log> NewLinuxLog(LinuxLogOptions options) {
  return std::make_shared<LinuxLog>(std::move(options));
}

}  // namespace qn
