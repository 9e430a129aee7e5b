#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "common/Protocol.h"
#include "common/Value.h"

namespace qn {

// Framing of the wire protocol: each frame is a 4-byte big-endian body length followed by
// the body (one MessagePack value). A length of 0 or above protocol::kMaxBodyBytes is bad.

inline constexpr std::size_t kFrameHeaderBytes = 4;

// Appends one frame holding the MessagePack encoding of `body` to `buffer`.
// Returns false, leaving `buffer` as it was, when the encoding is over kMaxBodyBytes (such
// a frame would be refused by the peer).
bool AppendFrame(std::string& buffer, const Value& body);

// Splits a byte stream into frame bodies. Feed it whatever arrives, in any chunks (one byte
// at a time is fine); Next() then yields the complete bodies in order. A bad length is a
// permanent error, reported as soon as its 4 header bytes have arrived, without waiting for
// the body. The decoder holds at most the unconsumed part of what was fed: consumed frames
// are dropped at the next Feed or Next, and bytes fed after an error are discarded.
//
// Not thread-safe: one decoder per connection, used from one thread (or strand) at a time.
class FrameDecoder {
 public:
  // Appends bytes received from the peer.
  void Feed(std::string_view bytes);

  // The next complete body, or nullopt when more bytes are needed or the stream has failed
  // (then error() says why). The view points into the decoder and stays valid until the
  // next call of Feed or Next.
  std::optional<std::string_view> Next();

  // The permanent error (code kBadLength), once a bad length has been seen.
  const std::optional<protocol::RequestProblem>& error() const { return error_; }

  // Bytes held that were fed but not yet returned by Next (including a partial frame).
  std::size_t buffered() const { return buffer_.size() - consumed_; }

  // Bytes still to come before the next frame is whole: 0 when it is whole, when its
  // header has not fully arrived, or when its length is bad.
  std::size_t Missing() const;

 private:
  void DropConsumed();

  std::string buffer_;
  std::size_t consumed_ = 0;  // bytes at the front of buffer_ already returned by Next
  std::optional<protocol::RequestProblem> error_;
};

}  // namespace qn
