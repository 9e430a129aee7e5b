#pragma once

#include <sys/types.h>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "common/Protocol.h"
#include "common/Value.h"
#include "platform/ipc.h"

namespace qn::testing {

// An IpcConnection driven by the test: it records what the service installs on it
// (exported object, handlers, Resume), hands requests to the exported object as the IPC
// layer would, records the replies, and ends when the test says so. Thread-safe.
class FakeIpcConnection final : public IpcConnection {
 public:
  struct Reply {
    std::uint32_t request_id;
    Value result;
  };

  explicit FakeIpcConnection(pid_t pid, uid_t uid = 1000);
  ~FakeIpcConnection() override;

  pid_t PeerPid() const override { return pid_; }
  uid_t PeerUid() const override { return uid_; }
  std::string Description() const override;
  void SetExportedObject(std::shared_ptr<IpcExportedObject> object) override;
  void SetInterruptionHandler(std::function<void()> handler) override;
  void SetInvalidationHandler(std::function<void()> handler) override;
  void Resume() override;

  // Test side.
  std::shared_ptr<IpcExportedObject> exportedObject() const;
  bool resumed() const;
  bool ended() const;

  // Hands a request (arguments already checked) to the exported object, on this thread.
  // Replies made before the connection ends are recorded under `request_id`.
  // REQUIRES: an exported object is set.
  void Request(protocol::Op op, Array args, std::uint32_t request_id);
  std::vector<Reply> Replies() const;

  // Calls the interruption handler (the connection stays open).
  void Interrupt();
  // Ends the connection as the IPC layer does: calls the invalidation handler once, then
  // lets go of the exported object and the handlers. Later replies are dropped.
  void Invalidate();

 private:
  struct Shared {
    std::mutex mu;
    bool ended = false;
    std::vector<Reply> replies;
  };

  const pid_t pid_;
  const uid_t uid_;
  const std::shared_ptr<Shared> shared_ = std::make_shared<Shared>();
  mutable std::mutex mu_;
  std::shared_ptr<IpcExportedObject> exported_;  // GUARDED_BY(mu_)
  std::function<void()> interruption_;           // GUARDED_BY(mu_)
  std::function<void()> invalidation_;           // GUARDED_BY(mu_)
  bool resumed_ = false;                         // GUARDED_BY(mu_)
};

// An IpcListener whose connections the test offers to the delegate. Thread-safe.
class FakeIpcListener final : public IpcListener {
 public:
  void SetDelegate(std::shared_ptr<IpcListenerDelegate> delegate) override;
  // Records the call and returns at once (the test drives everything).
  void Resume() override;
  void Stop() override;

  // Offers `connection` to the delegate, as an accepted socket would be; returns its answer
  // (false without a delegate).
  bool Accept(std::shared_ptr<IpcConnection> connection);
  bool resumed() const;
  bool stopped() const;

 private:
  mutable std::mutex mu_;
  std::shared_ptr<IpcListenerDelegate> delegate_;  // GUARDED_BY(mu_)
  bool resumed_ = false;                           // GUARDED_BY(mu_)
  bool stopped_ = false;                           // GUARDED_BY(mu_)
};

}  // namespace qn::testing
