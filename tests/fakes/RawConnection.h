#pragma once

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <deque>
#include <optional>
#include <string>
#include <vector>

#include "common/Frame.h"
#include "common/MsgPack.h"

namespace qn::testing {

// A raw connection to a service socket, for bytes the client library would never send.
class RawConnection {
 public:
  using Clock = std::chrono::steady_clock;
  // Connects at once unless `socket_path` is empty (then Connect() does it later).
  explicit RawConnection(const std::string& socket_path, int receive_buffer = 0)
      : fd_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    if (receive_buffer > 0) {
      ::setsockopt(fd_, SOL_SOCKET, SO_RCVBUF, &receive_buffer, sizeof receive_buffer);
    }
    if (!socket_path.empty()) Connect(socket_path);
  }
  ~RawConnection() { ::close(fd_); }
  int fd() const { return fd_; }
  bool Connect(const std::string& socket_path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, socket_path.c_str(), sizeof address.sun_path - 1);
    return connected_ = ::connect(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
  }
  bool connected() const { return connected_; }

  // Ends this side's stream (the peer reads end of stream); replies can still be read.
  void EndStream() { ::shutdown(fd_, SHUT_WR); }

  // Writes every byte (false when the peer closed first).
  bool Write(const std::string& bytes) {
    for (std::size_t done = 0; done < bytes.size();) {
      const ssize_t n = ::send(fd_, bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
      if (n <= 0 && errno != EINTR) return false;
      if (n > 0) done += static_cast<std::size_t>(n);
    }
    return true;
  }
  // One frame: [4-byte big-endian length][MessagePack body], or `body` as it is.
  static std::string Frame(const Value& body) {
    std::string frame;
    AppendFrame(frame, body);
    return frame;
  }
  static std::string RawFrame(const std::string& body) {
    const auto n = static_cast<std::uint32_t>(body.size());
    return std::string{static_cast<char>(n >> 24), static_cast<char>(n >> 16),
                       static_cast<char>(n >> 8), static_cast<char>(n)} +
           body;
  }

  // The next decoded frame; nullopt when the peer closed or `timeout` passed first.
  std::optional<Value> ReadFrame(std::chrono::milliseconds timeout = std::chrono::seconds(30)) {
    const auto deadline = Clock::now() + timeout;
    bool closed = false;
    while (pending_.empty())
      if (!Receive(deadline, &closed)) return std::nullopt;
    Value frame = std::move(pending_.front());
    pending_.pop_front();
    return frame;
  }
  // Reads until the peer closes (then sets *closed) or `timeout` passes; returns the frames.
  std::vector<Value> ReadUntilClosed(bool* closed,
                                     std::chrono::milliseconds timeout = std::chrono::seconds(30)) {
    *closed = false;
    for (const auto deadline = Clock::now() + timeout; Receive(deadline, closed);) {
    }
    std::vector<Value> frames(pending_.begin(), pending_.end());
    pending_.clear();
    return frames;
  }

 private:
  // Receives once, waiting at most until `deadline`, and decodes what came. False when the
  // peer closed or the deadline passed.
  bool Receive(Clock::time_point deadline, bool* closed) {
    char buffer[65536];
    for (;;) {
      const auto left =
          std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
      if (left <= 0) return false;
      pollfd p{fd_, POLLIN, 0};
      if (::poll(&p, 1, static_cast<int>(left)) <= 0) continue;
      const ssize_t n = ::recv(fd_, buffer, sizeof buffer, 0);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return *closed = true, false;
      decoder_.Feed(std::string_view(buffer, static_cast<std::size_t>(n)));
      while (auto body = decoder_.Next()) {
        auto decoded = DecodeMsgPack(*body);
        if (auto* value = std::get_if<Value>(&decoded)) pending_.push_back(*value);
      }
      return true;
    }
  }

  int fd_;
  bool connected_ = false;
  FrameDecoder decoder_;
  std::deque<Value> pending_;  // decoded, not yet returned
};

}  // namespace qn::testing
