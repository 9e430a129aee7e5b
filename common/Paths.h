#pragma once

#include <sys/types.h>
#include <optional>
#include <string>

namespace qn {

// The folders of the daemon and its command-line tool, shared by both so that they agree on
// where the socket, the notification folder, the store and the logs live.
//
//   --home DIR            runtime DIR/run, state DIR/state, logs DIR/log
//   root                  /run/quenta, /var/lib/quenta, /var/log/quenta
//   any other user        $XDG_RUNTIME_DIR/quenta (else /tmp/quenta-<uid>),
//                         $XDG_STATE_HOME/quenta (else ~/.local/state/quenta), <state>/log
//
// The socket is <runtime>/reporting.sock unless --socket names another path.
struct Paths {
  std::string runtime_dir;  // socket, notifications
  std::string state_dir;    // reporting store, defaults
  std::string log_dir;      // summary files
  std::string socket_path;
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

  // The calling process's user and environment.
  static PathEnvironment Current();
};

// Computes the folders; creates nothing.
Paths ResolvePaths(const PathOptions& options, const PathEnvironment& environment);
Paths ResolvePaths(const PathOptions& options);

}  // namespace qn
