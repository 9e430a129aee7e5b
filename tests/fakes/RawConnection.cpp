#include "tests/fakes/RawConnection.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "common/MsgPack.h"

namespace qn::testing {

RawConnection::RawConnection(const std::string& socket_path, int receive_buffer) {
  fd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd_ < 0) return;
  if (receive_buffer > 0) {
    ::setsockopt(fd_, SOL_SOCKET, SO_RCVBUF, &receive_buffer, sizeof receive_buffer);
  }
  if (!socket_path.empty()) Connect(socket_path);
}

bool RawConnection::Connect(const std::string& socket_path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, socket_path.c_str(), sizeof address.sun_path - 1);
  connected_ = ::connect(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
  return connected_;
}

RawConnection::~RawConnection() {
  if (fd_ >= 0) ::close(fd_);
}

bool RawConnection::Write(const std::string& bytes) {
  std::size_t written = 0;
  while (written < bytes.size()) {
    ssize_t n = ::send(fd_, bytes.data() + written, bytes.size() - written, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    written += static_cast<std::size_t>(n);
  }
  return true;
}

std::string RawConnection::Frame(const Value& body) {
  std::string frame;
  AppendFrame(frame, body);
  return frame;
}

std::string RawConnection::RawFrame(const std::string& body) {
  const auto n = static_cast<std::uint32_t>(body.size());
  std::string frame{static_cast<char>(n >> 24), static_cast<char>(n >> 16),
                    static_cast<char>(n >> 8), static_cast<char>(n)};
  return frame + body;
}

bool RawConnection::Receive(std::chrono::steady_clock::time_point deadline, bool* closed) {
  char buffer[65536];
  for (;;) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return false;
    pollfd p{fd_, POLLIN, 0};
    if (::poll(&p, 1, static_cast<int>(left.count())) <= 0) continue;
    ssize_t n = ::recv(fd_, buffer, sizeof buffer, 0);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      *closed = true;
      return false;
    }
    decoder_.Feed(std::string_view(buffer, static_cast<std::size_t>(n)));
    while (auto body = decoder_.Next()) {
      auto decoded = DecodeMsgPack(*body);
      if (auto* value = std::get_if<Value>(&decoded)) pending_.push_back(*value);
    }
    return true;
  }
}

std::optional<Value> RawConnection::ReadFrame(std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  bool closed = false;
  while (pending_.empty()) {
    if (!Receive(deadline, &closed)) return std::nullopt;
  }
  Value frame = pending_.front();
  pending_.erase(pending_.begin());
  return frame;
}

std::vector<Value> RawConnection::ReadUntilClosed(bool* closed, std::chrono::milliseconds timeout) {
  *closed = false;
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (Receive(deadline, closed)) {
  }
  std::vector<Value> frames = std::move(pending_);
  pending_.clear();
  return frames;
}

bool RawConnection::WaitForPeerClose(std::chrono::milliseconds timeout) {
  pollfd p{fd_, POLLRDHUP, 0};
  return ::poll(&p, 1, static_cast<int>(timeout.count())) == 1 &&
         (p.revents & (POLLRDHUP | POLLHUP)) != 0;
}

}  // namespace qn::testing
