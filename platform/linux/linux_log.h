#pragma once

#include <unistd.h>

#include <memory>
#include <string>

#include "common/Counters.h"
#include "platform/log.h"

namespace qn {

struct LinuxLogOptions {
  enum class Sink {
    kAuto,     // the journal when stderr is connected to it (JOURNAL_STREAM), else the stream
    kJournal,  // sd_journal_send; the stream when no journal runs (no journal socket)
    kStream,   // one line per write() on `fd`
  };
  Sink sink = Sink::kAuto;
  // The stream sink's file descriptor; not owned, and it must stay open while the log is used.
  int fd = STDERR_FILENO;
  // Scopes whose debug (level 5) lines are written: the daemon's --debug argument, four-
  // character codes separated by commas or blanks ("qnrr,qnrs"), or "all" for every scope
  // and the default log. Empty: no debug lines.
  std::string debug_scopes;
  // Counts the stream's dropped lines (logLinesDropped); may be null.
  std::shared_ptr<Counters> counters;
  // SYSLOG_IDENTIFIER of journal entries.
  std::string identifier = "qnreportingd";
};

// The platform log on Linux. Journal entries carry MESSAGE (the line), PRIORITY (default:
// notice, info: info, debug: debug, error: err), CODE_FILE, CODE_LINE, CODE_FUNC,
// QN_SCOPE (the scope's code, absent for the default log) and SYSLOG_IDENTIFIER. On the
// stream each line is the line plus "\n", and lines of different threads never interleave.
// Writing never blocks: a line the stream does not take at once waits in a queue of at most
// 4 MiB that a thread of the log writes out; beyond that, or when the stream is gone (its
// reader left; SIGPIPE must be ignored), the line is dropped and counted, and the next line
// that gets through says how many were lost. The `enabled` and `flags` arguments of
// RegisterScope are kept in nothing: every scope writes, and only the configured scopes
// write debug lines. Safe to call from any thread.
std::shared_ptr<Log> NewLinuxLog(LinuxLogOptions options = {});

// Whether `fd` is the stream that systemd connected to the journal: JOURNAL_STREAM
// ("<device>:<inode>", as systemd sets it) names the device and inode of `fd`.
// `journal_stream` may be null (the variable is not set).
bool IsJournalStream(int fd, const char* journal_stream);

}  // namespace qn
