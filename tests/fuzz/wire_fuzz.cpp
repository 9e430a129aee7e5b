// libFuzzer target for what the daemon does with a client's bytes: framing, MessagePack
// decoding, the request check, and every request that passes it handed to the real
// service (delegate, server instance, sessions) on fakes, as one client's connection.
// Besides "no crash, no leak, no sanitizer report" it checks that every decoded body
// re-encodes to bytes that decode to an equal value. Built and run by scripts/fuzz.

#include <cstddef>
#include <cstdint>
#include <string_view>

#include "Statistics/Service/QNReportingServiceDelegate.h"
#include "common/Frame.h"
#include "common/Json.h"
#include "common/MsgPack.h"
#include "common/Protocol.h"
#include "tests/fakes/FakeIpc.h"
#include "tests/fakes/FakePlatform.h"
#include "tests/fuzz/FuzzInput.h"

namespace {

using qn::fuzz::Check;

// The service on fakes with one client connected; what it queued runs at the end.
struct Service {
  qn::testing::FakePlatform env;
  std::shared_ptr<qn::testing::FakeIpcListener> listener =
      std::make_shared<qn::testing::FakeIpcListener>();
  std::shared_ptr<qn::QNReportingServiceDelegate> delegate =
      qn::QNReportingServiceDelegate::Create(env.platform);
  std::shared_ptr<qn::testing::FakeIpcConnection> connection =
      std::make_shared<qn::testing::FakeIpcConnection>(100);
  Service() {
    listener->SetDelegate(delegate);
    Check(listener->Accept(connection));
  }
  ~Service() {
    env.dispatcher->RunUntilIdle();
    connection->Invalidate();
    env.dispatcher->RunUntilIdle();
  }
};

void Exercise(std::string_view body, Service& service) {
  auto decoded = qn::DecodeMsgPack(body);
  auto* value = std::get_if<qn::Value>(&decoded);
  if (!value) {
    Check(!std::get<qn::protocol::RequestProblem>(decoded).message.empty());
    return;
  }
  auto again = qn::DecodeMsgPack(qn::EncodeMsgPack(*value));
  auto* same = std::get_if<qn::Value>(&again);
  Check(same != nullptr && *same == *value);

  auto checked = qn::protocol::ValidateRequest(*value);
  if (auto* header = std::get_if<qn::protocol::RequestHeader>(&checked)) {
    Check(header->request_id != 0);
    const qn::Array& items = *value->as_array();
    Check(qn::protocol::ArgumentsOf(header->op).size() + 2 == items.size());
    if (header->op == qn::protocol::Op::kKillService) return;  // ends the process by design
    service.connection->Request(header->op, qn::Array(items.begin() + 2, items.end()));
    service.env.dispatcher->RunUntilIdle();
  } else {
    auto& problem = std::get<qn::protocol::RequestProblem>(checked);
    qn::Value error = qn::protocol::MakeConnectionError(problem.code, problem.message);
    std::string frame;
    Check(qn::AppendFrame(frame, error));
  }
  // What the store and the logs would make of it.
  (void)qn::ToJsonLenient(*value);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::string_view input(reinterpret_cast<const char*>(data), size);
  Service service;

  // The whole input as one body.
  Exercise(input, service);

  // The input as a stream, fed in chunks whose size the first byte picks.
  if (input.empty()) return 0;
  const std::size_t chunk = 1 + static_cast<unsigned char>(input[0]) % 64;
  input.remove_prefix(1);
  qn::FrameDecoder decoder;
  for (std::size_t at = 0; at < input.size(); at += chunk) {
    decoder.Feed(input.substr(at, chunk));
    while (auto body = decoder.Next()) Exercise(*body, service);
    Check(decoder.buffered() <= at + chunk);
    if (decoder.error()) break;
  }
  return 0;
}
