#pragma once

#include <iosfwd>
#include <string>
#include <vector>

#include "common/Paths.h"

namespace qn::qnreport {

// The administration commands, which work on the daemon's folders directly and need no
// connection. Each takes the words after its command word, writes its output to `out` and
// its complaints to `err`, and returns the process exit status (0 success, 1 failure,
// 2 usage error).

// defaults write KEY VALUE | delete KEY | read: the daemon's defaults suite
// ("com.norvel.quenta"). VALUE is read as JSON when it is JSON (true, 0, "text", {...}),
// else as a plain string (YES).
int RunDefaults(const Paths& paths, const std::vector<std::string>& args, std::ostream& out,
                std::ostream& err);

// notify post NAME: posts a system-wide notification to every process watching it.
int RunNotify(const Paths& paths, const std::vector<std::string>& args, std::ostream& out,
              std::ostream& err);

// events [--sink reporting|analytics|powerlog] [--json]: the rows of the reporting store,
// oldest first, one per line (a JSON object per line with --json).
int RunEvents(const Paths& paths, const std::vector<std::string>& args, std::ostream& out,
              std::ostream& err);

}  // namespace qn::qnreport
