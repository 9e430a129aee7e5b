#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "common/Value.h"
#include "platform/linux/export/export_source.h"
#include "platform/log.h"

typedef struct __natsConnection natsConnection;
typedef struct __jsCtx jsCtx;
typedef struct __natsMsg natsMsg;
typedef struct jsPubAck jsPubAck;
typedef struct jsPubAckErr jsPubAckErr;

namespace qn {

struct NatsExportOptions {
  std::vector<std::string> servers;  // nats://host:port URLs of the cluster
  std::string subject_prefix = "quenta";
  std::string stream = "QUENTA";
  bool create_stream = false;  // create the stream when it is missing
  int replicas = 1;            // of a stream it creates
  // What libnats takes for credentials and TLS (paths; empty: not used).
  std::string creds_file, tls_ca, tls_cert, tls_key;
  std::string device;   // the device ID (subjects, message IDs, bodies)
  std::string db_path;  // the store's database
  // Publishes sent and not yet acknowledged, at most.
  std::size_t max_unacked = 1024;
  // How long a publish waits for its acknowledgement before it is sent again.
  std::chrono::milliseconds ack_timeout{5000};
  // Stream checks and reconnects back off from this up to the maximum.
  std::chrono::milliseconds backoff_min{250}, backoff_max{10000};
};

// Ships the store's rows to a NATS JetStream stream from a thread of its own.
//
// Each row of each kind (see ExportKind) is published on `<prefix>.<device>.<kind>`, its
// body the row as JSON (ExportSource::Read), with the header
// `Nats-Msg-Id: <device>:<kind>:<row id>`, so that the stream drops a re-send within its
// duplicate window. Rows are read in id order after a cursor per kind and published
// asynchronously, at most `max_unacked` unacknowledged at once; a publish that fails or
// is not acknowledged within `ack_timeout` is sent again, after a pause that grows while
// failures go on. A cursor moves only over a contiguous run of acknowledged rows (a
// duplicate counts as acknowledged) and is saved in the store's `export_cursors` under
// the name "nats:<stream>" about once a second (by a thread of its own, so that waiting
// for the store's write lock never holds publishing up) and at Stop: after any ending, export
// resumes after the saved cursor, so delivery is at least once.
//
// A session row is published once it was flushed, or at once when an earlier run of the
// daemon wrote it (it will not be flushed any more); the sessions cursor waits for an
// open session meanwhile, and the rows after it that are published in the meantime may be
// sent again after a restart.
//
// The exporter never holds the store's writer up: it reads with a connection of its own
// and only its lag grows. Failures (no server, no stream, no quorum, a store without a
// table of cursors) never end it: it logs one line per change of state, keeps trying with
// back-off and shows the reason in Stats. Credentials never appear in a log line or Stats.
class NatsExporter {
 public:
  // Starts the thread. Nothing else happens on the caller's thread. `log` may be null.
  static std::shared_ptr<NatsExporter> Start(NatsExportOptions options, std::shared_ptr<Log> log);
  // Stops (see Stop).
  ~NatsExporter();
  NatsExporter(const NatsExporter&) = delete;
  NatsExporter& operator=(const NatsExporter&) = delete;

  // Tells the exporter that the store committed rows. Cheap, never blocks for long: call it
  // after each of the store's transactions.
  void Wake();

  // Saves the cursors, closes the connection and ends the thread; publishes not yet
  // acknowledged are sent again by the next run. Idempotent.
  void Stop();

  // The counters: "state", "connected", "server", "published", "acknowledged",
  // "duplicates", "errors", "resends", "lag_rows", "lag_seconds", "last_error".
  Dictionary Stats() const;

  // Made by Start.
  NatsExporter(NatsExportOptions options, std::shared_ptr<Log> log);

 private:
  enum class EntryState { kWaiting, kReady, kInflight, kAcked };
  struct Entry {
    std::int64_t id = 0;
    EntryState state = EntryState::kReady;
    int attempts = 0;
    std::chrono::steady_clock::time_point sent;
    std::string body;
  };
  struct Kind {
    std::int64_t cursor = 0;      // the last acknowledged row of a contiguous run
    std::int64_t read_after = 0;  // the last row read
    bool exhausted = false;       // nothing to read until the next Wake
    std::deque<Entry> entries;    // read and not yet behind the cursor, in id order
  };
  // What libnats' threads hand to the exporter thread.
  struct Event {
    enum Type { kAck, kFailed, kDisconnected, kReconnected, kClosed } type = kAck;
    ExportKind kind = ExportKind::kMessages;
    std::int64_t id = 0;
    bool duplicate = false;
    std::string error;
  };
  struct Figures {
    std::string state = "starting";
    bool connected = false;
    std::string server;
    std::uint64_t published = 0, acknowledged = 0, duplicates = 0, errors = 0, resends = 0;
    std::int64_t lag_rows = 0;
    double lag_seconds = 0;
    std::string last_error;
  };

  static void OnAck(jsCtx* js, natsMsg* msg, jsPubAck* ack, jsPubAckErr* error, void* self);
  static void OnConnection(natsConnection* nc, void* self, Event::Type type);
  void Post(Event event);

  void Run();
  bool OpenSource();
  bool Connect();
  bool CheckStream();
  void Disconnect();
  void HandleEvents(std::vector<Event>& events);
  void ReadMore();
  void RecheckWaitingSessions();
  void Fill();
  void Expire();
  // Moves the cursors over acknowledged rows and hands them to the saver (at most once a
  // second unless `now`).
  void AdvanceAndSave(bool now);
  // The saver thread: writes the cursors it is handed, so that waiting for the store's
  // write lock never holds up publishing.
  void SaveLoop();
  void RefreshLag();
  Entry* Find(ExportKind kind, std::int64_t id);
  void Failed(const std::string& error);
  // Logs "export: <line>" (nothing without a log).
  void Say(bool error, const std::string& line);
  // Records `state` and logs it when it differs from the last one.
  void SetState(const std::string& state, const std::string& line, bool error);
  template <typename F>
  void Update(F&& change) {
    std::lock_guard lock(mutex_);
    change(figures_);
  }
  // Waits until an event, a Wake, Stop or `until`. Returns false once stopping.
  bool WaitUntil(std::chrono::steady_clock::time_point until);

  const NatsExportOptions options_;
  const std::shared_ptr<Log> log_;
  const std::string name_;  // "nats:<stream>", the cursors' exporter name

  mutable std::mutex mutex_;
  std::condition_variable changed_;
  bool stopping_ = false;      // GUARDED_BY(mutex_)
  bool woken_ = false;         // GUARDED_BY(mutex_)
  std::vector<Event> events_;  // GUARDED_BY(mutex_)
  Figures figures_;            // GUARDED_BY(mutex_)
  std::thread thread_;
  std::thread saver_;
  std::condition_variable save_wanted_;
  std::optional<std::array<std::int64_t, kExportKinds>> to_save_;  // GUARDED_BY(mutex_)
  bool saver_stopping_ = false;                                    // GUARDED_BY(mutex_)
  std::once_flag stopped_;

  // The exporter thread's own.
  std::unique_ptr<ExportSource> source_;
  natsConnection* nc_ = nullptr;
  jsCtx* js_ = nullptr;
  bool closed_ = false;
  Kind kinds_[kExportKinds];
  std::deque<std::pair<ExportKind, std::int64_t>> to_send_;
  std::size_t inflight_ = 0;
  std::size_t waiting_ = 0;            // sessions waiting for their flush
  std::int64_t earlier_sessions_ = 0;  // sessions up to this id were written by earlier runs
  std::chrono::milliseconds backoff_;
  std::chrono::steady_clock::time_point resume_at_, connect_at_, next_tick_, last_save_;
  bool cursors_dirty_ = false;
  bool failing_ = false;
  std::string last_state_;
};

}  // namespace qn
