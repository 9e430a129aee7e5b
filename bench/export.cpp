// Export throughput: rows per second from a full store to a JetStream stream, the exporter
// against a bare libnats js_PublishMsgAsync loop that publishes the same bodies with the
// same subjects and message IDs and the same bound on unacknowledged publishes. Runs are
// interleaved (exporter, bare, exporter, ...) and each starts on a new, empty stream.
//
//   bench_export --nats URL[,URL...] [--replicas N] [--rows N] [--rounds N] [--dir DIR]
//
// Prints one line per run and the medians with their ratio. The servers are the caller's
// (bench/export.sh starts them).
#include <nats/nats.h>
#include <sqlite3.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "bench/sample_payload.h"
#include "platform/linux/export/export_source.h"
#include "platform/linux/export/nats_exporter.h"
#include "platform/linux/reporting_store.h"

namespace qn::bench {
namespace {

using Clock = std::chrono::steady_clock;
constexpr const char* kStream = "BENCH";
constexpr const char* kDevice = "bench";
constexpr std::size_t kWindow = NatsExportOptions{}.max_unacked;

struct Args {
  std::string nats;
  int replicas = 1;
  int rows = 200'000;
  int rounds = 3;
  std::string dir = "/tmp";
};

void Fail(const char* what, natsStatus s) {
  std::fprintf(stderr, "bench_export: %s: %s\n", what, natsStatus_GetText(s));
  std::exit(1);
}

// A store of `rows` single messages (the sample payload).
std::string MakeStore(const Args& args) {
  const std::string path = args.dir + "/bench-export.db";
  for (const char* suffix : {"", "-wal", "-shm"}) ::unlink((path + suffix).c_str());
  std::optional<Error> error;
  auto store = ReportingStore::Open(path, nullptr, &error);
  if (!store) std::exit(1);
  for (int n = 0; n < args.rows; ++n) {
    store->AddSingleMessage(Value(Dictionary{{"SessionID", n}}), Value(Dictionary{}), 5, 1,
                            SamplePayload());
  }
  store->Close();
  return path;
}

// An empty stream for the next run (the last one deleted).
void FreshStream(jsCtx* js, int replicas) {
  js_DeleteStream(js, kStream, nullptr, nullptr);
  const char* subjects[] = {"bench.>"};
  jsStreamConfig config;
  jsStreamConfig_Init(&config);
  config.Name = kStream;
  config.Subjects = subjects;
  config.SubjectsLen = 1;
  config.Storage = js_FileStorage;
  config.Replicas = replicas;
  config.Duplicates = 120'000'000'000;
  jsStreamInfo* info = nullptr;
  for (int attempt = 0;; ++attempt) {
    const natsStatus s = js_AddStream(&info, js, &config, nullptr, nullptr);
    if (s == NATS_OK) break;
    if (attempt == 50) Fail("create the stream", s);
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
  }
  jsStreamInfo_Destroy(info);
}

double RunExporter(const Args& args, const std::string& db) {
  sqlite3* handle = nullptr;
  sqlite3_open(db.c_str(), &handle);
  sqlite3_exec(handle, "DELETE FROM export_cursors", nullptr, nullptr, nullptr);
  sqlite3_close(handle);
  NatsExportOptions options;
  for (std::size_t at = 0; at <= args.nats.size();) {
    const std::size_t comma = std::min(args.nats.find(',', at), args.nats.size());
    options.servers.push_back(args.nats.substr(at, comma - at));
    at = comma + 1;
  }
  options.subject_prefix = "bench";
  options.stream = kStream;
  options.device = kDevice;
  options.db_path = db;
  const auto start = Clock::now();
  auto exporter = NatsExporter::Start(options, nullptr);
  while (exporter->Stats().Find("acknowledged")->as_int64().value_or(0) < args.rows) {
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  const double seconds = std::chrono::duration<double>(Clock::now() - start).count();
  exporter->Stop();
  return args.rows / seconds;
}

// The bare loop: the same messages, prepared before the clock starts.
double RunBare(const Args& args, const std::string& db, natsConnection* nc) {
  std::optional<Error> error;
  auto source = ExportSource::Open(db, kDevice, &error);
  std::vector<ExportRow> rows;
  source->Read(ExportKind::kMessages, 0, args.rows, rows);
  jsOptions jo;
  jsOptions_Init(&jo);
  jo.PublishAsync.MaxPending = kWindow;
  jsCtx* js = nullptr;
  natsConnection_JetStream(&js, nc, &jo);
  const std::string subject = std::string("bench.") + kDevice + ".messages";
  std::string id;
  const auto start = Clock::now();
  for (const ExportRow& row : rows) {
    id = std::string(kDevice) + ":messages:" + std::to_string(row.id);
    natsMsg* msg = nullptr;
    natsMsg_Create(&msg, subject.c_str(), nullptr, row.body.data(),
                   static_cast<int>(row.body.size()));
    natsMsgHeader_Set(msg, "Nats-Msg-Id", id.c_str());
    natsStatus s;
    while ((s = js_PublishMsgAsync(js, &msg, nullptr)) == NATS_TIMEOUT) {
    }
    natsMsg_Destroy(msg);
    if (s != NATS_OK) Fail("publish", s);
  }
  jsPubOptions po;
  jsPubOptions_Init(&po);
  po.MaxWait = 60'000;
  if (natsStatus s = js_PublishAsyncComplete(js, &po); s != NATS_OK) Fail("complete", s);
  const double seconds = std::chrono::duration<double>(Clock::now() - start).count();
  jsCtx_Destroy(js);
  return rows.size() / seconds;
}

double Median(std::vector<double> values) {
  std::sort(values.begin(), values.end());
  return values[values.size() / 2];
}

}  // namespace
}  // namespace qn::bench

int main(int argc, char** argv) {
  using namespace qn::bench;
  Args args;
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string flag = argv[i];
    if (flag == "--nats")
      args.nats = argv[i + 1];
    else if (flag == "--replicas")
      args.replicas = std::atoi(argv[i + 1]);
    else if (flag == "--rows")
      args.rows = std::atoi(argv[i + 1]);
    else if (flag == "--rounds")
      args.rounds = std::atoi(argv[i + 1]);
    else if (flag == "--dir")
      args.dir = argv[i + 1];
  }
  if (args.nats.empty()) {
    std::fprintf(stderr,
                 "usage: bench_export --nats URL[,URL...] [--replicas N] [--rows N] "
                 "[--rounds N] [--dir DIR]\n");
    return 2;
  }
  const std::string db = MakeStore(args);
  natsConnection* nc = nullptr;
  if (natsStatus s = natsConnection_ConnectTo(&nc, args.nats.c_str()); s != NATS_OK)
    Fail("connect", s);
  jsCtx* js = nullptr;
  natsConnection_JetStream(&js, nc, nullptr);
  std::vector<double> exporter, bare;
  for (int round = 0; round < args.rounds; ++round) {
    FreshStream(js, args.replicas);
    exporter.push_back(RunExporter(args, db));
    FreshStream(js, args.replicas);
    bare.push_back(RunBare(args, db, nc));
    std::printf("round %d: exporter %.0f rows/s, bare js_PublishMsgAsync %.0f rows/s\n", round + 1,
                exporter.back(), bare.back());
    std::fflush(stdout);
  }
  js_DeleteStream(js, kStream, nullptr, nullptr);
  std::printf("R%d, %d rows, medians: exporter %.0f rows/s, bare %.0f rows/s, ratio %.2f\n",
              args.replicas, args.rows, Median(exporter), Median(bare),
              Median(exporter) / Median(bare));
  jsCtx_Destroy(js);
  natsConnection_Destroy(nc);
  return 0;
}
