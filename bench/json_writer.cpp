// JSON writer micro-benchmark: the store's hot path, the compact text of a typical 8-key
// message payload (strings, integers, doubles, a nested dictionary), written by our writer
// (AppendJsonLenient into a reused string) and by nlohmann/json's dump. nlohmann dumps only
// its own tree, so its figure is shown both with the conversion from our Value that a
// switch would need and for the dump of a ready tree alone (its best case).
//
//   bench_json_writer [--benchmark_repetitions=N ...]
#include <benchmark/benchmark.h>

#include <nlohmann/json.hpp>
#include <string>

#include "bench/sample_payload.h"
#include "common/Json.h"

namespace {

using Ordered = nlohmann::ordered_json;

// The payload's kinds only: enough to give nlohmann the same tree.
Ordered ToNlohmann(const qn::Value& value) {
  switch (value.kind()) {
    case qn::Value::Kind::kInt:
      return *value.as_int64();
    case qn::Value::Kind::kUInt:
      return *value.as_uint64();
    case qn::Value::Kind::kDouble:
      return *value.as_double();
    case qn::Value::Kind::kString:
      return *value.as_string();
    case qn::Value::Kind::kDictionary: {
      Ordered object = Ordered::object();
      for (const auto& [key, element] : *value.as_dictionary()) {
        object[*key.as_string()] = ToNlohmann(element);
      }
      return object;
    }
    default:
      return nullptr;
  }
}

std::string Dump(const Ordered& tree) {
  return tree.dump(-1, ' ', false, Ordered::error_handler_t::replace);
}

void BM_OurWriter(benchmark::State& state) {
  const qn::Value payload = qn::bench::SamplePayload();
  std::string out;
  for (auto _ : state) {
    out.clear();
    qn::AppendJsonLenient(out, payload);
    benchmark::DoNotOptimize(out.data());
  }
  state.counters["json_bytes"] = static_cast<double>(out.size());
}
BENCHMARK(BM_OurWriter);

void BM_NlohmannConvertAndDump(benchmark::State& state) {
  const qn::Value payload = qn::bench::SamplePayload();
  for (auto _ : state) {
    std::string out = Dump(ToNlohmann(payload));
    benchmark::DoNotOptimize(out.data());
  }
}
BENCHMARK(BM_NlohmannConvertAndDump);

void BM_NlohmannDumpOnly(benchmark::State& state) {
  const Ordered tree = ToNlohmann(qn::bench::SamplePayload());
  for (auto _ : state) {
    std::string out = Dump(tree);
    benchmark::DoNotOptimize(out.data());
  }
}
BENCHMARK(BM_NlohmannDumpOnly);

}  // namespace

BENCHMARK_MAIN();
