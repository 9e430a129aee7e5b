// Ingest throughput of the reporting store, against what bare SQLite reaches on the same
// disk with the same journal settings.
//
//   bench_store_ingest [MESSAGES] [DIR] [bare|store|events]
//
// 1. Bare SQLite: MESSAGES rows of 200 bytes into a two-column table, one transaction per
//    10,000 rows, one prepared statement, WAL, synchronous=NORMAL; once with SQLite's
//    default page size and once with the store's 16 KiB pages.
// 2. The store: MESSAGES messages with an 8-key payload handed over through the LivoReporting
//    sink's SendMessage (one framework session), then Drain; the time runs from the first
//    hand-over until everything is committed. Then twice more with an analytics event
//    handed over before each message: once as the daemon's analytics copy makes it (the
//    store refers to the message instead of writing the payload again) and once as an
//    event that repeats nothing (two rows and two JSON texts per message).
// Prints the rates and the ratio of the store's to the better bare one. The database files go to a
// fresh folder under DIR (default: the system's temporary folder) and are removed afterwards. A
// last argument "bare", "store" or "events" runs only that part (for profiling).
#include <sqlite3.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "common/Value.h"
#include "platform/linux/reporting_store.h"
#include "platform/linux/store_sinks.h"

namespace {

using Clock = std::chrono::steady_clock;

double Seconds(Clock::duration d) { return std::chrono::duration<double>(d).count(); }

// CPU seconds (user + system) used by the whole process so far. On a shared machine the
// CPU cost per row is steadier than the wall-clock rate.
double CpuSeconds() {
  rusage usage{};
  getrusage(RUSAGE_SELF, &usage);
  auto seconds = [](const timeval& tv) { return tv.tv_sec + tv.tv_usec * 1e-6; };
  return seconds(usage.ru_utime) + seconds(usage.ru_stime);
}

void Check(int rc, sqlite3* db, const char* what) {
  if (rc == SQLITE_OK || rc == SQLITE_DONE || rc == SQLITE_ROW) return;
  std::fprintf(stderr, "%s: %s\n", what, sqlite3_errmsg(db));
  std::exit(1);
}

// Rows per second of plain batched inserts.
// `page_size` 0 keeps SQLite's default.
double BareSqlite(const std::string& path, long rows, int page_size) {
  constexpr long kRowsPerTransaction = 10'000;
  sqlite3* db = nullptr;
  Check(sqlite3_open(path.c_str(), &db), db, "open");
  if (page_size > 0) {
    const std::string sql = "PRAGMA page_size=" + std::to_string(page_size);
    Check(sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr), db, "page size");
  }
  Check(sqlite3_exec(db, "PRAGMA journal_mode=WAL", nullptr, nullptr, nullptr), db, "wal");
  Check(sqlite3_exec(db, "PRAGMA synchronous=NORMAL", nullptr, nullptr, nullptr), db, "sync");
  Check(sqlite3_exec(db, "CREATE TABLE t(id INTEGER PRIMARY KEY, payload TEXT NOT NULL)", nullptr,
                     nullptr, nullptr),
        db, "create");
  sqlite3_stmt* insert = nullptr;
  Check(sqlite3_prepare_v2(db, "INSERT INTO t(payload) VALUES(?1)", -1, &insert, nullptr), db,
        "prepare");
  std::string row(200, 'x');

  const auto start = Clock::now();
  const double cpu_start = CpuSeconds();
  for (long i = 0; i < rows; i += kRowsPerTransaction) {
    Check(sqlite3_exec(db, "BEGIN", nullptr, nullptr, nullptr), db, "begin");
    for (long j = i; j < i + kRowsPerTransaction && j < rows; ++j) {
      // Rows differ, as real ones do: the row number in the first 15 characters.
      const std::string number = std::to_string(j);
      row.replace(15 - std::min<std::size_t>(15, number.size()),
                  std::min<std::size_t>(15, number.size()), number, 0, 15);
      sqlite3_bind_text(insert, 1, row.data(), static_cast<int>(row.size()), SQLITE_STATIC);
      Check(sqlite3_step(insert), db, "insert");
      sqlite3_reset(insert);
    }
    Check(sqlite3_exec(db, "COMMIT", nullptr, nullptr, nullptr), db, "commit");
  }
  const double elapsed = Seconds(Clock::now() - start);
  const double cpu = CpuSeconds() - cpu_start;
  sqlite3_finalize(insert);
  sqlite3_close(db);
  const std::string pages = page_size > 0 ? std::to_string(page_size) : std::string("default");
  std::printf(
      "bare sqlite (%s pages): %ld rows of 200 bytes in %.3f s: %.0f rows/s (CPU %.2f us/row)\n",
      pages.c_str(), rows, elapsed, rows / elapsed, cpu / rows * 1e6);
  return rows / elapsed;
}

// An 8-key payload of the kind clients send (about 190 bytes of JSON).
qn::Value Payload(long n) {
  qn::Dictionary d;
  d.Set("HostApplicationDisplayID", "com.example.music.player");
  d.Set("route", n % 2 ? "speaker" : "headphones");
  d.Set("volume", 0.25 + static_cast<double>(n % 4) / 8);
  d.Set("sample_rate", 48000);
  d.Set("channels", 2);
  d.Set("underruns", n % 7);
  d.Set("engine_on", n % 3 == 0);
  d.Set("session_duration_seconds", 12.5 + static_cast<double>(n));
  return qn::Value(std::move(d));
}

// What goes with each message besides its livo_messages row.
enum class Events {
  kNone,
  kRepeat,  // its analytics event, as the daemon hands it over: the store refers to the message
  kCopy,    // an analytics event that does not repeat it (two rows, two JSON texts)
};

// Messages per second through the LivoReporting sink, committed.
double Store(const std::string& path, long messages, Events events) {
  std::optional<qn::Error> error;
  auto store = qn::ReportingStore::Open(path, nullptr, &error);
  if (!store) {
    std::fprintf(stderr, "open store: %s\n", error ? error->Description().c_str() : "?");
    std::exit(1);
  }
  auto livo = qn::NewStoreLivoReporting(store);
  auto analytics = qn::NewStoreAnalytics(store);
  auto session = livo->CreateSession(qn::Dictionary{{"SessionID", 1}}, qn::Dictionary{}, {});
  // Distinct payloads, built beforehand: the benchmark measures the store, not the
  // building of dictionaries.
  std::vector<qn::Value> payloads;
  std::vector<qn::Value> event_payloads;
  for (long i = 0; i < 1024; ++i) {
    payloads.push_back(Payload(i));
    qn::Dictionary event = *payloads.back().as_dictionary();
    // The daemon's copy sets the host in place; one that moves it last repeats nothing.
    if (events == Events::kCopy) event.Erase(qn::Value("HostApplicationDisplayID"));
    event.Set("HostApplicationDisplayID", "com.example.music.player");
    event_payloads.push_back(qn::Value(std::move(event)));
  }
  store->Drain();

  const auto start = Clock::now();
  const double cpu_start = CpuSeconds();
  for (long i = 0; i < messages; ++i) {
    if (events != Events::kNone) {
      analytics->SendEventLazy(
          "com.norvel.quenta.Bench.Stop",
          [&event_payloads, i] { return event_payloads[static_cast<std::size_t>(i) & 1023]; }, 0);
    }
    session->SendMessage(5, 2, payloads[static_cast<std::size_t>(i) & 1023], nullptr);
  }
  const auto handed = Clock::now();
  store->Drain();
  const auto end = Clock::now();
  const double cpu = CpuSeconds() - cpu_start;

  const auto stats = store->stats();
  const double elapsed = Seconds(end - start);
  const double rate = static_cast<double>(messages) / elapsed;
  const char* with = events == Events::kNone     ? ""
                     : events == Events::kRepeat ? " and its analytics event (refers to it)"
                                                 : " and an analytics event (a copy)";
  std::printf(
      "store: %ld messages (8-key payload) via LivoReporting SendMessage%s, committed in %.3f "
      "s: %.0f messages/s (CPU %.2f us/message, both threads)\n"
      "       hand-over alone %.3f s (%.0f/s); %llu transactions; %llu dropped (queue full); "
      "%llu failed\n",
      messages, with, elapsed, rate, cpu / messages * 1e6, Seconds(handed - start),
      messages / Seconds(handed - start), static_cast<unsigned long long>(stats.batches),
      static_cast<unsigned long long>(stats.dropped_queue_full),
      static_cast<unsigned long long>(stats.failed));
  return rate;
}

}  // namespace

int main(int argc, char** argv) {
  const long messages = argc > 1 ? std::atol(argv[1]) : 1'000'000;
  const std::filesystem::path base = argc > 2 ? argv[2] : std::filesystem::temp_directory_path();
  std::string pattern = (base / "qn-store-bench-XXXXXX").string();
  if (!mkdtemp(pattern.data())) {
    std::perror("mkdtemp");
    return 1;
  }
  const std::filesystem::path dir = pattern;

  const std::string only = argc > 3 ? argv[3] : "";
  // Bare SQLite with its default pages and with the store's 16 KiB pages; the store is
  // compared with the better of the two.
  double bare = 0;
  if (only.empty() || only == "bare") {
    bare = BareSqlite((dir / "bare-default.db").string(), messages, 0);
    bare = std::max(bare, BareSqlite((dir / "bare-16k.db").string(), messages, 16384));
  }
  const double store = only == "bare" || only == "events"
                           ? 0
                           : Store((dir / "reports.db").string(), messages, Events::kNone);
  if (only.empty() || only == "events") {
    Store((dir / "repeat.db").string(), messages, Events::kRepeat);
    Store((dir / "copy.db").string(), messages, Events::kCopy);
  }
  if (only.empty()) {
    std::printf("ratio store/best bare: %.2f\n", store / bare);
    std::printf("targets: >= 250000 messages/s: %s; >= 0.5 of bare sqlite: %s\n",
                store >= 250'000 ? "met" : "NOT met", store >= 0.5 * bare ? "met" : "NOT met");
  }

  std::error_code ignored;
  std::filesystem::remove_all(dir, ignored);
  return 0;
}
