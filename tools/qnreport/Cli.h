#pragma once

#include <istream>
#include <ostream>
#include <string>
#include <vector>

namespace qn::qnreport {

// The whole qnreport command line: parses `args` (without the program name), runs the
// command and returns the exit status: 0 when every expected reply arrived or the admin
// command succeeded, 1 when the daemon could not be reached, a reply did not come in time
// or an admin command failed, 2 for usage errors (told on `err` with a pointer to --help).
// `in` feeds `shell`; replies, help and rows go to `out`.
int RunCommandLine(std::vector<std::string> args, std::istream& in, std::ostream& out,
                   std::ostream& err);

}  // namespace qn::qnreport
