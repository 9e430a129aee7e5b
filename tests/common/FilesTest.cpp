#include "common/Files.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <fstream>

#include "tests/fakes/TempDir.h"

namespace qn {
namespace {

namespace fs = std::filesystem;

class FilesTest : public ::testing::Test {
 protected:
  FilesTest() : old_umask_(umask(022)) {}
  ~FilesTest() override { umask(old_umask_); }

  static mode_t ModeOf(const std::string& path) {
    struct stat st;
    EXPECT_EQ(stat(path.c_str(), &st), 0) << path;
    return st.st_mode & 07777;
  }
  std::vector<std::string> Listing(const std::string& dir) const {
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(dir)) {
      names.push_back(entry.path().filename().string());
    }
    std::sort(names.begin(), names.end());
    return names;
  }

  const mode_t old_umask_;
  testing::TempDir dir_;
  const std::string& root_ = dir_.path();
};

TEST_F(FilesTest, CreatedDirectoriesGetExactlyTheModeDespiteTheUmask) {
  const std::string existing = root_ + "/existing";
  ASSERT_EQ(mkdir(existing.c_str(), 0700), 0);
  const std::string deep = existing + "/a//b/c/";
  ASSERT_FALSE(CreateDirectories(deep, 0777));
  EXPECT_EQ(ModeOf(existing), 0700u);  // not created here: left as it was
  EXPECT_EQ(ModeOf(existing + "/a"), 0777u);
  EXPECT_EQ(ModeOf(existing + "/a/b"), 0777u);
  EXPECT_EQ(ModeOf(existing + "/a/b/c"), 0777u);
  EXPECT_FALSE(CreateDirectories(deep, 0777));  // exists already: fine

  ASSERT_FALSE(CreateDirectories(root_ + "/private/x", 0700));
  EXPECT_EQ(ModeOf(root_ + "/private/x"), 0700u);
}

TEST_F(FilesTest, AtomicWriteFailuresLeaveNothingBehind) {
  // Target is a directory: the rename fails after the temporary was written.
  ASSERT_FALSE(CreateDirectories(root_ + "/dir.json", 0755));
  auto error = WriteFileAtomically(root_ + "/dir.json", "text");
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain, "posix");
  EXPECT_NE(error->description.find("rename"), std::string::npos) << error->description;
  EXPECT_EQ(Listing(root_), (std::vector<std::string>{"dir.json"}));

  // Missing directory, and a path component that is a file.
  EXPECT_TRUE(WriteFileAtomically(root_ + "/missing/file.json", "text"));
  std::ofstream(root_ + "/plain") << "x";
  error = WriteFileAtomically(root_ + "/plain/file.json", "text");
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, ENOTDIR);
  EXPECT_EQ(testing::ReadFileText(root_ + "/plain"), "x");
  EXPECT_EQ(Listing(root_), (std::vector<std::string>{"dir.json", "plain"}));
  EXPECT_TRUE(WriteFileAtomically(root_ + "/", "text"));
}

}  // namespace
}  // namespace qn
