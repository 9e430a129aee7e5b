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

std::vector<Value> JsonLines(const std::string& text) {
  std::vector<Value> lines;
  std::istringstream in(text);
  std::string line;
  while (std::getline(in, line)) {
    Value value;
    EXPECT_FALSE(ParseJson(line, value)) << line;
    lines.push_back(value);
  }
  return lines;
}

Value Json(std::string_view text) {
  Value value;
  EXPECT_FALSE(ParseJson(text, value)) << text;
  return value;
}

TEST(QnreportShellTest, OneConnectionEveryReplyAsAJsonLine) {
  ListenerHarness harness([](protocol::Op op, const Array& args, IpcReply reply) {
    if (op == protocol::Op::kGetServiceNameForReporterID && args[0] == Value(0)) {
      reply(Value(65535));
    }
    FakeExportedObject::DefaultReply(op, args, reply);
  });
  std::string error;
  auto client = client::Client::Connect(harness.socket_path(), &error);
  ASSERT_TRUE(client) << error;
  std::istringstream in(R"(create 42
type 42 2
bogus
name 0
send {"route": "speaker"} 5 1 42
wait
valid 42
reporters
)");
  std::ostringstream out;
  EXPECT_EQ(qnreport::RunShell(*client, in, out, std::chrono::seconds(20)), 0);
  auto lines = JsonLines(out.str());
  // The error line is printed when its line is read; the replies when they arrive.
  std::vector<Value> expected = {
      Json(R"({"op":"create","id":42,"reply":true})"),
      Json(R"({"op":"type","id":42,"reply":true})"),
      Json(R"({"op":"name","id":0,"reply":65535})"),
      Json(R"({"op":"name","id":0,"reply":0})"),
      Json(R"({"op":"send","reply":null})"),
      Json(R"({"op":"valid","id":42,"reply":{"reporterID":42,"serviceType":7}})"),
      Json(R"({"op":"reporters","reply":[1,2,3]})"),
  };
  std::vector<Value> replies;
  int errors = 0;
  for (const Value& line : lines) {
    if (line.as_dictionary()->Contains("error")) {
      ++errors;
      EXPECT_EQ(*line.as_dictionary()->Find("line"), Value(3));
    } else {
      replies.push_back(line);
    }
  }
  EXPECT_EQ(errors, 1);
  EXPECT_EQ(replies, expected) << out.str();
  // One connection served all of it.
  EXPECT_EQ(harness.delegate().accepted().size(), 1u);
}

}  // namespace
}  // namespace qn::testing
