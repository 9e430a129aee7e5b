// libFuzzer target for what the daemon does with a client's bytes: framing, MessagePack
// decoding and the request check. Besides "no crash, no leak, no sanitizer report" it
// checks that every decoded body re-encodes to bytes that decode to an equal value.
//
// Build: cmake -DCMAKE_CXX_COMPILER=clang++ -DQN_FUZZ=ON -DQN_SANITIZE=address ...
// Run:   wire_fuzz -max_total_time=60 [corpus dir]

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "common/Frame.h"
#include "common/Json.h"
#include "common/MsgPack.h"
#include "common/Protocol.h"

namespace {

void Check(bool ok) {
  if (!ok) std::abort();
}

void Exercise(std::string_view body) {
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
    Check(qn::protocol::ArgumentsOf(header->op).size() + 2 == value->as_array()->size());
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

  // The whole input as one body.
  Exercise(input);

  // The input as a stream, fed in chunks whose size the first byte picks.
  if (input.empty()) return 0;
  const std::size_t chunk = 1 + static_cast<unsigned char>(input[0]) % 64;
  input.remove_prefix(1);
  qn::FrameDecoder decoder;
  for (std::size_t at = 0; at < input.size(); at += chunk) {
    decoder.Feed(input.substr(at, chunk));
    while (auto body = decoder.Next()) Exercise(*body);
    Check(decoder.buffered() <= at + chunk);
    if (decoder.error()) break;
  }
  return 0;
}
