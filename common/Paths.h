#pragma once

#include <sys/types.h>
#include <optional>
#include <string>

namespace qn {

// The folders of the daemon and its command-line tool, shared by both so that they agree on
// where the socket, the notification folder, the store and the logs live.
//
//   --home DIR            runtime DIR/run, state DIR/state, logs DIR/log
//   started by systemd    $RUNTIME_DIRECTORY, $STATE_DIRECTORY, $LOGS_DIRECTORY (the unit's
//                         RuntimeDirectory=, StateDirectory=, LogsDirectory=), each when set
//   root                  /run/quenta, /var/lib/quenta, /var/log/quenta
//   any other user        $XDG_RUNTIME_DIR/quenta, $XDG_STATE_HOME/quenta (else
//                         ~/.local/state/quenta), <state>/log
//
// A user other than root without XDG_RUNTIME_DIR (or without a home folder) gets no folder
// in a shared place such as /tmp, where another user could have made it first: the folder
// stays empty and `problem` says why (the daemon then needs --home, a client a socket path).
// The socket is <runtime>/reporting.sock unless --socket names another path.
struct Paths {
  std::string runtime_dir;  // socket, notifications
  std::string state_dir;    // reporting store, defaults
  std::string log_dir;      // summary files
  std::string socket_path;
  std::string problem;  // why a folder is empty; empty when every folder is set
};

// What the command line said (absent = not given).
struct PathOptions {
  std::optional<std::string> home;
  std::optional<std::string> socket;
};

// The parts of the process environment the folders depend on. Empty or relative XDG
// variables are ignored, as the XDG base-directory rules ask.
struct PathEnvironment {
  uid_t uid = 0;
  std::optional<std::string> xdg_runtime_dir;
  std::optional<std::string> xdg_state_home;
  std::optional<std::string> home;  // $HOME, else the password database's entry
  // What systemd sets for a unit's own folders.
  std::optional<std::string> runtime_directory;
  std::optional<std::string> state_directory;
  std::optional<std::string> logs_directory;

  // The calling process's user and environment.
  static PathEnvironment Current();
};

// Computes the folders; creates nothing.
Paths ResolvePaths(const PathOptions& options, const PathEnvironment& environment);
Paths ResolvePaths(const PathOptions& options);

}  // namespace qn
