// qnreport: the line parser, and the shell against an in-process listener.

#include <gtest/gtest.h>

#include <sstream>

#include "common/Json.h"
#include "tests/ipc/ipc_test_util.h"
#include "tools/qnreport/Commands.h"
#include "tools/qnreport/Shell.h"

namespace qn::testing {
namespace {

using qnreport::ParseCommand;

std::string Problem(std::string_view line) {
  auto result = ParseCommand(line);
  if (auto* problem = std::get_if<std::string>(&result)) return *problem;
  ADD_FAILURE() << line << " was accepted";
  return {};
}

TEST(QnreportParseTest, BadLinesSayWhatIsWrong) {
  EXPECT_NE(Problem("frobnicate 1").find("unknown command \"frobnicate\""), std::string::npos);
  EXPECT_NE(Problem("create").find("missing reporter ID"), std::string::npos);
  EXPECT_NE(Problem("create 9223372036854775808").find("not a 64-bit integer"), std::string::npos);
  EXPECT_NE(Problem("type 1 65536").find("16-bit"), std::string::npos);
  EXPECT_NE(Problem("create 1 2").find("unexpected \"2\""), std::string::npos);
  EXPECT_NE(Problem("config 1 {\"a\":").find("JSON object"), std::string::npos);
  EXPECT_NE(Problem("config 1 [1]").find("not an array"), std::string::npos);
  EXPECT_NE(Problem("config 1 {\"a\" 1}").find("not valid JSON"), std::string::npos);
  EXPECT_NE(Problem("send {} 4294967296 1").find("32-bit"), std::string::npos);
  EXPECT_NE(Problem("send {} 1 1 1,x").find("bad reporter ID \"x\""), std::string::npos);
  EXPECT_NE(Problem("send {} 1").find("usage"), std::string::npos);
  EXPECT_NE(Problem("sleep -1").find("seconds"), std::string::npos);
}

TEST(QnreportShellTest, OneConnectionEveryReplyAsAJsonLine) {
  ListenerHarness harness([](protocol::Op op, const Array& args, IpcReply reply) {
    if (op == protocol::Op::kGetServiceNameForReporterID && args[0] == Value(0)) {
      reply(Value(65535));
    }
    FakeExportedObject::DefaultReply(op, args, reply);
  });
  auto client = client::Client::Connect(harness.socket_path());
  ASSERT_TRUE(client);
  std::istringstream in(
      "create 42\ntype 42 2\nbogus\nname 0\nsend {\"route\": \"speaker\"} 5 1 42\nwait\n"
      "valid 42\nreporters\n");
  std::ostringstream out;
  EXPECT_EQ(qnreport::RunShell(*client, in, out, std::chrono::seconds(20)), 0);
  // The error line is printed when its line is read; the replies when they arrive.
  std::istringstream printed(out.str());
  std::string line, replies;
  int errors = 0;
  while (std::getline(printed, line)) {
    Value value;
    ASSERT_FALSE(ParseJson(line, value)) << line;
    const bool error = value.as_dictionary()->Contains("error");
    errors += error && *value.as_dictionary()->Find("line") == Value(3);
    if (!error) replies += line + "\n";
  }
  EXPECT_EQ(errors, 1) << out.str();
  EXPECT_EQ(replies,
            R"({"op":"create","id":42,"reply":true}
{"op":"type","id":42,"reply":true}
{"op":"name","id":0,"reply":65535}
{"op":"name","id":0,"reply":0}
{"op":"send","reply":null}
{"op":"valid","id":42,"reply":{"reporterID":42,"serviceType":7}}
{"op":"reporters","reply":[1,2,3]}
)");
  EXPECT_EQ(harness.delegate().accepted().size(), 1u);  // one connection served all of it
}

}  // namespace
}  // namespace qn::testing
