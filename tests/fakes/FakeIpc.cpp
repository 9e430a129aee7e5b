#include "tests/fakes/FakeIpc.h"

#include <stdexcept>

namespace qn::testing {

FakeIpcConnection::FakeIpcConnection(pid_t pid, uid_t uid) : pid_(pid), uid_(uid) {}

FakeIpcConnection::~FakeIpcConnection() = default;

std::string FakeIpcConnection::Description() const {
  return "<FakeIpcConnection pid=" + std::to_string(pid_) + ">";
}

void FakeIpcConnection::SetExportedObject(std::shared_ptr<IpcExportedObject> object) {
  std::lock_guard lock(mu_);
  exported_ = std::move(object);
}

void FakeIpcConnection::SetInterruptionHandler(std::function<void()> handler) {
  std::lock_guard lock(mu_);
  interruption_ = std::move(handler);
}

void FakeIpcConnection::SetInvalidationHandler(std::function<void()> handler) {
  std::lock_guard lock(mu_);
  invalidation_ = std::move(handler);
}

void FakeIpcConnection::Resume() {
  std::lock_guard lock(mu_);
  resumed_ = true;
}

std::shared_ptr<IpcExportedObject> FakeIpcConnection::exportedObject() const {
  std::lock_guard lock(mu_);
  return exported_;
}

bool FakeIpcConnection::resumed() const {
  std::lock_guard lock(mu_);
  return resumed_;
}

bool FakeIpcConnection::ended() const {
  std::lock_guard lock(shared_->mu);
  return shared_->ended;
}

void FakeIpcConnection::Request(protocol::Op op, Array args, std::uint32_t request_id) {
  auto object = exportedObject();
  if (!object) throw std::logic_error("FakeIpcConnection: no exported object");
  std::weak_ptr<Shared> weak = shared_;
  object->HandleRequest(op, args, [weak, request_id](Value result) {
    auto shared = weak.lock();
    if (!shared) return;
    std::lock_guard lock(shared->mu);
    if (shared->ended) return;
    shared->replies.push_back(Reply{request_id, std::move(result)});
  });
}

std::vector<FakeIpcConnection::Reply> FakeIpcConnection::Replies() const {
  std::lock_guard lock(shared_->mu);
  return shared_->replies;
}

void FakeIpcConnection::Interrupt() {
  std::function<void()> handler;
  {
    std::lock_guard lock(mu_);
    handler = interruption_;
  }
  if (handler) handler();
}

void FakeIpcConnection::Invalidate() {
  {
    std::lock_guard lock(shared_->mu);
    if (shared_->ended) return;
    shared_->ended = true;
  }
  std::function<void()> handler;
  {
    std::lock_guard lock(mu_);
    handler = invalidation_;
  }
  if (handler) handler();
  std::shared_ptr<IpcExportedObject> exported;
  std::function<void()> interruption, invalidation;
  {
    std::lock_guard lock(mu_);
    exported = std::move(exported_);
    interruption = std::move(interruption_);
    invalidation = std::move(invalidation_);
  }
  // Released here, outside the lock: the exported object's release may run destructors
  // that log.
}

void FakeIpcListener::SetDelegate(std::shared_ptr<IpcListenerDelegate> delegate) {
  std::lock_guard lock(mu_);
  delegate_ = std::move(delegate);
}

void FakeIpcListener::Resume() {
  std::lock_guard lock(mu_);
  resumed_ = true;
}

void FakeIpcListener::Stop() {
  std::lock_guard lock(mu_);
  stopped_ = true;
}

bool FakeIpcListener::Accept(std::shared_ptr<IpcConnection> connection) {
  std::shared_ptr<IpcListenerDelegate> delegate;
  {
    std::lock_guard lock(mu_);
    delegate = delegate_;
  }
  return delegate ? delegate->ShouldAcceptNewConnection(*this, std::move(connection)) : false;
}

bool FakeIpcListener::resumed() const {
  std::lock_guard lock(mu_);
  return resumed_;
}

bool FakeIpcListener::stopped() const {
  std::lock_guard lock(mu_);
  return stopped_;
}

}  // namespace qn::testing
