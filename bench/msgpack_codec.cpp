// MessagePack codec micro-benchmark: decoding and encoding of a typical sendMessage request
// ([op, id, {8-key payload}, category, type, [ids]], about 200 bytes), as the daemon decodes
// every request and the client library encodes it.
//
//   bench_msgpack_codec [--benchmark_repetitions=N ...]
#include <benchmark/benchmark.h>

#include <cstdlib>
#include <string>
#include <variant>

#include "bench/sample_payload.h"
#include "common/MsgPack.h"

namespace {

void BM_DecodeRequest(benchmark::State& state) {
  const std::string body = qn::EncodeMsgPack(qn::bench::SampleSendMessageRequest());
  for (auto _ : state) {
    auto decoded = qn::DecodeMsgPack(body);
    if (!std::holds_alternative<qn::Value>(decoded)) std::abort();
    benchmark::DoNotOptimize(decoded);
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * body.size()));
  state.counters["body_bytes"] = static_cast<double>(body.size());
}
BENCHMARK(BM_DecodeRequest);

void BM_EncodeRequest(benchmark::State& state) {
  const qn::Value request = qn::bench::SampleSendMessageRequest();
  std::string out;
  for (auto _ : state) {
    out.clear();
    qn::AppendMsgPack(out, request);
    benchmark::DoNotOptimize(out.data());
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * out.size()));
}
BENCHMARK(BM_EncodeRequest);

}  // namespace

BENCHMARK_MAIN();
