#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/linux_log.h"
#include "tests/platform/test_util.h"

namespace qn {
namespace {

// A pipe whose read end a background thread drains into a string, so writers never block.
class PipeReader {
 public:
  PipeReader() {
    if (::pipe2(fds_, O_CLOEXEC) != 0) std::abort();
    reader_ = std::thread([this] {
      char buf[65536];
      ssize_t n;
      while ((n = ::read(fds_[0], buf, sizeof buf)) > 0) text_.append(buf, n);
    });
  }
  ~PipeReader() {
    CloseWriteEnd();
    if (reader_.joinable()) reader_.join();
    ::close(fds_[0]);
  }
  int write_fd() const { return fds_[1]; }
  // Closes the write end and returns everything written.
  std::string Finish() {
    CloseWriteEnd();
    reader_.join();
    return text_;
  }

 private:
  void CloseWriteEnd() {
    if (fds_[1] >= 0) ::close(fds_[1]);
    fds_[1] = -1;
  }
  int fds_[2];
  std::thread reader_;
  std::string text_;
};

std::shared_ptr<Log> StreamLog(int fd, std::string debug_scopes = "") {
  return NewLinuxLog({.sink = LinuxLogOptions::Sink::kStream,
                      .fd = fd,
                      .debug_scopes = std::move(debug_scopes),
                      .counters = nullptr,
                      .identifier = "qnreportingd"});
}

const LogScope* Register(Log& log, const char* code) {
  std::uint64_t n = 0;
  for (const char* p = code; *p; ++p) n = (n << 8) | static_cast<unsigned char>(*p);
  return log.RegisterScope(true, n, code, "com.norvel.quenta", "test", 31).get();
}

TEST(LinuxLogTest, StreamSinkWritesExactlyTheLine) {
  PipeReader pipe;
  auto log = StreamLog(pipe.write_fd());
  const int line = __LINE__ + 1;
  QN_LOG(*log, nullptr, LogLevel::kInfo, "%s:%d:%s: created reporting session for ID: %lli", 42);
  QN_LOG_AS("QNReportingUtilityWait", *log, nullptr, LogLevel::kError, "%s:%d:%s: %@", "odd  %s");
  const std::string expected = std::string("log_test.cpp:") + std::to_string(line) + ":" +
                               "virtual void qn::{anonymous}::LinuxLogTest_"
                               "StreamSinkWritesExactlyTheLine_Test::TestBody(): created "
                               "reporting session for ID: 42\n" +
                               "log_test.cpp:" + std::to_string(line + 1) +
                               ":QNReportingUtilityWait: odd  %s\n";
  EXPECT_EQ(pipe.Finish(), expected);
}

TEST(LinuxLogTest, DebugLinesOnlyForEnabledScopes) {
  PipeReader pipe;
  auto log = StreamLog(pipe.write_fd(), "qnrr, qnrd");
  const LogScope* session = Register(*log, "qnrr");
  const LogScope* server = Register(*log, "qnrs");
  EXPECT_TRUE(log->LogEnabled(session, 5));
  EXPECT_FALSE(log->LogEnabled(server, 5));
  EXPECT_FALSE(log->LogEnabled(nullptr, 5));
  for (int level = 0; level < 5; ++level) EXPECT_TRUE(log->LogEnabled(server, level));

  QN_LOG_AS("f", *log, session, LogLevel::kDebug, "%s:%d:%s: session debug");
  QN_LOG_AS("f", *log, server, LogLevel::kDebug, "%s:%d:%s: server debug");
  QN_LOG_AS("f", *log, nullptr, LogLevel::kDebug, "%s:%d:%s: default debug");
  QN_LOG_AS("f", *log, server, LogLevel::kDefault, "%s:%d:%s: server default");
  const std::string text = pipe.Finish();
  EXPECT_NE(text.find("session debug"), std::string::npos);
  EXPECT_EQ(text.find("server debug"), std::string::npos);
  EXPECT_EQ(text.find("default debug"), std::string::npos);
  EXPECT_NE(text.find("server default"), std::string::npos);
}

TEST(LinuxLogTest, LinesFromManyThreadsNeverInterleave) {
  PipeReader pipe;
  auto log = StreamLog(pipe.write_fd());
  constexpr int kThreads = 4;
  constexpr int kLines = 200;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < kLines; ++i) {
        // Some lines are longer than a pipe's atomic write size.
        const std::string body(i % 10 == 0 ? 20000 : 50 + i, static_cast<char>('a' + t));
        log->Write(nullptr, LogLevel::kDefault, "f.cpp", 1, "f", body);
      }
    });
  }
  for (auto& t : threads) t.join();
  log.reset();  // what the pipe did not take at once is written out before the log goes
  const std::string text = pipe.Finish();
  int lines = 0;
  std::size_t start = 0;
  while (start < text.size()) {
    const std::size_t end = text.find('\n', start);
    ASSERT_NE(end, std::string::npos);
    const std::string_view line(text.data() + start, end - start);
    ASSERT_FALSE(line.empty());
    start = end + 1;
    // A reader that falls far behind loses lines; the next line says how many.
    unsigned long long dropped = 0;
    if (std::sscanf(std::string(line).c_str(), "qnreportingd: %llu log lines dropped", &dropped) ==
        1) {
      lines += static_cast<int>(dropped);
      continue;
    }
    ASSERT_EQ(line.find_first_not_of(line[0]), std::string_view::npos)
        << "two lines were mixed in one";
    ++lines;
  }
  EXPECT_EQ(lines, kThreads * kLines);
}

}  // namespace
}  // namespace qn
