// qnreport: the command-line client and admin tool of qnreportingd.

#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <iostream>
#include <optional>
#include <sstream>
#include <string>
#include <string_view>
#include <vector>

#include "common/Paths.h"
#include "qnreporting/Client.h"
#include "tools/qnreport/Admin.h"
#include "tools/qnreport/Commands.h"
#include "tools/qnreport/Shell.h"

namespace qn::qnreport {
namespace {

constexpr int kExitUsage = 2;

constexpr const char* kUsage =
    R"(Usage: qnreport [--home DIR] [--socket PATH] [--timeout SECONDS] COMMAND [ARGS]

Talks to the quenta reporting daemon (qnreportingd) over its Unix socket.

Commands:
  shell                      run operations read from stdin, one per line, on one
                             connection; print every reply as a JSON line
  create ID                  createReportingSession
  type ID SERVICE_TYPE       setServiceType
  name ID                    getServiceNameForReporterID (replies twice for ID 0)
  config ID {json}           setConfiguration
  start ID                   startReportingSessionForID (the reply may come only when
                             the session is stopped)
  send {json} CATEGORY TYPE [ID,ID...]
                             sendMessage (no IDs: every started session)
  stop ID                    stopReportingSessionForID
  destroy ID                 destroyReportingSession
  valid ID                   reporterID:valid:
  reporters                  getAllReporters
  kill                       killService: ends the daemon
  defaults write KEY VALUE | delete KEY | read
                             the daemon's defaults ("device_name", "disable_reporting");
                             the daemon reads them when notified (see notify)
  notify post NAME           post a notification; com.norvel.quenta.reporting makes the
                             daemon re-read its defaults (as `systemctl reload` does)
  events [--sink reporting|analytics|powerlog] [--json]
                             what the reporting store holds, oldest first

Options:
  --home DIR         the daemon's folders are under DIR (socket: DIR/run/reporting.sock)
  --socket PATH      the daemon's socket (default: root /run/quenta/reporting.sock, other
                     users $XDG_RUNTIME_DIR/quenta/reporting.sock)
  --timeout SECONDS  how long to wait for replies (default 10)
  --help             this text; `qnreport COMMAND --help` describes one command

Exit status: 0 when every expected reply arrived, 1 when the daemon could not be reached
or a reply did not come in time (or an admin command failed), 2 for usage errors.
)";

constexpr const char* kShellHelp =
    R"(Usage: qnreport [--home DIR] [--socket PATH] [--timeout SECONDS] shell

Reads one operation per line from stdin and runs them in order on ONE connection, without
waiting for replies in between (use `wait` for that). Every reply is printed as one JSON
line on stdout as soon as it arrives:

  create 42                           {"op":"create","id":42,"reply":true}
  type 42 2                           {"op":"type","id":42,"reply":true}
  name 42                             {"op":"name","id":42,"reply":2}
  config 42 {"key": "value"}          {"op":"config","id":42,"reply":true}
  start 42                            {"op":"start","id":42,"reply":true}
  send {"route":"speaker"} 5 1 42     {"op":"send","reply":null}
  send {"a":1} 0x10005 2 1,2,3        (several sessions; no list = every started one)
  stop 42                             {"op":"stop","id":42,"reply":true}
  destroy 42                          {"op":"destroy","id":42,"reply":true}
  valid 42                            {"op":"valid","id":42,"reply":{"reporterID":42,"serviceType":2}}
  reporters                           {"op":"reporters","reply":[42]}
  kill                                (no reply; the daemon exits)
  sleep SECONDS                       pause reading input
  wait                                wait for every pending reply (up to --timeout)
  # comment, or an empty line         ignored

Numbers are decimal or 0x-hexadecimal. A reply with an error (sendMessage while reporting
is disabled) is {"op":"send","reply":{"domain":...,"code":1,"userInfo":null}}. The reply
to `start` of a session that starts comes only when the session is stopped or started
again. `name 0` prints two lines.

Other lines:
  {"error":"...","line":N}            a line that could not be run; the shell goes on
  {"event":"connection-error","domain":"com.norvel.quenta.ipc","code":N,"message":"..."}
                                      the daemon rejected what it was sent
  {"event":"closed"}                  the daemon closed the connection
  {"event":"unexpected-reply","request":N,"reply":...}
                                      a reply no request was waiting for

At the end of input the shell waits for pending replies (up to --timeout) and, after
`kill`, for the daemon to close the connection. Exit status 0 when every expected reply
arrived, 1 otherwise.
)";

struct CommandHelp {
  const char* word;
  const char* text;
};

constexpr CommandHelp kCommandHelp[] = {
    {"create",
     "Usage: qnreport create ID\n\nCreates a reporting session with the 64-bit "
     "reporter ID. Prints {\"op\":\"create\",\"id\":ID,\"reply\":true}.\n"},
    {"type",
     "Usage: qnreport type ID SERVICE_TYPE\n\nSets the session's 16-bit service type "
     "(65535 = unknown). Prints {\"op\":\"type\",\"id\":ID,\"reply\":true}.\n"},
    {"name",
     "Usage: qnreport name ID\n\nPrints the service type of the session with this ID "
     "(65535 when there is none): {\"op\":\"name\",\"id\":ID,\"reply\":N}.\nFor ID 0 "
     "the daemon replies twice, so two lines are printed.\n"},
    {"config",
     "Usage: qnreport config ID {json}\n\nSets the session's configuration (a JSON "
     "object). Prints {\"op\":\"config\",\"id\":ID,\"reply\":true}.\n"},
    {"start",
     "Usage: qnreport start ID\n\nStarts the session. When this call starts it, the "
     "daemon replies only when the session is\nstopped or started again, so on its "
     "own this command waits until --timeout and exits 1.\nUse `qnreport shell` "
     "to start, send and stop on one connection.\n"},
    {"send",
     "Usage: qnreport send {json} CATEGORY TYPE [ID,ID...]\n\nSends a message (a JSON "
     "object) with a 32-bit category and a 16-bit type to the listed\nsessions, or to "
     "every started session when no IDs are given. Prints\n{\"op\":\"send\",\"reply\":"
     "null}, or the error when reporting is disabled.\n"},
    {"stop",
     "Usage: qnreport stop ID\n\nStops the session. Prints {\"op\":\"stop\",\"id\":ID,"
     "\"reply\":true}.\n"},
    {"destroy",
     "Usage: qnreport destroy ID\n\nDestroys the session. Prints "
     "{\"op\":\"destroy\",\"id\":ID,\"reply\":true}.\n"},
    {"valid",
     "Usage: qnreport valid ID\n\nPrints {\"op\":\"valid\",\"id\":ID,\"reply\":"
     "{\"reporterID\":ID,\"serviceType\":N}}; reporterID is 0 when\nno session has "
     "this ID.\n"},
    {"reporters",
     "Usage: qnreport reporters\n\nPrints the reporter IDs of every session of "
     "every client: {\"op\":\"reporters\",\"reply\":[...]}.\n"},
    {"kill",
     "Usage: qnreport kill\n\nAsks the daemon to exit (status 2). Waits until it has "
     "closed the connection.\n"},
    {"defaults",
     "Usage: qnreport defaults write KEY VALUE | delete KEY | read\n\nChanges or "
     "shows the daemon's defaults suite (<state>/defaults/com.norvel.quenta.json).\n"
     "VALUE is read as JSON when it is JSON (true, 1, \"text\"), else as a string (YES).\n"
     "Keys the daemon reads: device_name, disable_reporting. It reads them when told to:\n"
     "  qnreport notify post com.norvel.quenta.reporting\n"},
    {"notify",
     "Usage: qnreport notify post NAME\n\nPosts a system-wide notification (no payload) "
     "to every process watching NAME.\ncom.norvel.quenta.reporting makes the daemon "
     "re-read its defaults.\n"},
    {"events",
     "Usage: qnreport events [--sink reporting|analytics|powerlog] [--json]\n\nShows "
     "what the reporting store (<state>/reports.db) holds, oldest first, one row\nper "
     "line: framework sessions and their messages, single messages (reporting),\n"
     "analytics events and power-log events. --json prints each row as a JSON object.\n"},
};

struct GlobalOptions {
  PathOptions paths;
  double timeout_seconds = 10;
};

int Usage(const std::string& problem) {
  std::fprintf(stderr, "qnreport: %s\nTry 'qnreport --help'.\n", problem.c_str());
  return kExitUsage;
}

bool WantsHelp(const std::vector<std::string>& args) {
  for (const auto& arg : args) {
    if (arg == "--help" || arg == "-h") return true;
  }
  return false;
}

std::unique_ptr<client::Client> Connect(const GlobalOptions& options) {
  const std::string path = ResolvePaths(options.paths).socket_path;
  std::string error;
  auto client = client::Client::Connect(path, &error);
  if (!client) {
    std::fprintf(stderr, "qnreport: %s (is qnreportingd running?)\n", error.c_str());
  }
  return client;
}

client::Timeout TimeoutOf(const GlobalOptions& options) {
  return std::chrono::milliseconds(static_cast<std::int64_t>(options.timeout_seconds * 1000));
}

int Main(int argc, char** argv) {
  std::vector<std::string> args(argv + 1, argv + argc);
  GlobalOptions options;
  std::size_t i = 0;
  for (; i < args.size(); ++i) {
    const std::string& arg = args[i];
    if (arg == "--help" || arg == "-h") {
      std::fputs(kUsage, stdout);
      return 0;
    }
    if (arg.rfind("--", 0) != 0) break;
    std::string name = arg;
    std::optional<std::string> value;
    if (auto eq = arg.find('='); eq != std::string::npos) {
      name = arg.substr(0, eq);
      value = arg.substr(eq + 1);
    }
    if (name != "--home" && name != "--socket" && name != "--timeout") {
      return Usage("unknown option " + name);
    }
    if (!value) {
      if (i + 1 >= args.size()) return Usage(name + " needs a value");
      value = args[++i];
    }
    if (name == "--home") {
      options.paths.home = *value;
    } else if (name == "--socket") {
      options.paths.socket = *value;
    } else {
      char* end = nullptr;
      options.timeout_seconds = std::strtod(value->c_str(), &end);
      if (value->empty() || *end != '\0' || !std::isfinite(options.timeout_seconds) ||
          options.timeout_seconds <= 0) {
        return Usage("--timeout needs a positive number of seconds");
      }
    }
  }
  if (i >= args.size()) return Usage("missing command");
  const std::string command = args[i];
  std::vector<std::string> rest(args.begin() + static_cast<std::ptrdiff_t>(i) + 1, args.end());

  if (command == "shell") {
    if (WantsHelp(rest)) {
      std::fputs(kShellHelp, stdout);
      return 0;
    }
    if (!rest.empty()) return Usage("shell takes no arguments; it reads stdin");
    auto client = Connect(options);
    if (!client) return 1;
    return RunShell(*client, std::cin, std::cout, TimeoutOf(options));
  }

  for (const CommandHelp& help : kCommandHelp) {
    if (command == help.word && WantsHelp(rest)) {
      std::fputs(help.text, stdout);
      return 0;
    }
  }
  if (command == "defaults")
    return RunDefaults(ResolvePaths(options.paths), rest, std::cout, std::cerr);
  if (command == "notify")
    return RunNotify(ResolvePaths(options.paths), rest, std::cout, std::cerr);
  if (command == "events")
    return RunEvents(ResolvePaths(options.paths), rest, std::cout, std::cerr);
  if (!IsOperationWord(command) || command == "sleep" || command == "wait") {
    return Usage("unknown command " + command);
  }

  // One operation: the same parser as the shell's, on the arguments joined into a line.
  std::string line = command;
  for (const auto& arg : rest) line += " " + arg;
  auto parsed = ParseCommand(line);
  if (auto* problem = std::get_if<std::string>(&parsed)) return Usage(*problem);
  auto client = Connect(options);
  if (!client) return 1;
  Shell shell(*client, std::cout, TimeoutOf(options));
  shell.RunLine(line, 1);
  return shell.Finish();
}

}  // namespace
}  // namespace qn::qnreport

int main(int argc, char** argv) { return qn::qnreport::Main(argc, argv); }
