// Block throttle micro-benchmarks: the message key of an 8-key payload, and adding messages
// from 4 threads at once (new keys, and duplicates that re-arm a pending entry).
#include <benchmark/benchmark.h>

#include <atomic>
#include <memory>

#include "Statistics/Service/QNReportingBlockThrottle.h"

namespace {

class NullLog final : public qn::Log {
 public:
  std::shared_ptr<const qn::LogScope> RegisterScope(bool, std::uint64_t, std::string, std::string,
                                                    std::string, std::uint32_t) override {
    return nullptr;
  }
  bool LogEnabled(const qn::LogScope*, int level) const override { return level < 5; }
  void Write(const qn::LogScope*, qn::LogLevel, const char*, int, const char*,
             std::string_view) override {}
};

qn::Dictionary Payload(std::int64_t sequence) {
  return qn::Dictionary{{"route", "speaker"},
                        {"device", "built-in"},
                        {"sample_rate", 48000},
                        {"channels", 2},
                        {"volume", 0.75},
                        {"sequence", sequence},
                        {"qnreporting_timestamp", 1},
                        {"note", std::string(60, 'x')}};
}

void BM_BuildMessageKey(benchmark::State& state) {
  const qn::Dictionary payload = Payload(7);
  for (auto _ : state) {
    benchmark::DoNotOptimize(qn::QNReportingBlockThrottle::buildMessageKey(payload, 42, 5, 1));
  }
}
BENCHMARK(BM_BuildMessageKey);

qn::QNReportingBlockThrottle& SharedThrottle() {
  static qn::QNReportingBlockThrottle throttle(std::make_shared<NullLog>(), nullptr);
  return throttle;
}

// Each thread adds `state.range(0)` distinct keys over and over: the first round makes new
// entries, later rounds within the throttle time find duplicates.
void BM_AddMessageBlock(benchmark::State& state) {
  std::vector<qn::Dictionary> payloads;
  for (std::int64_t i = 0; i < state.range(0); ++i) {
    payloads.push_back(Payload(state.thread_index() * 1'000'000 + i));
  }
  std::size_t next = 0;
  for (auto _ : state) {
    SharedThrottle().addMessageBlock([] {}, 42, payloads[next], 5, 1);
    next = (next + 1) % payloads.size();
  }
}
BENCHMARK(BM_AddMessageBlock)->Arg(1)->Arg(1000)->Threads(4)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
