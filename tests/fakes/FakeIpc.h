#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>

#include "common/Protocol.h"
#include "platform/ipc.h"

namespace qn::testing {

// An IpcConnection driven by the test: it keeps what the service installs on it, hands
// requests to the exported object as the IPC layer would (dropping the replies), and ends
// when the test says so. Thread-safe.
class FakeIpcConnection final : public IpcConnection {
 public:
  explicit FakeIpcConnection(pid_t pid, uid_t uid = 1000) : pid_(pid), uid_(uid) {}
  pid_t PeerPid() const override { return pid_; }
  uid_t PeerUid() const override { return uid_; }
  std::shared_ptr<HeldBytes> PeerHeldBytes() const override { return held_; }
  std::string Description() const override {
    return "<FakeIpcConnection pid=" + std::to_string(pid_) + ">";
  }
  void SetExportedObject(std::shared_ptr<IpcExportedObject> object) override {
    std::lock_guard lock(mu_);
    exported_ = std::move(object);
  }
  void SetInterruptionHandler(std::function<void()> handler) override {
    std::lock_guard lock(mu_);
    interruption_ = std::move(handler);
  }
  void SetInvalidationHandler(std::function<void()> handler) override {
    std::lock_guard lock(mu_);
    invalidation_ = std::move(handler);
  }
  void Resume() override {}

  // Hands a request (arguments already checked) to the exported object, on this thread.
  void Request(protocol::Op op, const Array& args) {
    std::shared_ptr<IpcExportedObject> object;
    {
      std::lock_guard lock(mu_);
      object = exported_;
    }
    if (!object) throw std::logic_error("FakeIpcConnection: no exported object");
    object->HandleRequest(op, args, [](Value) {});
  }
  // Calls the interruption handler (the connection stays open).
  void Interrupt() {
    std::unique_lock lock(mu_);
    auto handler = interruption_;
    lock.unlock();
    if (handler) handler();
  }
  // Ends the connection as the IPC layer does: calls the invalidation handler once, then
  // lets go of the exported object and the handlers (released outside the lock: their
  // destructors may log).
  void Invalidate() {
    std::unique_lock lock(mu_);
    if (ended_) return;
    ended_ = true;
    auto handler = invalidation_;
    lock.unlock();
    if (handler) handler();
    lock.lock();
    auto exported = std::move(exported_);
    auto interruption = std::move(interruption_), invalidation = std::move(invalidation_);
    lock.unlock();
  }

 private:
  const pid_t pid_;
  const uid_t uid_;
  const std::shared_ptr<HeldBytes> held_ = std::make_shared<HeldBytes>();
  std::mutex mu_;
  std::shared_ptr<IpcExportedObject> exported_;  // GUARDED_BY(mu_)
  std::function<void()> interruption_;           // GUARDED_BY(mu_)
  std::function<void()> invalidation_;           // GUARDED_BY(mu_)
  bool ended_ = false;                           // GUARDED_BY(mu_)
};

// An IpcListener whose connections the test offers to the delegate.
class FakeIpcListener final : public IpcListener {
 public:
  void SetDelegate(std::shared_ptr<IpcListenerDelegate> delegate) override {
    std::lock_guard lock(mu_);
    delegate_ = std::move(delegate);
  }
  void Resume() override {}
  void Stop() override {}
  // Offers `connection` to the delegate, as an accepted socket would be; returns its answer.
  bool Accept(std::shared_ptr<IpcConnection> connection) {
    std::unique_lock lock(mu_);
    auto delegate = delegate_;
    lock.unlock();
    return delegate && delegate->ShouldAcceptNewConnection(*this, std::move(connection));
  }

 private:
  std::mutex mu_;
  std::shared_ptr<IpcListenerDelegate> delegate_;  // GUARDED_BY(mu_)
};

}  // namespace qn::testing
