#include "tools/qnreport/Cli.h"

#include <unistd.h>

#include <CLI/CLI.hpp>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <map>
#include <memory>

#include "common/Paths.h"
#include "qnreporting/Client.h"
#include "tools/qnreport/Admin.h"
#include "tools/qnreport/Commands.h"
#include "tools/qnreport/Shell.h"
#include "tools/qnreport/Top.h"

#ifndef QN_VERSION
#define QN_VERSION "0.1.0"
#endif

namespace qn::qnreport {
namespace {

constexpr int kExitFailure = 1;
constexpr int kExitUsage = 2;

constexpr const char* kShellDetails = R"(
Runs the operations in order on ONE connection, without waiting for replies in between
(use `wait` for that), and prints every reply as one JSON line as soon as it arrives:

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
`kill`, for the daemon to close the connection.
)";

constexpr const char* kFooter = R"(
The socket is DIR/run/reporting.sock with --home DIR, else /run/quenta/reporting.sock
for root and $XDG_RUNTIME_DIR/quenta/reporting.sock for other users.
Run `qnreport COMMAND --help` for one command; `man qnreport` has the whole story.
Exit status: 0 when every expected reply arrived, 1 when the daemon could not be reached
or a reply did not come in time (or an admin command failed), 2 for usage errors.
)";

// One protocol operation as a subcommand. Its words are checked and run by the shell's own
// line parser, so that `qnreport create 42` and the shell line `create 42` are one thing.
struct Operation {
  const char* word;
  const char* summary;
  std::vector<std::pair<const char*, const char*>> args;  // name, description
  bool last_is_optional = false;
  const char* details = "";
};

const std::vector<Operation>& Operations() {
  static const std::vector<Operation> operations = {
      {"create", "Create a reporting session", {{"ID", "64-bit reporter ID"}}},
      {"type",
       "Set a session's service type",
       {{"ID", "reporter ID"}, {"SERVICE_TYPE", "16-bit service type (65535: unknown)"}}},
      {"name",
       "Print a session's service type (65535: none)",
       {{"ID", "reporter ID; the daemon replies twice for 0"}}},
      {"config",
       "Set a session's configuration",
       {{"ID", "reporter ID"}, {"JSON", "the configuration, a JSON object"}}},
      {"start",
       "Start a session",
       {{"ID", "reporter ID"}},
       false,
       "\nThe daemon replies when the session is stopped or started again, so on its own this\n"
       "command waits until --timeout and exits 1. Use `qnreport shell` to start, send and\n"
       "stop on one connection.\n"},
      {"send",
       "Send a message to sessions",
       {{"JSON", "the payload, a JSON object"},
        {"CATEGORY", "32-bit category"},
        {"TYPE", "16-bit type"},
        {"IDS", "reporter IDs, comma-separated (none: every session)"}},
       true},
      {"stop", "Stop a session: its summary is sent", {{"ID", "reporter ID"}}},
      {"destroy", "Destroy a session", {{"ID", "reporter ID"}}},
      {"valid",
       "Print a session's reporter ID (0: none) and service type",
       {{"ID", "reporter ID"}}},
      {"reporters", "Print the reporter IDs of every session of every client", {}},
      {"kill", "Ask the daemon to exit (status 2) and wait until it has", {}},
  };
  return operations;
}

// A value check for CLI11: `accept` says whether the text is good.
CLI::Validator Check(const std::string& what, std::function<bool(const std::string&)> accept) {
  return CLI::Validator(
      [what, accept](std::string& text) { return accept(text) ? std::string() : what; }, "");
}

double Now() {
  return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

// Passes what a command writes on to `target` and remembers the last character, so that
// every command's output can be made to end with a newline.
class LastCharacter : public std::streambuf {
 public:
  explicit LastCharacter(std::ostream& target) : target_(target) {}
  bool EndsLine() const { return last_ == '\n'; }

 protected:
  int_type overflow(int_type c) override {
    if (traits_type::eq_int_type(c, traits_type::eof())) return traits_type::not_eof(c);
    const char ch = traits_type::to_char_type(c);
    return xsputn(&ch, 1) == 1 ? c : traits_type::eof();
  }
  std::streamsize xsputn(const char* text, std::streamsize n) override {
    if (n > 0) last_ = text[n - 1];
    return target_.write(text, n) ? n : 0;
  }
  int sync() override { return target_.flush() ? 0 : -1; }

 private:
  std::ostream& target_;
  char last_ = '\n';  // nothing written: nothing to end
};

int Run(std::vector<std::string> args, std::istream& in, std::ostream& out, std::ostream& err) {
  CLI::App app("Talks to the quenta reporting daemon (qnreportingd) and reads what it stored.",
               "qnreport");
  app.set_help_flag("-h,--help", "Show this text; `qnreport COMMAND --help` describes one");
  app.set_version_flag("--version", std::string("qnreport ") + QN_VERSION, "Show the version");
  app.require_subcommand(0, 1);  // none: told below, with the list of commands
  app.fallthrough();
  app.footer(kFooter);
  // An option given twice takes the last value, as the command-line convention goes.
  app.option_defaults()->multi_option_policy(CLI::MultiOptionPolicy::TakeLast);

  PathOptions paths;
  double timeout_seconds = 10;
  app.add_option("--home", paths.home, "The daemon runs with --home DIR")->type_name("DIR");
  app.add_option("--socket", paths.socket, "The daemon's socket (default: see below)")
      ->type_name("PATH");
  app.add_option("--timeout", timeout_seconds, "How long to wait for replies")
      ->type_name("SECONDS")
      ->default_str("10")
      ->check(Check("needs a positive number of seconds", [](const std::string& text) {
        char* end = nullptr;
        const double seconds = std::strtod(text.c_str(), &end);
        return !text.empty() && *end == '\0' && std::isfinite(seconds) && seconds > 0;
      }));

  // Protocol operations: one subcommand each, plus the shell.
  std::map<std::string, std::vector<std::string>> words;
  for (const Operation& op : Operations()) words[op.word].resize(op.args.size());
  std::vector<std::pair<CLI::App*, const Operation*>> operations;
  for (const Operation& op : Operations()) {
    CLI::App* sub = app.add_subcommand(op.word, op.summary);
    sub->footer(op.details);
    for (std::size_t i = 0; i < op.args.size(); ++i) {
      CLI::Option* option =
          sub->add_option(op.args[i].first, words[op.word][i], op.args[i].second)->type_name("");
      if (!(op.last_is_optional && i + 1 == op.args.size())) option->required();
    }
    operations.emplace_back(sub, &op);
  }
  CLI::App* shell =
      app.add_subcommand("shell", "Run operations from stdin, one per line, on one connection");
  shell->footer(kShellDetails);

  // Administration: the daemon's folders, no connection.
  CLI::App* defaults = app.add_subcommand("defaults", "Change or show the daemon's defaults");
  defaults->require_subcommand(1);
  defaults->footer(
      "\nThe suite is <state>/defaults/com.norvel.quenta.json. The daemon reads device_name and\n"
      "disable_reporting when told to: qnreport notify post com.norvel.quenta.reporting\n");
  std::string key, value;
  CLI::App* write = defaults->add_subcommand("write", "Set KEY to VALUE");
  write->add_option("KEY", key, "the key")->type_name("")->required();
  write->add_option("VALUE", value, "read as JSON when it is JSON (true, 1, \"text\"), else text")
      ->type_name("")
      ->required();
  CLI::App* erase = defaults->add_subcommand("delete", "Remove KEY");
  erase->add_option("KEY", key, "the key")->type_name("")->required();
  CLI::App* read = defaults->add_subcommand("read", "Print the suite as JSON");

  CLI::App* notify = app.add_subcommand("notify", "Post a system-wide notification");
  notify->require_subcommand(1);
  std::string notification;
  notify
      ->add_subcommand("post",
                       "Post NAME; com.norvel.quenta.reporting makes the daemon "
                       "re-read its defaults")
      ->add_option("NAME", notification, "the notification's name")
      ->type_name("")
      ->required()
      ->check(Check("needs a non-empty name", [](const std::string& t) { return !t.empty(); }));

  CLI::App* orientation = app.add_subcommand(
      "orientation", "Show the device and UI orientation, or post the UI orientation");
  std::string ui_orientation;
  CLI::App* post_ui = orientation->add_subcommand("ui", "Post VALUE as the UI orientation");
  post_ui->add_option("VALUE", ui_orientation, "normal, bottom-up, left-up, right-up or undefined")
      ->type_name("")
      ->required();
  orientation->footer(
      "\nThe device orientation is what the daemon follows from iio-sensor-proxy while a session\n"
      "reports orientation. The UI orientation is what the display side posts: a compositor\n"
      "hook or a user service runs `qnreport orientation ui left-up` at each rotation.\n");

  EventsOptions events_options;
  std::string sink, since;
  CLI::App* events = app.add_subcommand("events", "Show what the reporting store holds");
  events->footer(
      "\nRows come oldest first, one per line, in aligned columns: framework sessions and their\n"
      "messages, single messages, analytics and power-log events.\n"
      "TIME is \"2026-11-21 13:05[:SS]\", \"2026-11-21\", \"13:05\" (today), \"-15m\", \"-2h\",\n"
      "\"-1d\" (before now) or seconds since the epoch, in local time.\n");
  events->add_option("--sink", sink, "Only one sink's rows")
      ->check(CLI::IsMember({"reporting", "analytics", "powerlog"}));
  events->add_flag("--json", events_options.json, "Each row as a JSON object");
  events->add_flag("-f,--follow", events_options.follow,
                   "Then print new rows as they arrive (Ctrl-C ends)");
  events->add_option("--since", since, "Only rows from TIME on (see below)")
      ->type_name("TIME")
      ->check(Check("is not a time (try \"-15m\" or \"2026-11-21 13:05\")",
                    [](const std::string& t) { return ParseTimeArgument(t, 0).has_value(); }));
  events
      ->add_option("--session", events_options.filter.session,
                   "Only framework session N (SESSION column)")
      ->type_name("N");

  std::int64_t session_number = 0;
  CLI::App* session =
      app.add_subcommand("session", "Tell one framework session's story from the store");
  session->add_option("N", session_number, "the session's number (SESSION column of events)")
      ->type_name("")
      ->required();
  session->footer(
      "\nWhen it started and stopped, its messages counted by category and type, its summary\n"
      "event, the change of the driver-statistics counters, and its summary file.\n");

  bool stats_json = false;
  CLI::App* stats = app.add_subcommand("stats", "Show the daemon's counters");
  stats->add_flag("--json", stats_json, "The counters as the daemon wrote them (JSON)");
  stats->footer(
      "\nRequests by operation, messages, bad frames by code, flow-control pauses, what the\n"
      "limits refused, drops, the store's rows and lag, connections and sessions open. The\n"
      "daemon refreshes them once a second in <runtime>/stats.json; systemctl status shows the\n"
      "status line.\n");

  TopOptions top_options;
  CLI::App* top = app.add_subcommand("top", "Watch the daemon's rates and gauges live");
  top->add_option("--interval", top_options.interval, "Refresh every SECONDS (default 1)")
      ->type_name("SECONDS")
      ->check(CLI::Range(0.1, 3600.0));
  top->add_option("--count", top_options.count, "Refresh N times, then end")
      ->type_name("N")
      ->check(CLI::PositiveNumber);
  top->footer(
      "\nFollows <runtime>/stats.json: requests, messages and store rows per second, the\n"
      "gauges, pauses and refusals per second, and a sparkline of messages per second (one\n"
      "column per refresh, the last minute at most). q or Ctrl-C ends it. When standard output\n"
      "is not a terminal it prints one line per refresh instead.\n");

  std::reverse(args.begin(), args.end());
  try {
    app.parse(args);
  } catch (const CLI::ParseError& e) {
    if (e.get_exit_code() == 0) return app.exit(e, out, err);
    err << "qnreport: " << e.what() << "\nTry 'qnreport --help'.\n";
    return kExitUsage;
  }

  if (app.get_subcommands().empty()) {
    err << "qnreport: missing command\nTry 'qnreport --help'.\n";
    return kExitUsage;
  }
  const Paths resolved = ResolvePaths(paths);
  if (write->parsed()) return RunDefaultsWrite(resolved, key, value, err);
  if (erase->parsed()) return RunDefaultsDelete(resolved, key, err);
  if (read->parsed()) return RunDefaultsRead(resolved, out, err);
  if (notify->parsed()) return RunNotifyPost(resolved, notification, err);
  if (session->parsed()) return RunSession(resolved, session_number, out, err);
  if (stats->parsed()) return RunStats(resolved, stats_json, out, err);
  if (top->parsed()) {
    if (isatty(STDOUT_FILENO)) top_options.terminal = STDOUT_FILENO;
    return RunTop(resolved, top_options, out, err);
  }
  if (orientation->parsed()) {
    return RunOrientation(
        resolved, post_ui->parsed() ? std::optional(ui_orientation) : std::nullopt, out, err);
  }
  if (events->parsed()) {
    if (!sink.empty()) events_options.filter.sink = ParseReportingSink(sink);
    if (!since.empty()) events_options.filter.since = ParseTimeArgument(since, Now());
    return RunEvents(resolved, events_options, out, err);
  }

  // Everything else talks to the daemon.
  std::string line;
  for (const auto& [sub, op] : operations) {
    if (!sub->parsed()) continue;
    line = op->word;
    for (const std::string& word : words[op->word]) {
      if (!word.empty()) line += " " + word;
    }
    const auto parsed = ParseCommand(line);
    if (const auto* problem = std::get_if<std::string>(&parsed)) {
      err << "qnreport: " << *problem << "\nTry 'qnreport " << op->word << " --help'.\n";
      return kExitUsage;
    }
  }
  std::string error;
  auto client = client::Client::Connect(resolved.socket_path, &error);
  if (!client) {
    err << "qnreport: " << error << " (is qnreportingd running?)\n";
    return kExitFailure;
  }
  const auto timeout = std::chrono::milliseconds(static_cast<std::int64_t>(timeout_seconds * 1000));
  if (shell->parsed()) return RunShell(*client, in, out, timeout);
  Shell one(*client, out, timeout);
  one.RunLine(line, 1);
  return one.Finish();
}

}  // namespace

int RunCommandLine(std::vector<std::string> args, std::istream& in, std::ostream& out,
                   std::ostream& err) {
  LastCharacter out_end(out), err_end(err);
  std::ostream tracked_out(&out_end), tracked_err(&err_end);
  const int status = Run(std::move(args), in, tracked_out, tracked_err);
  if (!out_end.EndsLine()) tracked_out << "\n";
  if (!err_end.EndsLine()) tracked_err << "\n";
  tracked_out.flush();
  return status;
}

}  // namespace qn::qnreport
