#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "common/Value.h"

namespace qn::qnreport {

// One line of `qnreport shell` (or the arguments of a single-operation subcommand).
struct Command {
  enum class Kind {
    kCreate,     // create ID
    kType,       // type ID SERVICE_TYPE
    kName,       // name ID
    kConfig,     // config ID {json}
    kStart,      // start ID
    kSend,       // send {json} CATEGORY TYPE [ID,ID...]
    kStop,       // stop ID
    kDestroy,    // destroy ID
    kValid,      // valid ID
    kReporters,  // reporters
    kKill,       // kill
    kSleep,      // sleep SECONDS
    kWait,       // wait
    kNothing,    // an empty line or a comment (# ...)
  };
  Kind kind = Kind::kNothing;
  std::string name;  // the command word as written in the line ("create")
  std::int64_t reporterID = 0;
  std::uint16_t serviceType = 0;                         // type
  Value payload;                                         // config, send: a dictionary
  std::uint32_t category = 0;                            // send
  std::uint16_t type = 0;                                // send
  std::optional<std::vector<std::int64_t>> reporterIDs;  // send; absent = every session
  double seconds = 0;                                    // sleep
};

// Parses one line. Integers are decimal or 0x-hexadecimal and must fit their type; JSON
// arguments are objects and may contain blanks. On failure returns a message for the user.
std::variant<Command, std::string> ParseCommand(std::string_view line);

// The command words, for help texts and checks.
bool IsOperationWord(std::string_view word);

}  // namespace qn::qnreport
