// The C interface of libqnreporting, called from C (c_api_check.c).

#include <gtest/gtest.h>

#include "qnreporting/qnreporting.h"
#include "tests/ipc/ipc_test_util.h"

extern "C" int qn_c_api_round_trip(const char* socket_path);

namespace qn::testing {
namespace {

TEST(CApiTest, EveryOperationFromC) {
  ListenerHarness harness([](protocol::Op op, const Array& args, IpcReply reply) {
    // sendMessage without reporter IDs is refused, as with reporting disabled.
    if (op == protocol::Op::kSendMessage && args[3].is_null()) {
      reply(Value(Dictionary{
          {"domain", "com.norvel.audio.reporting"}, {"code", 1}, {"userInfo", Value()}}));
      return;
    }
    FakeExportedObject::DefaultReply(op, args, reply);
  });
  EXPECT_EQ(qn_c_api_round_trip(harness.socket_path().c_str()), 0);
  EXPECT_TRUE(Eventually([&] { return harness.delegate().invalidations() == 1; }));
}

TEST(CApiTest, ConnectFailureDescribesTheProblem) {
  TempDir dir;
  char error[256] = "untouched";
  const std::string path = dir.path() + "/none.sock";
  EXPECT_EQ(qn_client_connect(path.c_str(), error, sizeof error), nullptr);
  EXPECT_NE(std::string(error).find("none.sock"), std::string::npos) << error;
  qn_client_free(nullptr);
  EXPECT_EQ(qn_client_create_session(nullptr, 1, 0), QN_BAD_ARGUMENT);
}

}  // namespace
}  // namespace qn::testing
