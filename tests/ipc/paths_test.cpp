// The daemon's and the CLI's folders (common/Paths.h).

#include <gtest/gtest.h>

#include <sys/stat.h>

#include "common/Paths.h"
#include "tests/ipc/ipc_test_util.h"

namespace qn {
namespace {

TEST(PathsTest, HomeOptionPutsEverythingUnderIt) {
  PathEnvironment root;  // uid 0: --home still wins
  Paths paths = ResolvePaths(PathOptions{"/srv/q/", std::nullopt}, root);
  EXPECT_EQ(paths.runtime_dir, "/srv/q/run");
  EXPECT_EQ(paths.state_dir, "/srv/q/state");
  EXPECT_EQ(paths.log_dir, "/srv/q/log");
  EXPECT_EQ(paths.socket_path, "/srv/q/run/reporting.sock");
}

TEST(PathsTest, RootUsesTheSystemFolders) {
  PathEnvironment root;
  root.xdg_runtime_dir = "/run/user/0";  // ignored for root
  Paths paths = ResolvePaths({}, root);
  EXPECT_EQ(paths.runtime_dir, "/run/quenta");
  EXPECT_EQ(paths.state_dir, "/var/lib/quenta");
  EXPECT_EQ(paths.log_dir, "/var/log/quenta");
  EXPECT_EQ(paths.socket_path, "/run/quenta/reporting.sock");
}

TEST(PathsTest, OtherUsersUseTheXdgFoldersOrFallBack) {
  PathEnvironment user;
  user.uid = 1000;
  user.xdg_runtime_dir = "/run/user/1000";
  user.xdg_state_home = "/home/u/.state";
  user.home = "/home/u";
  Paths paths = ResolvePaths({}, user);
  EXPECT_EQ(paths.runtime_dir, "/run/user/1000/quenta");
  EXPECT_EQ(paths.state_dir, "/home/u/.state/quenta");
  EXPECT_EQ(paths.log_dir, "/home/u/.state/quenta/log");
  EXPECT_EQ(paths.socket_path, "/run/user/1000/quenta/reporting.sock");

  // Without the XDG variables: a runtime folder of this user's own, state under the home.
  user.xdg_runtime_dir.reset();
  user.xdg_state_home.reset();
  paths = ResolvePaths({}, user);
  EXPECT_EQ(paths.runtime_dir, "/tmp/quenta-1000");
  EXPECT_EQ(paths.state_dir, "/home/u/.local/state/quenta");
}

}  // namespace
}  // namespace qn
