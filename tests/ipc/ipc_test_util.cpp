#include "tests/ipc/ipc_test_util.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>
#include <cerrno>
#include <filesystem>

namespace qn::testing {

bool Eventually(const std::function<bool()>& condition, std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  return true;
}

void FakeExportedObject::HandleRequest(protocol::Op op, const Array& args, IpcReply reply) {
  {
    std::lock_guard lock(mu_);
    calls_.push_back(Call{op, args});
  }
  if (handler_) {
    handler_(op, args, std::move(reply));
  } else {
    DefaultReply(op, args, reply);
  }
}

void FakeExportedObject::AfterRequests(std::function<void()> done) {
  {
    std::lock_guard lock(mu_);
    if (hold_) {
      held_.push_back(std::move(done));
      return;
    }
  }
  done();
}

void FakeExportedObject::HoldTakenIn(bool hold) {
  std::vector<std::function<void()>> release;
  {
    std::lock_guard lock(mu_);
    hold_ = hold;
    if (!hold) release.swap(held_);
  }
  for (auto& done : release) done();
}

void FakeExportedObject::DefaultReply(protocol::Op op, const Array& args, const IpcReply& reply) {
  using protocol::Op;
  switch (op) {
    case Op::kGetServiceNameForReporterID:
      reply(Value(static_cast<std::uint16_t>(args[0].as_int64().value_or(0) & 0xFFFF)));
      return;
    case Op::kReporterIDValid:
      reply(Value(Dictionary{{"reporterID", args[0]}, {"serviceType", 7}}));
      return;
    case Op::kGetAllReporters:
      reply(Value(Array{1, 2, 3}));
      return;
    case Op::kSendMessage:
      reply(Value());
      return;
    case Op::kKillService:
      return;
    default:
      reply(Value(true));
      return;
  }
}

std::vector<FakeExportedObject::Call> FakeExportedObject::calls() const {
  std::lock_guard lock(mu_);
  return calls_;
}

bool FakeDelegate::ShouldAcceptNewConnection(IpcListener&,
                                             std::shared_ptr<IpcConnection> connection) {
  Accepted entry;
  entry.connection = connection;
  entry.invalidations = std::make_shared<std::atomic<int>>(0);
  auto object = std::make_shared<FakeExportedObject>(handler_);
  entry.object = object;
  {
    std::lock_guard lock(mu_);
    accepted_.push_back(entry);
  }
  if (!accept) return false;
  connection->SetExportedObject(object);
  connection->SetInvalidationHandler([count = entry.invalidations] { ++*count; });
  connection->Resume();
  return true;
}

std::vector<FakeDelegate::Accepted> FakeDelegate::accepted() const {
  std::lock_guard lock(mu_);
  return accepted_;
}

int FakeDelegate::invalidations() const {
  std::lock_guard lock(mu_);
  int total = 0;
  for (const auto& entry : accepted_) total += *entry.invalidations;
  return total;
}

ListenerHarness::ListenerHarness(FakeExportedObject::Handler handler, LinuxIpcOptions options)
    : delegate_(std::make_shared<FakeDelegate>(std::move(handler))) {
  socket_path_ = dir_.path() + "/run/reporting.sock";
  options.socket_path = socket_path_;
  options.socket_activation = false;
  options.notify_ready = false;
  auto made = NewLinuxIpcListener(options, log_);
  if (!made.listener) {
    ADD_FAILURE() << "listener: " << made.error;
    return;
  }
  listener_ = made.listener;
  listener_->SetDelegate(delegate_);
  thread_ = std::thread([listener = listener_] { listener->Resume(); });
}

ListenerHarness::~ListenerHarness() { Stop(); }

void ListenerHarness::Stop() {
  if (!thread_.joinable()) return;
  listener_->Stop();
  thread_.join();
}

int BindUnixSocket(int type, const std::string& path) {
  const int fd = ::socket(AF_UNIX, type | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
  if (::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
    ::close(fd);
    return -1;
  }
  return fd;
}

}  // namespace qn::testing
