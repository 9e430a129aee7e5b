#include "platform/linux/export/nats_exporter.h"

#include <nats/nats.h>

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <random>

namespace qn {
namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

constexpr int kReadBatch = 256;
constexpr auto kTick = std::chrono::seconds(1);  // lag, cursor saves, overdue publishes
constexpr auto kConnectTimeout = milliseconds(2000);
constexpr auto kCloseWait = std::chrono::seconds(5);
constexpr auto kFinalAckWait = milliseconds(1000);            // at Stop, for publishes in flight
constexpr std::int64_t kDuplicateWindowNs = 120'000'000'000;  // a created stream's window
constexpr const char* kMsgIdHeader = "Nats-Msg-Id";

// `url` without the user and password it may hold ("nats://u:p@host" -> "nats://host").
std::string Redacted(std::string url) {
  const std::size_t scheme = url.find("://");
  const std::size_t start = scheme == std::string::npos ? 0 : scheme + 3;
  const std::size_t at = url.find('@', start);
  if (at != std::string::npos) url.erase(start, at + 1 - start);
  return url;
}

std::string ServerList(const std::vector<std::string>& servers) {
  std::string list;
  for (const std::string& server : servers) list += (list.empty() ? "" : ",") + Redacted(server);
  return list;
}

// libnats' text for a failure: the last error's detail when it has one.
std::string NatsError(natsStatus status) {
  natsStatus last = NATS_OK;
  const char* text = nats_GetLastError(&last);
  if (last == status && text && *text) return text;
  return natsStatus_GetText(status);
}

}  // namespace

std::shared_ptr<NatsExporter> NatsExporter::Start(NatsExportOptions options,
                                                  std::shared_ptr<Log> log) {
  auto exporter = std::make_shared<NatsExporter>(std::move(options), std::move(log));
  exporter->thread_ = std::thread([raw = exporter.get()] { raw->Run(); });
  exporter->saver_ = std::thread([raw = exporter.get()] { raw->SaveLoop(); });
  return exporter;
}

NatsExporter::NatsExporter(NatsExportOptions options, std::shared_ptr<Log> log)
    : options_(std::move(options)),
      log_(std::move(log)),
      name_("nats:" + options_.stream),
      backoff_(options_.backoff_min) {}

NatsExporter::~NatsExporter() { Stop(); }

void NatsExporter::Wake() {
  std::lock_guard lock(mutex_);
  if (!woken_) changed_.notify_one();  // else the thread was told already
  woken_ = true;
}

void NatsExporter::Stop() {
  std::call_once(stopped_, [this] {
    {
      std::lock_guard lock(mutex_);
      stopping_ = true;
      changed_.notify_one();
    }
    if (thread_.joinable()) thread_.join();
    {
      std::lock_guard lock(mutex_);
      saver_stopping_ = true;  // after the exporter's last cursors
      save_wanted_.notify_one();
    }
    if (saver_.joinable()) saver_.join();
  });
}

Dictionary NatsExporter::Stats() const {
  std::lock_guard lock(mutex_);
  const Figures& f = figures_;
  return Dictionary{{"state", Value(f.state)},
                    {"connected", Value(f.connected)},
                    {"server", Value(f.server)},
                    {"published", Value(f.published)},
                    {"acknowledged", Value(f.acknowledged)},
                    {"duplicates", Value(f.duplicates)},
                    {"errors", Value(f.errors)},
                    {"resends", Value(f.resends)},
                    {"lag_rows", Value(f.lag_rows)},
                    {"lag_seconds", Value(f.lag_seconds)},
                    {"last_error", Value(f.last_error)}};
}

// --- libnats' threads -----------------------------------------------------------------

void NatsExporter::Post(Event event) {
  std::lock_guard lock(mutex_);
  events_.push_back(std::move(event));
  // The first event wakes the thread, which takes all that came meanwhile at once.
  if (events_.size() == 1) changed_.notify_one();
}

void NatsExporter::OnAck(jsCtx*, natsMsg* msg, jsPubAck* ack, jsPubAckErr* error, void* self) {
  Event event;
  const char* id = nullptr;
  if (natsMsgHeader_Get(msg, kMsgIdHeader, &id) == NATS_OK && id) {
    // "<device>:<kind>:<row id>"
    const std::string_view text(id);
    const std::size_t last = text.rfind(':');
    const std::size_t first = text.rfind(':', last == 0 ? 0 : last - 1);
    if (last != std::string_view::npos && first != std::string_view::npos) {
      const std::string_view kind = text.substr(first + 1, last - first - 1);
      for (ExportKind k : kAllExportKinds)
        if (kind == ExportKindName(k)) event.kind = k;
      event.id = std::strtoll(id + last + 1, nullptr, 10);
    }
  }
  if (ack) {
    event.duplicate = ack->Duplicate;
  } else {
    event.type = Event::kFailed;
    event.error = error && error->ErrText && *error->ErrText
                      ? error->ErrText
                      : natsStatus_GetText(error ? error->Err : NATS_ERR);
  }
  natsMsg_Destroy(msg);
  static_cast<NatsExporter*>(self)->Post(std::move(event));
}

void NatsExporter::OnConnection(natsConnection*, void* self, Event::Type type) {
  Event event;
  event.type = type;
  static_cast<NatsExporter*>(self)->Post(std::move(event));
}

// --- the exporter thread --------------------------------------------------------------

bool NatsExporter::WaitUntil(Clock::time_point until) {
  std::unique_lock lock(mutex_);
  changed_.wait_until(lock, until, [&] { return stopping_ || woken_ || !events_.empty(); });
  if (woken_) {
    woken_ = false;
    for (Kind& kind : kinds_) kind.exhausted = false;
  }
  return !stopping_;
}

void NatsExporter::SetState(const std::string& state, const std::string& line, bool error) {
  Update([&](Figures& f) {
    f.state = state;
    if (error) f.last_error = line;
  });
  if (line == last_state_) return;
  last_state_ = line;
  Say(error, line);
}

void NatsExporter::Say(bool error, const std::string& line) {
  if (!log_) return;
  QN_LOG_AS("NatsExporter", *log_, nullptr, error ? LogLevel::kError : LogLevel::kDefault,
            "%s:%d:%s: export: %s", line.c_str());
}

bool NatsExporter::OpenSource() {
  std::optional<Error> error;
  source_ = ExportSource::Open(options_.db_path, options_.device, &error);
  if (!source_) {
    SetState("store unreadable", "cannot read the store: " + error->Description(), true);
    return false;
  }
  std::array<std::int64_t, kExportKinds> cursors{};
  if (auto failure = source_->LoadCursors(name_, cursors)) {
    SetState("store unreadable", "cannot read the store: " + failure->Description(), true);
    source_.reset();
    return false;
  }
  for (ExportKind kind : kAllExportKinds) {
    Kind& k = kinds_[static_cast<int>(kind)];
    k.cursor = k.read_after = cursors[static_cast<int>(kind)];
  }
  earlier_sessions_ = source_->LastSessionId();
  return true;
}

void NatsExporter::Run() {
  while (!source_ && !OpenSource()) {
    if (!WaitUntil(Clock::now() + options_.backoff_max)) return;
  }
  std::vector<Event> events;
  while (true) {
    if (Clock::now() >= next_tick_) {
      next_tick_ = Clock::now() + kTick;
      Expire();
      RecheckWaitingSessions();
      RefreshLag();
    }
    if (!nc_) {
      // Store commits wake the thread; a new attempt still waits for the pause to end.
      if (Clock::now() >= connect_at_ && !Connect()) {
        connect_at_ = Clock::now() + backoff_;
        backoff_ = std::min(backoff_ * 2, options_.backoff_max);
      }
      if (!nc_) {
        if (!WaitUntil(std::min(connect_at_, next_tick_))) break;
        continue;
      }
    }
    {
      std::lock_guard lock(mutex_);
      events.swap(events_);
    }
    HandleEvents(events);
    events.clear();
    if (closed_) {  // the library gave up on the connection (e.g. refused credentials)
      Disconnect();
      continue;
    }
    Fill();
    AdvanceAndSave(false);
    const bool sending = inflight_ < options_.max_unacked && !to_send_.empty();
    if (!WaitUntil(sending ? std::min(resume_at_, next_tick_) : next_tick_)) break;
  }
  // Publishes in flight get a moment to be acknowledged; what arrived still moves the cursors.
  if (js_ && inflight_) {
    jsPubOptions po;
    jsPubOptions_Init(&po);
    po.MaxWait = kFinalAckWait.count();
    js_PublishAsyncComplete(js_, &po);
  }
  {
    std::lock_guard lock(mutex_);
    events.swap(events_);
  }
  HandleEvents(events);
  AdvanceAndSave(true);
  Disconnect();
}

bool NatsExporter::Connect() {
  natsOptions* opts = nullptr;
  std::vector<const char*> servers;
  for (const std::string& server : options_.servers) servers.push_back(server.c_str());
  natsStatus s = natsOptions_Create(&opts);
  if (s == NATS_OK) {
    s = natsOptions_SetServers(opts, servers.data(), static_cast<int>(servers.size()));
  }
  if (s == NATS_OK) s = natsOptions_SetName(opts, "qnreportingd");
  if (s == NATS_OK) s = natsOptions_SetTimeout(opts, kConnectTimeout.count());
  if (s == NATS_OK) s = natsOptions_SetMaxReconnect(opts, -1);
  // Reconnects back off (doubling after each round over the servers, with jitter), so that
  // a cluster electing leaders is not hammered.
  if (s == NATS_OK) {
    s = natsOptions_SetCustomReconnectDelay(
        opts,
        [](natsConnection*, int attempts, void* self) -> int64_t {
          const NatsExportOptions& o = static_cast<NatsExporter*>(self)->options_;
          const int64_t most = o.backoff_max.count();
          const int64_t delay = std::min(most, o.backoff_min.count() << std::min(attempts, 16));
          thread_local std::minstd_rand random(std::random_device{}());
          return delay / 2 + static_cast<int64_t>(random() % static_cast<uint64_t>(delay / 2 + 1));
        },
        this);
  }
  // A server that stops answering (stopped, not gone) is noticed within a few seconds.
  if (s == NATS_OK) s = natsOptions_SetPingInterval(opts, 2000);
  if (s == NATS_OK) s = natsOptions_SetMaxPingsOut(opts, 2);
  if (s == NATS_OK) {
    s = natsOptions_SetDisconnectedCB(
        opts, [](natsConnection* nc, void* self) { OnConnection(nc, self, Event::kDisconnected); },
        this);
  }
  if (s == NATS_OK) {
    s = natsOptions_SetReconnectedCB(
        opts, [](natsConnection* nc, void* self) { OnConnection(nc, self, Event::kReconnected); },
        this);
  }
  if (s == NATS_OK) {
    s = natsOptions_SetClosedCB(
        opts, [](natsConnection* nc, void* self) { OnConnection(nc, self, Event::kClosed); }, this);
  }
  if (s == NATS_OK && !options_.creds_file.empty()) {
    s = natsOptions_SetUserCredentialsFromFiles(opts, options_.creds_file.c_str(), nullptr);
  }
  const bool tls =
      !options_.tls_ca.empty() || !options_.tls_cert.empty() || !options_.tls_key.empty();
  if (s == NATS_OK && tls) s = natsOptions_SetSecure(opts, true);
  if (s == NATS_OK && !options_.tls_ca.empty()) {
    s = natsOptions_LoadCATrustedCertificates(opts, options_.tls_ca.c_str());
  }
  if (s == NATS_OK && !options_.tls_cert.empty()) {
    s = natsOptions_LoadCertificatesChain(opts, options_.tls_cert.c_str(),
                                          options_.tls_key.c_str());
  }
  const std::string where = ServerList(options_.servers);
  if (s != NATS_OK) {
    SetState("misconfigured", "cannot use the connection settings: " + NatsError(s), true);
    natsOptions_Destroy(opts);
    return false;
  }
  closed_ = false;
  s = natsConnection_Connect(&nc_, opts);
  natsOptions_Destroy(opts);
  if (s != NATS_OK) {
    SetState("unreachable", "cannot connect to " + where + ": " + NatsError(s), true);
    natsConnection_Destroy(nc_);
    nc_ = nullptr;
    return false;
  }
  jsOptions jo;
  jsOptions_Init(&jo);
  jo.Wait = options_.ack_timeout.count();
  // The library's own bound stays above ours: a publish never stalls inside it.
  jo.PublishAsync.MaxPending = static_cast<int64_t>(options_.max_unacked) * 2 + 64;
  jo.PublishAsync.AckHandler = &NatsExporter::OnAck;
  jo.PublishAsync.AckHandlerClosure = this;
  s = natsConnection_JetStream(&js_, nc_, &jo);
  if (s != NATS_OK || !CheckStream()) {
    if (s != NATS_OK) SetState("unreachable", "cannot use JetStream: " + NatsError(s), true);
    Disconnect();
    return false;
  }
  char url[256] = "";
  natsConnection_GetConnectedUrl(nc_, url, sizeof url);
  Update([&](Figures& f) {
    f.connected = true;
    f.server = Redacted(url);
  });
  SetState("connected", "connected to " + Redacted(url) + ", stream " + options_.stream, false);
  backoff_ = options_.backoff_min;
  return true;
}

bool NatsExporter::CheckStream() {
  jsStreamInfo* info = nullptr;
  jsErrCode code = static_cast<jsErrCode>(0);
  natsStatus s = js_GetStreamInfo(&info, js_, options_.stream.c_str(), nullptr, &code);
  jsStreamInfo_Destroy(info);
  if (s == NATS_OK) return true;
  if (s != NATS_NOT_FOUND && code != JSStreamNotFoundErr) {
    SetState("no JetStream", "stream " + options_.stream + " unavailable: " + NatsError(s), true);
    return false;
  }
  if (!options_.create_stream) {
    SetState("stream missing",
             "stream " + options_.stream +
                 " does not exist (--export-create-stream creates it); nothing is exported",
             true);
    return false;
  }
  const std::string subjects = options_.subject_prefix + ".>";
  const char* subject_list[] = {subjects.c_str()};
  jsStreamConfig config;
  jsStreamConfig_Init(&config);
  config.Name = options_.stream.c_str();
  config.Subjects = subject_list;
  config.SubjectsLen = 1;
  config.Storage = js_FileStorage;
  config.Replicas = options_.replicas;
  config.Duplicates = kDuplicateWindowNs;
  s = js_AddStream(&info, js_, &config, nullptr, &code);
  jsStreamInfo_Destroy(info);
  if (s != NATS_OK) {
    SetState("stream missing", "cannot create stream " + options_.stream + ": " + NatsError(s),
             true);
    return false;
  }
  Say(false, "created stream " + options_.stream + " (" + subjects + ", " +
                 std::to_string(options_.replicas) + " replicas)");
  return true;
}

void NatsExporter::Disconnect() {
  if (!nc_) return;
  natsConnection_Close(nc_);
  // The closed callback is the connection's last: after it nothing refers to this object.
  const auto deadline = Clock::now() + kCloseWait;
  std::vector<Event> events;
  while (!closed_ && Clock::now() < deadline) {
    {
      std::unique_lock lock(mutex_);
      changed_.wait_until(lock, deadline, [&] { return !events_.empty(); });
      events.swap(events_);
    }
    for (const Event& event : events) closed_ = closed_ || event.type == Event::kClosed;
    std::erase_if(events,
                  [](const Event& e) { return e.type != Event::kAck && e.type != Event::kFailed; });
    HandleEvents(events);
    events.clear();
  }
  jsCtx_Destroy(js_);
  js_ = nullptr;
  natsConnection_Destroy(nc_);
  nc_ = nullptr;
  // What was in flight is sent again on the next connection.
  for (ExportKind kind : kAllExportKinds) {
    for (Entry& entry : kinds_[static_cast<int>(kind)].entries) {
      if (entry.state != EntryState::kInflight) continue;
      entry.state = EntryState::kReady;
      to_send_.emplace_back(kind, entry.id);
    }
  }
  inflight_ = 0;
  Update([](Figures& f) { f.connected = false; });
}

NatsExporter::Entry* NatsExporter::Find(ExportKind kind, std::int64_t id) {
  auto& entries = kinds_[static_cast<int>(kind)].entries;
  auto it = std::lower_bound(entries.begin(), entries.end(), id,
                             [](const Entry& e, std::int64_t v) { return e.id < v; });
  return it != entries.end() && it->id == id ? &*it : nullptr;
}

void NatsExporter::Failed(const std::string& error) {
  const auto now = Clock::now();
  // One pause per burst of failures (all publishes in flight may fail together).
  if (now >= resume_at_) {
    resume_at_ = now + backoff_;
    backoff_ = std::min(backoff_ * 2, options_.backoff_max);
  }
  Update([&](Figures& f) {
    ++f.errors;
    f.last_error = error;
  });
  if (!failing_) {
    failing_ = true;
    Say(true, "publishing failed (" + error + "); sending again with back-off");
  }
}

void NatsExporter::HandleEvents(std::vector<Event>& events) {
  std::uint64_t acknowledged = 0, duplicates = 0;
  for (Event& event : events) {
    switch (event.type) {
      case Event::kAck: {
        ++acknowledged;
        duplicates += event.duplicate;
        Entry* entry = Find(event.kind, event.id);
        if (!entry || entry->state == EntryState::kAcked) break;
        if (entry->state == EntryState::kInflight) --inflight_;
        entry->state = EntryState::kAcked;
        entry->body = std::string();
        break;
      }
      case Event::kFailed: {
        Failed(event.error);
        Entry* entry = Find(event.kind, event.id);
        if (entry && entry->state == EntryState::kInflight) {
          --inflight_;
          entry->state = EntryState::kReady;
          to_send_.emplace_back(event.kind, event.id);
        }
        break;
      }
      case Event::kDisconnected:
        Update([](Figures& f) { f.connected = false; });
        SetState("disconnected", "disconnected from " + figures_.server + "; reconnecting", true);
        break;
      case Event::kReconnected: {
        char url[256] = "";
        if (nc_) natsConnection_GetConnectedUrl(nc_, url, sizeof url);
        Update([&](Figures& f) {
          f.connected = true;
          f.server = Redacted(url);
        });
        SetState("connected", "reconnected to " + Redacted(url), false);
        break;
      }
      case Event::kClosed:
        closed_ = true;
        break;
    }
  }
  if (acknowledged) {
    backoff_ = options_.backoff_min;
    if (failing_) {
      failing_ = false;
      Say(false, "publishing again");
    }
    Update([&](Figures& f) {
      f.acknowledged += acknowledged;
      f.duplicates += duplicates;
    });
  }
}

void NatsExporter::ReadMore() {
  const std::size_t most_entries = options_.max_unacked * 4;
  std::vector<ExportRow> rows;
  for (ExportKind kind : kAllExportKinds) {
    Kind& k = kinds_[static_cast<int>(kind)];
    if (k.exhausted || k.entries.size() >= most_entries) continue;
    rows.clear();
    if (auto error = source_->Read(kind, k.read_after, kReadBatch, rows)) {
      SetState("store unreadable", "cannot read the store: " + error->Description(), true);
      k.exhausted = true;
      continue;
    }
    k.exhausted = rows.empty();
    for (ExportRow& row : rows) {
      const bool ready = row.flushed || row.id <= earlier_sessions_;
      k.entries.push_back(
          {row.id, ready ? EntryState::kReady : EntryState::kWaiting, 0, {}, std::move(row.body)});
      k.read_after = row.id;
      if (ready) {
        to_send_.emplace_back(kind, row.id);
      } else {
        ++waiting_;
      }
    }
  }
}

void NatsExporter::RecheckWaitingSessions() {
  if (!waiting_) return;
  for (Entry& entry : kinds_[static_cast<int>(ExportKind::kSessions)].entries) {
    if (entry.state != EntryState::kWaiting) continue;
    std::optional<Error> error;
    std::optional<ExportRow> row = source_->ReadSession(entry.id, &error);
    if (error) return;
    if (row && !row->flushed) continue;
    --waiting_;
    if (!row) {  // removed from the store meanwhile: nothing left to export
      entry.state = EntryState::kAcked;
      continue;
    }
    entry.body = std::move(row->body);
    entry.state = EntryState::kReady;
    to_send_.emplace_back(ExportKind::kSessions, entry.id);
  }
}

void NatsExporter::Fill() {
  if (Clock::now() < resume_at_) return;
  std::uint64_t published = 0, resends = 0;
  jsPubOptions po;
  jsPubOptions_Init(&po);
  po.MaxWait = options_.ack_timeout.count();
  std::string subject, msg_id;
  while (inflight_ < options_.max_unacked) {
    if (to_send_.empty()) {
      ReadMore();
      if (to_send_.empty()) break;
    }
    const auto [kind, id] = to_send_.front();
    Entry* entry = Find(kind, id);
    if (!entry || entry->state != EntryState::kReady) {
      to_send_.pop_front();
      continue;
    }
    subject = options_.subject_prefix + "." + options_.device + "." + ExportKindName(kind);
    msg_id = options_.device + ":" + ExportKindName(kind) + ":" + std::to_string(id);
    natsMsg* msg = nullptr;
    natsStatus s = natsMsg_Create(&msg, subject.c_str(), nullptr, entry->body.data(),
                                  static_cast<int>(entry->body.size()));
    if (s == NATS_OK) s = natsMsgHeader_Set(msg, kMsgIdHeader, msg_id.c_str());
    if (s == NATS_OK) s = js_PublishMsgAsync(js_, &msg, &po);
    natsMsg_Destroy(msg);  // nothing when the library took it
    if (s != NATS_OK) {
      Failed(NatsError(s));
      break;
    }
    to_send_.pop_front();
    entry->state = EntryState::kInflight;
    entry->sent = Clock::now();
    resends += entry->attempts++ > 0;
    ++published;
    ++inflight_;
  }
  if (published) {
    Update([&](Figures& f) {
      f.published += published;
      f.resends += resends;
    });
  }
}

void NatsExporter::Expire() {
  // The library reports a publish without an acknowledgement after ack_timeout; one it
  // never reports (lost with a connection) is sent again after twice that.
  const auto overdue = Clock::now() - 2 * options_.ack_timeout;
  for (ExportKind kind : kAllExportKinds) {
    for (Entry& entry : kinds_[static_cast<int>(kind)].entries) {
      if (entry.state != EntryState::kInflight || entry.sent > overdue) continue;
      entry.state = EntryState::kReady;
      --inflight_;
      to_send_.emplace_back(kind, entry.id);
      Failed("no acknowledgement in time");
    }
  }
}

void NatsExporter::AdvanceAndSave(bool now) {
  std::array<std::int64_t, kExportKinds> cursors{};
  for (ExportKind kind : kAllExportKinds) {
    Kind& k = kinds_[static_cast<int>(kind)];
    while (!k.entries.empty() && k.entries.front().state == EntryState::kAcked) {
      k.cursor = k.entries.front().id;
      k.entries.pop_front();
      cursors_dirty_ = true;
    }
    cursors[static_cast<int>(kind)] = k.cursor;
  }
  if (!cursors_dirty_ || (!now && Clock::now() - last_save_ < kTick)) return;
  last_save_ = Clock::now();
  cursors_dirty_ = false;
  std::lock_guard lock(mutex_);
  to_save_ = cursors;
  save_wanted_.notify_one();
}

void NatsExporter::SaveLoop() {
  std::unique_ptr<ExportSource> db;
  std::unique_lock lock(mutex_);
  while (true) {
    save_wanted_.wait(lock, [&] { return to_save_ || saver_stopping_; });
    if (!to_save_) return;
    const std::array<std::int64_t, kExportKinds> cursors = *to_save_;
    to_save_.reset();
    lock.unlock();
    std::optional<Error> error;
    if (!db) db = ExportSource::Open(options_.db_path, options_.device, &error);
    if (db) error = db->SaveCursors(name_, cursors);
    lock.lock();
    if (!error) continue;
    // Tried again a second later (newer cursors replace these); the counters say why.
    figures_.last_error = error->Description();
    if (saver_stopping_) return;
    if (!to_save_) to_save_ = cursors;
    save_wanted_.wait_for(lock, kTick, [&] { return saver_stopping_; });
  }
}

void NatsExporter::RefreshLag() {
  std::int64_t rows = 0;
  std::optional<double> oldest;
  for (ExportKind kind : kAllExportKinds) {
    ExportLag lag;
    if (source_->Lag(kind, kinds_[static_cast<int>(kind)].cursor, lag)) return;
    rows += lag.rows;
    if (lag.oldest_time && (!oldest || *lag.oldest_time < *oldest)) oldest = lag.oldest_time;
  }
  timespec now{};
  clock_gettime(CLOCK_REALTIME, &now);
  const double seconds =
      oldest ? std::max(0.0, static_cast<double>(now.tv_sec) + now.tv_nsec / 1e9 - *oldest) : 0;
  Update([&](Figures& f) {
    f.lag_rows = rows;
    f.lag_seconds = seconds;
  });
}

}  // namespace qn
