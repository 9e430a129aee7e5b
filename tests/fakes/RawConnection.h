#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <vector>

#include "common/Frame.h"
#include "common/Value.h"

namespace qn::testing {

// A raw connection to a service socket, for bytes the client library would never send.
class RawConnection {
 public:
  // Connects at once unless `socket_path` is empty (then Connect() does it later).
  explicit RawConnection(const std::string& socket_path, int receive_buffer = 0);
  bool Connect(const std::string& socket_path);
  ~RawConnection();
  bool connected() const { return connected_; }

  // Writes every byte (false when the peer closed first).
  bool Write(const std::string& bytes);
  // One frame: [4-byte big-endian length][MessagePack body].
  static std::string Frame(const Value& body);
  static std::string RawFrame(const std::string& body);

  // The next decoded frame; nullopt when the peer closed or `timeout` passed first.
  std::optional<Value> ReadFrame(std::chrono::milliseconds timeout = std::chrono::seconds(30));
  // Reads until the peer closes or `timeout` passes; returns the decoded frames read and
  // sets *closed when the peer closed.
  std::vector<Value> ReadUntilClosed(bool* closed,
                                     std::chrono::milliseconds timeout = std::chrono::seconds(30));
  // Waits, without reading, until the peer has closed its end.
  bool WaitForPeerClose(std::chrono::milliseconds timeout = std::chrono::seconds(30));

 private:
  // Receives once (waiting at most until `deadline`) and decodes what came. Returns false
  // when the peer closed or the deadline passed.
  bool Receive(std::chrono::steady_clock::time_point deadline, bool* closed);

  int fd_ = -1;
  bool connected_ = false;
  FrameDecoder decoder_;
  std::vector<Value> pending_;  // decoded, not yet returned
};

}  // namespace qn::testing
