#pragma once

#include <atomic>
#include <istream>
#include <mutex>
#include <ostream>
#include <string>

#include "common/Value.h"
#include "qnreporting/Client.h"
#include "tools/qnreport/Commands.h"

namespace qn::qnreport {

// Runs commands on one connection and prints every reply and event as one JSON line:
//   {"op":"create","id":42,"reply":true}
//   {"op":"send","reply":null}
//   {"op":"name","id":0,"reply":65535}          (twice for ID 0)
//   {"error":"unknown command \"foo\" ...","line":3}
//   {"event":"connection-error","domain":...,"code":...,"message":...}
//   {"event":"closed"}                            (the connection ended)
// Replies are printed from the client's I/O thread as they arrive; lines never interleave.
// Commands are run from one thread.
class Shell {
 public:
  Shell(client::Client& client, std::ostream& out, client::Timeout timeout);
  // Closes the connection and waits until no callback can reach this object any more.
  ~Shell();

  // Parses and runs one input line (`number` is its line number, for error lines).
  void RunLine(std::string_view line, int number);
  // End of input: writes out what is queued, waits for the pending replies (and, after
  // kill, for the connection to end). Returns the exit status: 0 when every expected
  // reply arrived, 1 otherwise.
  int Finish();

 private:
  void Run(const Command& command, int number);
  void Print(const Dictionary& line);
  void PrintReply(const Command& command, bool with_id, Value reply);
  void PrintError(const std::string& message, int number);

  client::Client& client_;
  std::ostream& out_;
  const client::Timeout timeout_;
  std::mutex out_mu_;
  std::atomic<bool> closing_{false};  // we close the connection: no "closed" event
  bool killed_ = false;
  bool failed_ = false;
};

// Reads `in` line by line and runs each line in a Shell; returns its exit status.
int RunShell(client::Client& client, std::istream& in, std::ostream& out, client::Timeout timeout);

}  // namespace qn::qnreport
