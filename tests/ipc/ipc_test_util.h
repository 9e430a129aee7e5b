#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/ipc.h"
#include "platform/linux/linux_ipc.h"
#include "qnreporting/Client.h"
#include "tests/fakes/LogCapture.h"
#include "tests/fakes/TempDir.h"

namespace qn::testing {

// Polls `condition` until it holds or `timeout` passes; for conditions with no event to
// wait on (log lines written by another thread).
inline bool Eventually(const std::function<bool()>& condition,
                       std::chrono::milliseconds timeout = std::chrono::seconds(20)) {
  for (const auto give_up = std::chrono::steady_clock::now() + timeout; !condition();) {
    if (std::chrono::steady_clock::now() > give_up) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  return true;
}

inline std::unique_ptr<client::Client> Connect(const std::string& path) {
  std::string error;
  auto client = client::Client::Connect(path, &error);
  EXPECT_NE(client, nullptr) << error;
  return client;
}

// An exported object that answers with the test's handler, or by default at once with a
// value of the operation's reply type: true; service type = the reporter ID argument;
// {"reporterID": ID, "serviceType": 7}; reporter IDs [1, 2, 3]; nil for sendMessage; no
// reply to killService. Requests count as taken in at once unless the test holds them.
class FakeExportedObject final : public IpcExportedObject {
 public:
  using Handler = std::function<void(protocol::Op, const Array&, IpcReply)>;
  explicit FakeExportedObject(Handler handler) : handler_(std::move(handler)) {}
  void HandleRequest(protocol::Op op, const Array& args, IpcReply reply) override {
    ++requests;
    handler_ ? handler_(op, args, std::move(reply)) : DefaultReply(op, args, reply);
  }
  void AfterRequests(std::function<void()> done) override {
    std::unique_lock lock(mu_);
    if (hold_) return held_.push_back(std::move(done));
    lock.unlock();
    done();
  }
  // While held, AfterRequests keeps its callbacks; releasing runs the ones kept.
  void HoldTakenIn(bool hold) {
    std::unique_lock lock(mu_);
    hold_ = hold;
    auto release = hold ? decltype(held_)() : std::move(held_);
    lock.unlock();
    for (auto& done : release) done();
  }
  static void DefaultReply(protocol::Op op, const Array& args, const IpcReply& reply) {
    using protocol::Op;
    if (op == Op::kGetServiceNameForReporterID) {
      reply(Value(static_cast<std::uint16_t>(args[0].as_int64().value_or(0) & 0xFFFF)));
    } else if (op == Op::kReporterIDValid) {
      reply(Value(Dictionary{{"reporterID", args[0]}, {"serviceType", 7}}));
    } else if (op == Op::kGetAllReporters) {
      reply(Value(Array{1, 2, 3}));
    } else if (op != Op::kKillService) {
      reply(op == Op::kSendMessage ? Value() : Value(true));
    }
  }

  std::atomic<int> requests{0};

 private:
  Handler handler_;
  std::mutex mu_;
  bool hold_ = false;                        // GUARDED_BY(mu_)
  std::vector<std::function<void()>> held_;  // GUARDED_BY(mu_)
};

// Accepts every connection with a new FakeExportedObject of the handler set here, and
// counts invalidations per connection.
class FakeDelegate final : public IpcListenerDelegate {
 public:
  struct Accepted {
    std::shared_ptr<std::atomic<int>> invalidations = std::make_shared<std::atomic<int>>(0);
    std::weak_ptr<FakeExportedObject> object;
    std::shared_ptr<HeldBytes> held;  // the connection's PeerHeldBytes
  };
  explicit FakeDelegate(FakeExportedObject::Handler handler = nullptr)
      : handler_(std::move(handler)) {}
  bool ShouldAcceptNewConnection(IpcListener&, std::shared_ptr<IpcConnection> c) override {
    auto object = std::make_shared<FakeExportedObject>(handler_);
    Accepted entry{.object = object, .held = c->PeerHeldBytes()};
    c->SetExportedObject(object);
    c->SetInvalidationHandler([count = entry.invalidations] { ++*count; });
    c->Resume();
    std::lock_guard lock(mu_);
    accepted_.push_back(entry);
    return true;
  }
  std::vector<Accepted> accepted() const {
    std::lock_guard lock(mu_);
    return accepted_;
  }
  int invalidations() const {
    int total = 0;
    for (const auto& entry : accepted()) total += *entry.invalidations;
    return total;
  }

 private:
  FakeExportedObject::Handler handler_;
  mutable std::mutex mu_;
  std::vector<Accepted> accepted_;
};

// A listener on `socket_path` (in a temporary folder by default), run on a thread of its own.
class ListenerHarness {
 public:
  explicit ListenerHarness(FakeExportedObject::Handler handler = nullptr,
                           LinuxIpcOptions options = {}, std::string socket_path = "")
      : socket_path_(socket_path.empty() ? dir_.path() + "/run/reporting.sock" : socket_path),
        delegate_(std::make_shared<FakeDelegate>(std::move(handler))) {
    options.socket_path = socket_path_;
    options.socket_activation = false;
    options.notify_ready = false;
    auto made = NewLinuxIpcListener(options, log_);
    error_ = made.error;
    if (!made.listener) return;
    listener_ = made.listener;
    listener_->SetDelegate(delegate_);
    thread_ = std::thread([listener = listener_] { listener->Resume(); });
  }
  ~ListenerHarness() { Stop(); }

  // Stops and waits for Resume to return.
  void Stop() {
    if (!thread_.joinable()) return;
    listener_->Stop();
    thread_.join();
  }
  bool listening() const { return listener_ != nullptr; }
  const std::string& error() const { return error_; }
  const std::string& socket_path() const { return socket_path_; }
  LogCapture& log() { return *log_; }
  FakeDelegate& delegate() { return *delegate_; }

 private:
  TempDir dir_;
  std::string socket_path_, error_;
  std::shared_ptr<LogCapture> log_ = std::make_shared<LogCapture>();
  std::shared_ptr<FakeDelegate> delegate_;
  std::shared_ptr<IpcListener> listener_;
  std::thread thread_;
};

}  // namespace qn::testing
