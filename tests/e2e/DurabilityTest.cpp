// What the daemon was handed survives its exit: summary files, stale temporary files.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "common/Files.h"
#include "common/Json.h"
#include "tests/e2e/Daemon.h"

namespace qn::e2e {
namespace {

using ::testing::EndsWith;

// The daemon on a --home of the caller's, so that files can be placed before it starts.
std::unique_ptr<Daemon> StartOn(const testing::TempDir& home, std::vector<std::string> args) {
  args.insert(args.begin(), {"--home", home.path()});
  return std::make_unique<Daemon>(args, home.File("run/reporting.sock"));
}

// The names in `dir`, sorted.
std::vector<std::string> NamesIn(const std::string& dir) {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& entry : std::filesystem::directory_iterator(dir, ec)) {
    names.push_back(entry.path().filename().string());
  }
  std::sort(names.begin(), names.end());
  return names;
}

TEST(DurabilityTest, SummaryFileIsInPlaceWhenTheStopReplyArrivesAndKillServiceKeepsIt) {
  testing::TempDir home;
  const std::string dir = home.File("log/DiagnosticLogs/Audio/Reporting");
  ASSERT_FALSE(CreateDirectories(dir, 0777));
  // What an earlier run left when it ended between writing and renaming.
  { std::ofstream(dir + "/.20240101-000000+0000-quenta-unknown-generic.json.tmp-7-0-1f") << "["; }
  auto daemon = StartOn(home, {"--internal-build"});
  ASSERT_TRUE(daemon->started());
  EXPECT_THAT(NamesIn(dir), ::testing::IsEmpty());

  struct Row {
    std::int64_t id;
    std::uint16_t serviceType;
    const char* suffix;
    bool killAfterReply;
  };
  auto client = daemon->Connect();
  ASSERT_TRUE(client);
  std::size_t expected = 0;
  for (const Row& row : {Row{1, 0, "-quenta-unknown-generic.json", false},
                         Row{2, 13, "-quenta-unknown-telephony.json", true}}) {
    SCOPED_TRACE(row.suffix);
    EXPECT_EQ(client->createReportingSessionSync(row.id), true);
    EXPECT_EQ(client->setServiceTypeSync(row.serviceType, row.id), true);
    client->startReportingSessionForID(row.id, nullptr);
    EXPECT_TRUE(RepliedWithoutError(client->sendMessageSync(Value(Dictionary{{"n", row.id}}), 1, 1,
                                                            std::vector<std::int64_t>{row.id})));
    ASSERT_EQ(client->stopReportingSessionForIDSync(row.id), true);
    if (row.killAfterReply) {
      client->killService();
      EXPECT_EQ(daemon->process().Wait(), Exited(2));
    }
    const auto names = NamesIn(dir);
    ASSERT_EQ(names.size(), ++expected);
    const auto file = std::find_if(names.begin(), names.end(),
                                   [&](const auto& name) { return name.ends_with(row.suffix); });
    ASSERT_NE(file, names.end());
    Value content;
    EXPECT_FALSE(ParseJson(testing::ReadFileText(dir + "/" + *file), content));
    ASSERT_TRUE(content.as_array());
    EXPECT_EQ(content.as_array()->size(), 3u);  // userInfo, the message, the summary event
  }
}

}  // namespace
}  // namespace qn::e2e
