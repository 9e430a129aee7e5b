#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "common/Frame.h"
#include "common/MsgPack.h"
#include "platform/ipc.h"
#include "platform/linux/linux_ipc.h"
#include "tests/fakes/LogCapture.h"
#include "tests/fakes/TempDir.h"

namespace qn::testing {

// Polls `condition` until it holds or `timeout` passes; for conditions with no event to
// wait on (log lines written by another thread).
bool Eventually(const std::function<bool()>& condition,
                std::chrono::milliseconds timeout = std::chrono::seconds(20));

// An exported object whose behaviour the test sets; by default it answers each request
// with a value of the type its operation replies with, right away:
//   bool true; service type = the reporter ID argument; the reporterID:valid: dictionary
//   {"reporterID": ID, "serviceType": 7}; reporter IDs [1, 2, 3]; sendMessage nil;
//   killService: no reply.
class FakeExportedObject final : public IpcExportedObject {
 public:
  using Handler = std::function<void(protocol::Op, const Array&, IpcReply)>;
  struct Call {
    protocol::Op op;
    Array args;
  };

  explicit FakeExportedObject(Handler handler = nullptr) : handler_(std::move(handler)) {}
  void HandleRequest(protocol::Op op, const Array& args, IpcReply reply) override;
  // Requests count as taken in at once, unless the test holds them back (HoldTakenIn).
  void AfterRequests(std::function<void()> done) override;

  // While held, AfterRequests keeps its callbacks; releasing runs the ones kept.
  void HoldTakenIn(bool hold);

  static void DefaultReply(protocol::Op op, const Array& args, const IpcReply& reply);

  std::vector<Call> calls() const;

 private:
  Handler handler_;
  mutable std::mutex mu_;
  std::vector<Call> calls_;                  // GUARDED_BY(mu_)
  bool hold_ = false;                        // GUARDED_BY(mu_)
  std::vector<std::function<void()>> held_;  // GUARDED_BY(mu_)
};

// Accepts every connection, gives each a new FakeExportedObject with the handler set
// here, counts invalidations per connection.
class FakeDelegate final : public IpcListenerDelegate {
 public:
  struct Accepted {
    std::shared_ptr<IpcConnection> connection;
    std::shared_ptr<std::atomic<int>> invalidations;
    std::weak_ptr<FakeExportedObject> object;
  };

  explicit FakeDelegate(FakeExportedObject::Handler handler = nullptr)
      : handler_(std::move(handler)) {}
  bool ShouldAcceptNewConnection(IpcListener& listener,
                                 std::shared_ptr<IpcConnection> connection) override;

  std::vector<Accepted> accepted() const;
  int invalidations() const;  // over all connections

  std::atomic<bool> accept{true};

 private:
  FakeExportedObject::Handler handler_;
  mutable std::mutex mu_;
  std::vector<Accepted> accepted_;
};

// A listener on a socket in a temporary folder, run on a thread of its own.
class ListenerHarness {
 public:
  explicit ListenerHarness(FakeExportedObject::Handler handler = nullptr,
                           LinuxIpcOptions options = {});
  ~ListenerHarness();  // stops and joins

  void Stop();  // stops and waits for Resume to return
  const std::string& socket_path() const { return socket_path_; }
  LogCapture& log() { return *log_; }
  FakeDelegate& delegate() { return *delegate_; }
  IpcListener& listener() { return *listener_; }
  const std::string& dir() const { return dir_.path(); }

 private:
  TempDir dir_;
  std::string socket_path_;
  std::shared_ptr<LogCapture> log_ = std::make_shared<LogCapture>();
  std::shared_ptr<FakeDelegate> delegate_;
  std::shared_ptr<IpcListener> listener_;
  std::thread thread_;
};

// A Unix socket of `type` (SOCK_STREAM, ...) bound to `path`: its descriptor, or -1 (nothing
// left open) when binding fails. The caller closes it.
int BindUnixSocket(int type, const std::string& path);

}  // namespace qn::testing
