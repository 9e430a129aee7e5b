#include "common/Paths.h"

#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>
#include <cerrno>
#include <cstdlib>
#include <cstring>

namespace qn {

namespace {

std::optional<std::string> AbsoluteVariable(const char* name) {
  const char* value = std::getenv(name);
  if (value == nullptr || value[0] != '/') return std::nullopt;
  return std::string(value);
}

std::string WithoutTrailingSlashes(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

}  // namespace

PathEnvironment PathEnvironment::Current() {
  PathEnvironment environment;
  environment.uid = getuid();
  environment.xdg_runtime_dir = AbsoluteVariable("XDG_RUNTIME_DIR");
  environment.xdg_state_home = AbsoluteVariable("XDG_STATE_HOME");
  environment.home = AbsoluteVariable("HOME");
  environment.runtime_directory = AbsoluteVariable("RUNTIME_DIRECTORY");
  environment.state_directory = AbsoluteVariable("STATE_DIRECTORY");
  environment.logs_directory = AbsoluteVariable("LOGS_DIRECTORY");
  if (!environment.home) {
    struct passwd entry;
    struct passwd* found = nullptr;
    char buffer[4096];
    if (getpwuid_r(environment.uid, &entry, buffer, sizeof buffer, &found) == 0 && found &&
        found->pw_dir && found->pw_dir[0] == '/') {
      environment.home = std::string(found->pw_dir);
    }
  }
  return environment;
}

Paths ResolvePaths(const PathOptions& options, const PathEnvironment& environment) {
  Paths paths;
  if (options.home) {
    std::string home = WithoutTrailingSlashes(*options.home);
    paths.runtime_dir = home + "/run";
    paths.state_dir = home + "/state";
    paths.log_dir = home + "/log";
  } else if (environment.uid == 0) {
    paths.runtime_dir = "/run/quenta";
    paths.state_dir = "/var/lib/quenta";
    paths.log_dir = "/var/log/quenta";
  } else {
    if (environment.xdg_runtime_dir && !environment.xdg_runtime_dir->empty()) {
      paths.runtime_dir = WithoutTrailingSlashes(*environment.xdg_runtime_dir) + "/quenta";
    }
    if (environment.xdg_state_home && !environment.xdg_state_home->empty()) {
      paths.state_dir = WithoutTrailingSlashes(*environment.xdg_state_home) + "/quenta";
    } else if (environment.home && !environment.home->empty()) {
      paths.state_dir = WithoutTrailingSlashes(*environment.home) + "/.local/state/quenta";
    }
    if (!paths.state_dir.empty()) paths.log_dir = paths.state_dir + "/log";
  }
  // A unit's own folders, made by systemd for the daemon's user, come first.
  if (!options.home) {
    for (const auto& [dir, set] : {std::pair{&paths.runtime_dir, &environment.runtime_directory},
                                   std::pair{&paths.state_dir, &environment.state_directory},
                                   std::pair{&paths.log_dir, &environment.logs_directory}}) {
      if (*set && !(*set)->empty()) *dir = WithoutTrailingSlashes(**set);
    }
  }
  if (paths.runtime_dir.empty()) {
    paths.problem =
        "XDG_RUNTIME_DIR is not set, and a user other than root has no runtime "
        "folder without it";
  } else if (paths.state_dir.empty()) {
    paths.problem =
        "neither XDG_STATE_HOME nor a home folder is set, and a user other than "
        "root has no state folder without them";
  }
  paths.socket_path = options.socket              ? *options.socket
                      : paths.runtime_dir.empty() ? ""
                                                  : paths.runtime_dir + "/reporting.sock";
  return paths;
}

Paths ResolvePaths(const PathOptions& options) {
  return ResolvePaths(options, PathEnvironment::Current());
}

}  // namespace qn
