#include "platform/linux/linux_log.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <syslog.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <climits>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <string_view>
#include <thread>

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

// Gets lines to a stream without ever blocking the caller: a pipe nobody reads must not stop
// every thread that logs. A line the stream takes at once is written at once; what it does
// not take waits, in order, in a queue of at most kMaxQueuedBytes that a thread of its own
// writes out as the stream drains. Beyond that size, and when the stream is gone (its
// reader left), lines are dropped and counted, and the next line written says how many.
// The descriptor's flags are left as they are (it is shared with whoever started us): a
// socket is written with MSG_DONTWAIT, anything else only when poll says it takes data, at
// most PIPE_BUF bytes at a time (a pipe with room for that much takes it without waiting).
class StreamWriter {
 public:
  StreamWriter(int fd, std::shared_ptr<Counters> counters)
      : fd_(fd), counters_(std::move(counters)) {
    struct stat st;
    socket_ = ::fstat(fd_, &st) == 0 && S_ISSOCK(st.st_mode);
  }

  // Gives what is queued up to kFinalDrain to get out; the rest is dropped.
  ~StreamWriter() {
    {
      std::lock_guard lock(mu_);
      stopping_ = true;
      give_up_at_ = std::chrono::steady_clock::now() + kFinalDrain;
    }
    wake_.notify_one();
    if (thread_.joinable()) thread_.join();
  }

  // `line` ends with its newline.
  void Write(std::string line) {
    std::lock_guard lock(mu_);
    if (dropped_ > 0) {
      line.insert(0, "qnreportingd: " + std::to_string(dropped_) +
                         " log lines dropped (the log stream was full or gone)\n");
      dropped_ = 0;
    }
    if (!queue_.empty() || busy_) {
      Enqueue(std::move(line));
      return;
    }
    std::string_view rest = line;
    if (!WriteSome(rest, 0)) {
      Drop();
      return;
    }
    if (!rest.empty()) Enqueue(std::string(rest), /*whole=*/false);
  }

 private:
  static constexpr std::size_t kMaxQueuedBytes = 4 << 20;
  static constexpr auto kFinalDrain = std::chrono::seconds(1);

  // REQUIRES: mu_ held. A line already begun (not `whole`) is always taken, so that no
  // line is cut in the middle.
  void Enqueue(std::string line, bool whole = true) {
    if (whole && queued_bytes_ + line.size() > kMaxQueuedBytes) {
      Drop();
      return;
    }
    queued_bytes_ += line.size();
    queue_.push_back(std::move(line));
    if (!thread_.joinable()) thread_ = std::thread([this] { Run(); });
    wake_.notify_one();
  }

  void Drop() {
    ++dropped_;
    if (counters_) Counters::Add(counters_->logLinesDropped);
  }

  // Writes from the front of `rest` what the stream takes, waiting at most `wait_ms` for
  // room each time. Returns false when the stream failed (gone); `rest` keeps what is left.
  bool WriteSome(std::string_view& rest, int wait_ms) {
    while (!rest.empty()) {
      ssize_t n;
      if (socket_) {
        n = ::send(fd_, rest.data(), rest.size(),
                   wait_ms > 0 ? MSG_NOSIGNAL : MSG_DONTWAIT | MSG_NOSIGNAL);
      } else {
        pollfd ready{fd_, POLLOUT, 0};
        const int polled = ::poll(&ready, 1, wait_ms);
        if (polled == 0) return true;
        if (polled < 0) {
          if (errno == EINTR) continue;
          return false;
        }
        n = ::write(fd_, rest.data(), std::min<std::size_t>(rest.size(), PIPE_BUF));
      }
      if (n < 0) {
        if (errno == EINTR) continue;
        return errno == EAGAIN || errno == EWOULDBLOCK;
      }
      rest.remove_prefix(static_cast<std::size_t>(n));
      if (wait_ms > 0) return true;  // the writer thread looks at its stop flag between writes
    }
    return true;
  }

  // The writer thread: writes the queue out as the stream takes it.
  void Run() {
    std::unique_lock lock(mu_);
    for (;;) {
      wake_.wait(lock, [&] { return !queue_.empty() || stopping_; });
      if (queue_.empty()) return;
      std::string line = std::move(queue_.front());
      queue_.pop_front();
      queued_bytes_ -= line.size();
      busy_ = true;
      lock.unlock();
      std::string_view rest = line;
      bool alive = true;
      while (alive && !rest.empty()) {
        alive = WriteSome(rest, 100);
        std::lock_guard check(mu_);
        if (stopping_ && std::chrono::steady_clock::now() > give_up_at_) alive = false;
      }
      lock.lock();
      busy_ = false;
      if (!alive) Drop();
    }
  }

  const int fd_;
  const std::shared_ptr<Counters> counters_;
  bool socket_ = false;

  std::mutex mu_;
  std::condition_variable wake_;
  std::deque<std::string> queue_;  // guarded by mu_
  std::size_t queued_bytes_ = 0;   // guarded by mu_
  bool busy_ = false;              // guarded by mu_: the writer thread holds a line
  bool stopping_ = false;          // guarded by mu_
  std::chrono::steady_clock::time_point give_up_at_;  // guarded by mu_
  std::uint64_t dropped_ = 0;  // guarded by mu_: lines lost since the last one written
  std::thread thread_;
};

class LinuxLog final : public Log {
 public:
  explicit LinuxLog(LinuxLogOptions options)
      : fd_(options.fd),
        stream_(options.fd, std::move(options.counters)),
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
    std::string line;
    line.reserve(message.size() + 1);
    line.append(message);
    line.push_back('\n');
    stream_.Write(std::move(line));
  }

  const int fd_;
  StreamWriter stream_;
  const std::string identifier_field_;
  const std::set<std::string, std::less<>> debug_scopes_;
  const bool debug_all_;
  bool journal_ = false;

  std::mutex scopes_mu_;
  std::map<std::uint64_t, std::shared_ptr<const LogScope>> scopes_;  // guarded by scopes_mu_
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
