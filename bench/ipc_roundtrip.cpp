// IPC benchmark: round-trip latency and pipelined throughput of the client protocol against
// a real qnreportingd, through libqnreporting.
//
//   bench_ipc_roundtrip [--daemon PATH] [--socket PATH] [--roundtrips N] [--messages N]
//                       [--clients N]
//
// Without --socket it starts the daemon (by default the qnreportingd built beside this
// benchmark) with --home in a temporary folder and stops it at the end with SIGTERM.

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "qnreporting/Client.h"

namespace {

using Clock = std::chrono::steady_clock;
using qn::client::Client;

struct Options {
  std::string daemon;
  std::string socket;
  int roundtrips = 20000;
  int messages = 100000;
  int clients = 4;
};

std::string DefaultDaemonPath() {
  std::error_code error;
  auto self = std::filesystem::read_symlink("/proc/self/exe", error);
  if (error) return "qnreportingd";
  return (self.parent_path() / ".." / "Statistics" / "qnreportingd").lexically_normal();
}

// The daemon under test, started in a private folder.
class Daemon {
 public:
  bool Start(const std::string& binary) {
    char pattern[] = "/tmp/qn-bench-XXXXXX";
    if (!::mkdtemp(pattern)) return false;
    home_ = pattern;
    socket_ = home_ + "/run/reporting.sock";
    pid_ = ::fork();
    if (pid_ == 0) {
      const std::string log = home_ + "/daemon.log";
      if (!std::freopen(log.c_str(), "w", stderr)) std::_Exit(126);
      ::execl(binary.c_str(), binary.c_str(), "--home", home_.c_str(), nullptr);
      std::_Exit(127);
    }
    return pid_ > 0;
  }
  ~Daemon() {
    if (pid_ > 0) {
      ::kill(pid_, SIGTERM);
      int status = 0;
      ::waitpid(pid_, &status, 0);
    }
    std::error_code ignored;
    if (!home_.empty()) std::filesystem::remove_all(home_, ignored);
  }
  const std::string& socket() const { return socket_; }

 private:
  pid_t pid_ = -1;
  std::string home_;
  std::string socket_;
};

std::unique_ptr<Client> ConnectWithRetry(const std::string& socket) {
  const auto deadline = Clock::now() + std::chrono::seconds(20);
  std::string error;
  while (Clock::now() < deadline) {
    if (auto client = Client::Connect(socket, &error)) return client;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  std::fprintf(stderr, "bench_ipc_roundtrip: %s\n", error.c_str());
  return nullptr;
}

double Seconds(Clock::duration d) { return std::chrono::duration<double>(d).count(); }

double Percentile(std::vector<double>& values, double p) {
  if (values.empty()) return 0;
  const std::size_t i = std::min(values.size() - 1, static_cast<std::size_t>(p * values.size()));
  std::nth_element(values.begin(), values.begin() + static_cast<std::ptrdiff_t>(i), values.end());
  return values[i];
}

// One request, wait for its reply, repeat.
bool RoundTrips(Client& client, int count) {
  std::vector<double> micros;
  micros.reserve(static_cast<std::size_t>(count));
  for (int i = 0; i < 200; ++i) client.reporterIDValidSync(i);  // warm up
  const auto begin = Clock::now();
  for (int i = 0; i < count; ++i) {
    const auto start = Clock::now();
    if (!client.reporterIDValidSync(i)) return false;
    micros.push_back(Seconds(Clock::now() - start) * 1e6);
  }
  const double total = Seconds(Clock::now() - begin);
  const double p50 = Percentile(micros, 0.50);
  const double p99 = Percentile(micros, 0.99);
  std::printf(
      "reporterID:valid: round trip   %8d calls  %9.0f calls/s  p50 %7.1f us  p99 %7.1f us\n",
      count, count / total, p50, p99);
  return true;
}

// Many requests in flight on one connection.
bool PipelinedValid(Client& client, int count) {
  std::atomic<int> replies{0};
  const auto begin = Clock::now();
  for (int i = 0; i < count; ++i) {
    client.reporterIDValid(i, [&](const qn::Dictionary&) { ++replies; });
  }
  if (!client.WaitForReplies(std::chrono::seconds(300))) return false;
  const double total = Seconds(Clock::now() - begin);
  std::printf("reporterID:valid: pipelined    %8d calls  %9.0f calls/s\n", replies.load(),
              replies / total);
  return true;
}

// sendMessage to one started session, all in flight at once, on `clients` connections.
bool PipelinedSend(const std::string& socket, int clients, int count) {
  std::vector<std::unique_ptr<Client>> connections;
  for (int c = 0; c < clients; ++c) {
    auto client = ConnectWithRetry(socket);
    if (!client) return false;
    const std::int64_t id = 1000 + c;
    client->createReportingSessionSync(id);
    client->setServiceTypeSync(2, id);
    client->startReportingSessionForID(id, nullptr);  // replies at stop
    connections.push_back(std::move(client));
  }
  const qn::Value message(qn::Dictionary{{"route", "speaker"}, {"volume", 0.5}, {"muted", false}});
  const int per_client = count / clients;
  const auto begin = Clock::now();
  std::vector<std::thread> threads;
  std::atomic<bool> ok{true};
  for (int c = 0; c < clients; ++c) {
    threads.emplace_back([&, c] {
      Client& client = *connections[static_cast<std::size_t>(c)];
      const std::vector<std::int64_t> ids{1000 + c};
      for (int i = 1; i < per_client; ++i) client.sendMessage(message, 5, 1, ids, nullptr);
      // Replies come in order: once the last one is back, all are. (WaitForReplies would
      // also wait for the start reply, which comes only at stop.)
      if (!client.sendMessageSync(message, 5, 1, ids, std::chrono::seconds(600))) ok = false;
    });
  }
  for (auto& t : threads) t.join();
  const double total = Seconds(Clock::now() - begin);
  if (!ok) return false;
  std::printf("sendMessage pipelined         %8d msgs   %9.0f msgs/s   (%d clients)\n",
              per_client * clients, per_client * clients / total, clients);
  for (int c = 0; c < clients; ++c) {
    auto& client = connections[static_cast<std::size_t>(c)];
    client->stopReportingSessionForIDSync(1000 + c);
    client->destroyReportingSessionSync(1000 + c);
  }
  return true;
}

int Run(const Options& options) {
  std::optional<Daemon> daemon;
  std::string socket = options.socket;
  if (socket.empty()) {
    daemon.emplace();
    if (!daemon->Start(options.daemon.empty() ? DefaultDaemonPath() : options.daemon)) {
      std::fprintf(stderr, "bench_ipc_roundtrip: cannot start the daemon\n");
      return 1;
    }
    socket = daemon->socket();
  }
  auto client = ConnectWithRetry(socket);
  if (!client) return 1;
  if (!RoundTrips(*client, options.roundtrips)) return 1;
  if (!PipelinedValid(*client, options.roundtrips * 5)) return 1;
  if (!PipelinedSend(socket, 1, options.messages)) return 1;
  if (options.clients > 1 && !PipelinedSend(socket, options.clients, options.messages)) return 1;
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  std::setvbuf(stdout, nullptr, _IOLBF, 0);
  Options options;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    auto next = [&]() -> std::string { return i + 1 < argc ? argv[++i] : ""; };
    if (arg == "--daemon") {
      options.daemon = next();
    } else if (arg == "--socket") {
      options.socket = next();
    } else if (arg == "--roundtrips") {
      options.roundtrips = std::max(1, std::atoi(next().c_str()));
    } else if (arg == "--messages") {
      options.messages = std::max(1, std::atoi(next().c_str()));
    } else if (arg == "--clients") {
      options.clients = std::max(1, std::atoi(next().c_str()));
    } else {
      std::fprintf(stderr,
                   "usage: bench_ipc_roundtrip [--daemon PATH] [--socket PATH] "
                   "[--roundtrips N] [--messages N] [--clients N]\n");
      return 2;
    }
  }
  return Run(options);
}
