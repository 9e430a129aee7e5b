// Load generator for qnreportingd, written against the wire protocol alone (no client
// library), so that what it measures is the daemon.
//
//   bench_loadgen [--socket PATH | --home DIR | --daemon PATH] [--op send|valid|pingpong]
//                 [--clients N] [--sessions S] [--messages M] [--window W] [--json]
//
// send:     each of N clients opens S sessions (create, type, start) and keeps W
//           sendMessage requests in flight until it has sent M messages, then stops and
//           destroys its sessions. Payloads are realistic: 8 keys, about 200 bytes.
// valid:    each client keeps W reporterID:valid: requests in flight, M in all.
// idle:     each client opens S sessions and holds them while the daemon's RSS is read.
// first:    one reporterID:valid: on a new connection, timed from before connect() to the
//           reply: against a socket-activated daemon, its start-up to first reply.
// pingpong: the reference: a raw Unix-socket echo of the same frame sizes between this
//           process and a forked child, one at a time (no daemon involved).
// neighbours: one client floods reporterID:valid: requests and never reads its replies,
//           another sends M messages to one session with a window of 1024, and a third
//           makes reporterID:valid: round trips one at a time meanwhile; the latencies
//           reported are the third client's, the rates the sender's.
//
// Reports accepted requests/s (replies received), durable messages/s (rows committed in the
// store, read from its database), round-trip p50/p99/p99.9, daemon CPU seconds per 1M
// requests and the daemon's peak RSS. Without --socket/--home it starts the daemon (the one
// built beside it, or --daemon) under a temporary --home and stops it at the end.

#include <poll.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "common/MsgPack.h"
#include "common/Value.h"

namespace {

using Clock = std::chrono::steady_clock;

struct Options {
  std::string socket, home, daemon, op = "send";
  int clients = 1, sessions = 1, window = 64;
  long messages = 200000;
  bool json = false;
};

// --- wire helpers --------------------------------------------------------------------------

void AppendBigEndian32(std::string& out, std::uint32_t v) {
  for (int shift = 24; shift >= 0; shift -= 8) out.push_back(static_cast<char>(v >> shift));
}

// One request frame: [op, id, args...], with the id as a fixed-width uint32 so that it can
// be patched into a prebuilt frame.
class RequestTemplate {
 public:
  RequestTemplate(int op, const std::vector<qn::Value>& args) {
    std::string body;
    body.push_back(static_cast<char>(0x90 | (2 + args.size())));
    body.push_back(static_cast<char>(op));
    body.push_back(static_cast<char>(0xce));
    id_offset_ = 4 + body.size();
    AppendBigEndian32(body, 0);
    for (const auto& arg : args) body += qn::EncodeMsgPack(arg);
    AppendBigEndian32(frame_, static_cast<std::uint32_t>(body.size()));
    frame_ += body;
  }
  void AppendTo(std::string& out, std::uint32_t id) const {
    const std::size_t at = out.size() + id_offset_;
    out += frame_;
    for (int i = 0; i < 4; ++i) out[at + i] = static_cast<char>(id >> (24 - 8 * i));
  }
  std::size_t size() const { return frame_.size(); }

 private:
  std::string frame_;
  std::size_t id_offset_ = 0;
};

// The request id of a reply body [id, result] (0 for anything else).
std::uint32_t ReplyId(const unsigned char* p, std::size_t n) {
  if (n < 2 || p[0] != 0x92) return 0;
  if (p[1] < 0x80) return p[1];
  auto be = [&](int bytes) {
    std::uint32_t v = 0;
    for (int i = 0; i < bytes && 2 + i < static_cast<int>(n); ++i) v = v << 8 | p[2 + i];
    return v;
  };
  if (p[1] == 0xcc) return be(1);
  if (p[1] == 0xcd) return be(2);
  if (p[1] == 0xce) return be(4);
  return 0;
}

int ConnectUnix(const std::string& path) {
  const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  for (int attempt = 0; attempt < 500; ++attempt) {
    if (::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0) return fd;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  std::fprintf(stderr, "loadgen: cannot connect to %s: %s\n", path.c_str(), std::strerror(errno));
  std::exit(1);
}

bool WriteAll(int fd, const std::string& bytes) {
  for (std::size_t done = 0; done < bytes.size();) {
    const ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
    if (n <= 0) return false;
    done += static_cast<std::size_t>(n);
  }
  return true;
}

// Reads frames and hands each body's reply id to `on_reply` until `enough` says stop.
class ReplyReader {
 public:
  explicit ReplyReader(int fd) : fd_(fd) {}
  template <typename F>
  bool ReadSome(F&& on_reply) {
    char chunk[65536];
    const ssize_t n = ::read(fd_, chunk, sizeof chunk);
    if (n <= 0) return false;
    buffer_.append(chunk, static_cast<std::size_t>(n));
    std::size_t at = 0;
    while (buffer_.size() - at >= 4) {
      const auto* p = reinterpret_cast<const unsigned char*>(buffer_.data() + at);
      const std::size_t length = std::size_t{p[0]} << 24 | p[1] << 16 | p[2] << 8 | p[3];
      if (buffer_.size() - at - 4 < length) break;
      on_reply(ReplyId(p + 4, length));
      at += 4 + length;
    }
    buffer_.erase(0, at);
    return true;
  }

 private:
  int fd_;
  std::string buffer_;
};

// --- the daemon's process ------------------------------------------------------------------

struct ProcessUsage {
  double cpu_seconds = 0;
  long rss_kib = 0, hwm_kib = 0;
};

ProcessUsage Usage(pid_t pid) {
  ProcessUsage usage;
  std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
  std::string line;
  std::getline(stat, line);
  const auto close = line.rfind(')');
  if (close != std::string::npos) {
    std::istringstream rest(line.substr(close + 2));
    std::string field;
    unsigned long utime = 0, stime = 0;
    for (int i = 3; i <= 15 && rest >> field; ++i) {
      if (i == 14) utime = std::stoul(field);
      if (i == 15) stime = std::stoul(field);
    }
    usage.cpu_seconds = static_cast<double>(utime + stime) / ::sysconf(_SC_CLK_TCK);
  }
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  while (std::getline(status, line)) {
    if (line.starts_with("VmRSS:")) usage.rss_kib = std::stol(line.substr(6));
    if (line.starts_with("VmHWM:")) usage.hwm_kib = std::stol(line.substr(6));
  }
  return usage;
}

pid_t PeerPid(int fd) {
  ucred credentials{};
  socklen_t size = sizeof credentials;
  ::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &credentials, &size);
  return credentials.pid;
}

std::int64_t StoredMessages(const std::string& db_path) {
  sqlite3* db = nullptr;
  std::int64_t count = -1;
  if (sqlite3_open_v2(db_path.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
    sqlite3_busy_timeout(db, 1000);
    sqlite3_stmt* stmt = nullptr;
    if (sqlite3_prepare_v2(db, "SELECT count(*) FROM livo_messages", -1, &stmt, nullptr) ==
            SQLITE_OK &&
        sqlite3_step(stmt) == SQLITE_ROW) {
      count = sqlite3_column_int64(stmt, 0);
    }
    sqlite3_finalize(stmt);
  }
  sqlite3_close(db);
  return count;
}

// --- one client ----------------------------------------------------------------------------

qn::Value Payload(int client, long n) {
  return qn::Value(qn::Dictionary{{"route", "speaker"},
                                  {"device", "built-in"},
                                  {"sample_rate", 48000},
                                  {"channels", 2},
                                  {"volume", 0.75},
                                  {"client", client},
                                  {"sequence", static_cast<std::int64_t>(n)},
                                  {"note", std::string(60, 'x')}});
}

struct ClientResult {
  std::vector<double> latencies_us;
  long replies = 0;
};

// Sends `count` copies of `request` with `window` in flight; returns when all replied.
void Pump(int fd, const RequestTemplate& request, long count, int window, std::uint32_t& next_id,
          ClientResult& result) {
  std::vector<Clock::time_point> sent(1 << 20);
  ReplyReader reader(fd);
  long issued = 0, answered = 0;
  std::string batch;
  while (answered < count) {
    batch.clear();
    const auto now = Clock::now();
    while (issued < count && issued - answered < window) {
      const std::uint32_t id = next_id++;
      sent[id % sent.size()] = now;
      request.AppendTo(batch, id);
      ++issued;
    }
    if (!batch.empty() && !WriteAll(fd, batch)) break;
    if (!reader.ReadSome([&](std::uint32_t id) {
          result.latencies_us.push_back(
              std::chrono::duration<double, std::micro>(Clock::now() - sent[id % sent.size()])
                  .count());
          ++answered;
        })) {
      break;
    }
  }
  result.replies += answered;
}

// Sends each request once and waits for `replies` replies.
void Exchange(int fd, const std::vector<RequestTemplate>& requests, long replies,
              std::uint32_t& next_id) {
  std::string batch;
  for (const auto& request : requests) request.AppendTo(batch, next_id++);
  WriteAll(fd, batch);
  ReplyReader reader(fd);
  long got = 0;
  while (got < replies && reader.ReadSome([&](std::uint32_t) { ++got; })) {
  }
}

// One client: its connection, its sessions, and what it has sent and heard back.
struct Client {
  int fd = -1;
  std::uint32_t next_id = 1;
  std::vector<std::int64_t> ids;
  std::vector<RequestTemplate> requests;  // what it sends: one per session (or one valid)
  long total = 0, issued = 0, answered = 0;
  std::vector<Clock::time_point> sent = std::vector<Clock::time_point>(1 << 16);
  std::unique_ptr<ReplyReader> reader;
};

// Connects, and for send/idle opens the client's sessions (create, type, start).
Client OpenClient(const Options& options, int index) {
  Client client;
  client.fd = ConnectUnix(options.socket);
  client.reader = std::make_unique<ReplyReader>(client.fd);
  client.total = options.messages;
  if (options.op == "valid") {
    client.requests.emplace_back(9, std::vector<qn::Value>{qn::Value(std::int64_t{1})});
    return client;
  }
  std::vector<RequestTemplate> setup;
  for (int s = 0; s < options.sessions; ++s) {
    const std::int64_t id = index * 100000 + s + 1;
    client.ids.push_back(id);
    setup.emplace_back(1, std::vector<qn::Value>{qn::Value(id)});
    setup.emplace_back(2, std::vector<qn::Value>{qn::Value(2), qn::Value(id)});
    setup.emplace_back(5, std::vector<qn::Value>{qn::Value(id)});
    client.requests.emplace_back(
        6, std::vector<qn::Value>{Payload(index, s), qn::Value(5), qn::Value(1),
                                  qn::Value(qn::Array{qn::Value(id)})});
  }
  // create and type reply at once; each start replies when its session stops.
  Exchange(client.fd, setup, 2L * options.sessions, client.next_id);
  return client;
}

// Stops and destroys the client's sessions, and closes its connection.
void CloseClient(const Options& options, Client& client) {
  std::vector<RequestTemplate> teardown;
  for (std::int64_t id : client.ids) {
    teardown.emplace_back(7, std::vector<qn::Value>{qn::Value(id)});
    teardown.emplace_back(8, std::vector<qn::Value>{qn::Value(id)});
  }
  if (!teardown.empty()) Exchange(client.fd, teardown, 3L * options.sessions, client.next_id);
  ::close(client.fd);
}

// Every client keeps `window` requests in flight until it has had `total` replies: one
// thread, one poll loop over every connection (as redis-benchmark drives its clients), so
// that the load generator's own thread switches do not show up as the daemon's latency.
// Each client goes through its sessions one after the other.
void PumpAll(std::vector<Client>& clients, int window, std::vector<ClientResult>& results) {
  std::vector<pollfd> fds(clients.size());
  std::string batch;
  for (;;) {
    std::size_t waiting = 0;
    for (std::size_t c = 0; c < clients.size(); ++c) {
      Client& client = clients[c];
      fds[c] = pollfd{client.answered < client.total ? client.fd : -1, POLLIN, 0};
      if (client.answered >= client.total) continue;
      ++waiting;
      batch.clear();
      const auto now = Clock::now();
      const long per_request = client.total / static_cast<long>(client.requests.size());
      while (client.issued < client.total && client.issued - client.answered < window) {
        const std::size_t which = std::min<std::size_t>(
            client.requests.size() - 1, static_cast<std::size_t>(client.issued / per_request));
        client.sent[client.next_id % client.sent.size()] = now;
        client.requests[which].AppendTo(batch, client.next_id++);
        ++client.issued;
      }
      if (!batch.empty() && !WriteAll(client.fd, batch)) return;
    }
    if (waiting == 0) return;
    // One client simply blocks in its read (as a lone client would); more wait in poll.
    if (clients.size() > 1 && ::poll(fds.data(), fds.size(), -1) < 0 && errno != EINTR) return;
    if (clients.size() == 1) fds[0].revents = POLLIN;
    for (std::size_t c = 0; c < clients.size(); ++c) {
      if (!(fds[c].revents & (POLLIN | POLLHUP | POLLERR))) continue;
      Client& client = clients[c];
      const bool open = client.reader->ReadSome([&](std::uint32_t id) {
        results[c].latencies_us.push_back(std::chrono::duration<double, std::micro>(
                                              Clock::now() - client.sent[id % client.sent.size()])
                                              .count());
        ++client.answered;
        ++results[c].replies;
      });
      if (!open) return;
    }
  }
}

// --- a flooder, a busy sender and a prober at once ---------------------------------------

// Writes reporterID:valid: requests until `stop`, never reading a reply.
void Flood(const Options& options, const std::atomic<bool>& stop) {
  const int fd = ConnectUnix(options.socket);
  const timeval patience{0, 100000};  // a write held back by the daemon returns to check `stop`
  ::setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
  const RequestTemplate request(9, {qn::Value(std::int64_t{1})});
  std::string batch;
  for (std::uint32_t id = 1; batch.size() < 64 * 1024; ++id) request.AppendTo(batch, id);
  std::size_t at = 0;
  while (!stop) {
    const ssize_t n = ::write(fd, batch.data() + at, batch.size() - at);
    if (n < 0 && errno != EAGAIN && errno != EINTR) break;
    if (n > 0) at = (at + static_cast<std::size_t>(n)) % batch.size();
  }
  ::close(fd);
}

void RunNeighbours(const Options& options, ClientResult& prober, ClientResult& sender) {
  std::atomic<bool> done{false};
  std::thread flood([&] { Flood(options, done); });
  std::this_thread::sleep_for(std::chrono::milliseconds(200));  // let the flooder get ahead
  std::thread send([&] {
    Options busy = options;
    busy.op = "send";
    std::vector<Client> clients;
    clients.push_back(OpenClient(busy, 1));
    std::vector<ClientResult> results(1);
    PumpAll(clients, 1024, results);
    CloseClient(busy, clients[0]);
    sender = std::move(results[0]);
    done = true;
  });
  const int fd = ConnectUnix(options.socket);
  const RequestTemplate request(9, {qn::Value(std::int64_t{1})});
  std::uint32_t id = 1;
  while (!done) Pump(fd, request, 1, 1, id, prober);
  ::close(fd);
  send.join();
  flood.join();
}

// --- the raw-socket reference ----------------------------------------------------------------

void PingPong(const Options& options, ClientResult& result) {
  int pair[2];
  ::socketpair(AF_UNIX, SOCK_STREAM, 0, pair);
  const RequestTemplate request(9, {qn::Value(std::int64_t{1})});
  const pid_t child = ::fork();
  if (child == 0) {  // echo every frame back as a small reply frame [id, true]
    ::close(pair[0]);
    ReplyReader reader(pair[1]);
    std::string reply;
    while (reader.ReadSome([&](std::uint32_t) {})) {
      reply.assign("\0\0\0\x03\x92\x01\xc3", 7);
      if (!WriteAll(pair[1], reply)) break;
    }
    std::_Exit(0);
  }
  ::close(pair[1]);
  // The echo replies with id 1; latencies still come from the one request in flight.
  std::uint32_t id = 1;
  std::vector<Clock::time_point> sent(1);
  ReplyReader reader(pair[0]);
  std::string frame;
  for (long n = 0; n < options.messages; ++n) {
    frame.clear();
    request.AppendTo(frame, id);
    const auto start = Clock::now();
    WriteAll(pair[0], frame);
    bool got = false;
    while (!got && reader.ReadSome([&](std::uint32_t) { got = true; })) {
    }
    result.latencies_us.push_back(
        std::chrono::duration<double, std::micro>(Clock::now() - start).count());
    ++result.replies;
  }
  ::close(pair[0]);
  ::waitpid(child, nullptr, 0);
}

double Percentile(std::vector<double>& values, double p) {
  if (values.empty()) return 0;
  const auto k = static_cast<std::size_t>(p * static_cast<double>(values.size() - 1));
  std::nth_element(values.begin(), values.begin() + static_cast<std::ptrdiff_t>(k), values.end());
  return values[k];
}

std::string DefaultDaemonPath() {
  std::error_code error;
  auto self = std::filesystem::read_symlink("/proc/self/exe", error);
  return (self.parent_path() / ".." / "Statistics" / "qnreportingd").lexically_normal();
}

}  // namespace

int main(int argc, char** argv) {
  Options options;
  CLI::App app("Load generator for qnreportingd (wire protocol, no client library)",
               "bench_loadgen");
  app.add_option("--socket", options.socket, "The daemon's socket");
  app.add_option("--home", options.home, "The daemon's --home (socket and store found there)");
  app.add_option("--daemon", options.daemon, "Start this daemon binary under a temporary home");
  app.add_option("--op", options.op, "send, valid, pingpong, idle, first or neighbours")
      ->check(CLI::IsMember({"send", "valid", "pingpong", "idle", "first", "neighbours"}));
  app.add_option("--clients", options.clients, "Clients (connections)")->check(CLI::Range(1, 64));
  app.add_option("--sessions", options.sessions, "Sessions per client")->check(CLI::Range(1, 4096));
  app.add_option("--messages", options.messages, "Requests per client")->check(CLI::PositiveNumber);
  app.add_option("--window", options.window, "Requests in flight per client")
      ->check(CLI::Range(1, 100000));
  app.add_flag("--json", options.json, "One JSON object instead of text");
  CLI11_PARSE(app, argc, argv);

  pid_t started = -1;
  if (options.op != "pingpong" && options.socket.empty() && options.home.empty()) {
    char pattern[] = "/tmp/qn-loadgen-XXXXXX";
    options.home = ::mkdtemp(pattern);
    const std::string binary = options.daemon.empty() ? DefaultDaemonPath() : options.daemon;
    started = ::fork();
    if (started == 0) {
      if (!std::freopen((options.home + "/daemon.log").c_str(), "w", stderr)) std::_Exit(126);
      ::execl(binary.c_str(), binary.c_str(), "--home", options.home.c_str(), nullptr);
      std::_Exit(127);
    }
  }
  if (options.socket.empty() && !options.home.empty()) {
    options.socket = options.home + "/run/reporting.sock";
  }
  const std::string db = options.home.empty() ? "" : options.home + "/state/reports.db";

  if (options.op == "first") {
    const auto begin = Clock::now();
    const int fd = ConnectUnix(options.socket);
    std::uint32_t id = 1;
    Exchange(fd, {RequestTemplate(9, {qn::Value(std::int64_t{1})})}, 1, id);
    const double us = std::chrono::duration<double, std::micro>(Clock::now() - begin).count();
    std::printf(options.json ? "{\"op\":\"first\",\"first_reply_us\":%.0f}\n"
                             : "first: reply %.0f us after connect\n",
                us);
    ::close(fd);
    return 0;
  }
  pid_t daemon = 0;
  ProcessUsage before;
  std::int64_t stored_before = 0;
  if (options.op != "pingpong") {
    const int probe = ConnectUnix(options.socket);
    daemon = PeerPid(probe);
    ::close(probe);
    before = Usage(daemon);
    if (!db.empty()) stored_before = std::max<std::int64_t>(0, StoredMessages(db));
  }

  std::atomic<bool> sampling{true};
  long peak_rss = 0;
  std::thread sampler([&] {
    while (daemon && sampling) {
      peak_rss = std::max(peak_rss, Usage(daemon).rss_kib);
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
  });

  std::vector<ClientResult> results(static_cast<std::size_t>(options.clients));
  const auto start = Clock::now();
  ClientResult sender;
  long idle_rss_kib = 0;
  if (options.op == "pingpong") {
    PingPong(options, results[0]);
  } else if (options.op == "neighbours") {
    RunNeighbours(options, results[0], sender);
  } else {
    std::vector<Client> clients;
    for (int c = 0; c < options.clients; ++c) clients.push_back(OpenClient(options, c));
    if (options.op == "idle") {  // every session open and started: measure, then close
      std::this_thread::sleep_for(std::chrono::milliseconds(200));
      idle_rss_kib = Usage(daemon).rss_kib;
      if (!options.json) {
        std::printf("idle: %d client(s) x %d session(s) open: daemon RSS %.1f MiB\n",
                    options.clients, options.sessions, idle_rss_kib / 1024.0);
      }
      for (int c = 0; c < options.clients; ++c)
        results[static_cast<std::size_t>(c)].replies = options.messages;
    } else {
      PumpAll(clients, options.window, results);
    }
    for (auto& client : clients) CloseClient(options, client);
  }
  const double accepted_seconds = std::chrono::duration<double>(Clock::now() - start).count();

  const bool neighbours = options.op == "neighbours";
  long replies = 0;
  std::vector<double> latencies;
  for (auto& r : results) {
    replies += r.replies;
    latencies.insert(latencies.end(), r.latencies_us.begin(), r.latencies_us.end());
  }
  // Durable: every message (plus the summary of each session) committed in the store.
  double durable_seconds = 0;
  const std::int64_t expected = options.op == "send" || neighbours
                                    ? stored_before + options.messages * options.clients +
                                          std::int64_t{options.sessions} * options.clients
                                    : 0;
  if (expected > 0 && !db.empty()) {
    while (StoredMessages(db) < expected &&
           std::chrono::duration<double>(Clock::now() - start).count() < 120) {
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    durable_seconds = std::chrono::duration<double>(Clock::now() - start).count();
  }
  sampling = false;
  sampler.join();
  const ProcessUsage after = daemon ? Usage(daemon) : ProcessUsage{};
  const long requests =
      neighbours ? replies : options.messages * (options.op == "pingpong" ? 1 : options.clients);
  const double cpu_per_million = (after.cpu_seconds - before.cpu_seconds) * 1e6 / requests;

  const double p50 = Percentile(latencies, 0.5), p99 = Percentile(latencies, 0.99),
               p999 = Percentile(latencies, 0.999);
  const double accepted_rate =
      static_cast<double>(neighbours ? sender.replies : replies) / accepted_seconds;
  const double durable_rate =
      durable_seconds > 0
          ? static_cast<double>(options.messages * options.clients) / durable_seconds
          : 0;
  if (options.json) {
    std::printf(
        "{\"op\":\"%s\",\"clients\":%d,\"sessions\":%d,\"window\":%d,\"requests\":%ld,"
        "\"accepted_per_s\":%.0f,\"durable_per_s\":%.0f,\"p50_us\":%.1f,\"p99_us\":%.1f,"
        "\"p999_us\":%.1f,\"daemon_cpu_s_per_million\":%.2f,\"daemon_peak_rss_kib\":%ld,"
        "\"daemon_rss_after_kib\":%ld,\"idle_rss_kib\":%ld}\n",
        options.op.c_str(), options.clients, options.sessions, options.window, requests,
        accepted_rate, durable_rate, p50, p99, p999, cpu_per_million, peak_rss, after.rss_kib,
        idle_rss_kib);
  } else {
    std::printf("%s: %d client(s) x %d session(s), window %d, %ld requests\n", options.op.c_str(),
                options.clients, options.sessions, options.window, requests);
    std::printf("  accepted  %.0f/s\n", accepted_rate);
    if (neighbours) std::printf("  (the sender's rates; the latencies are the prober's)\n");
    if (durable_rate > 0) std::printf("  durable   %.0f msgs/s\n", durable_rate);
    std::printf("  latency   p50 %.1f us, p99 %.1f us, p99.9 %.1f us\n", p50, p99, p999);
    if (daemon) {
      std::printf("  daemon    %.2f CPU s per 1M requests, peak RSS %.1f MiB, after %.1f MiB\n",
                  cpu_per_million, peak_rss / 1024.0, after.rss_kib / 1024.0);
    }
  }
  if (started > 0) {
    ::kill(started, SIGTERM);
    ::waitpid(started, nullptr, 0);
    std::filesystem::remove_all(options.home);
  }
  return replies == requests ? 0 : 1;
}
