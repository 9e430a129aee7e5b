#include "common/Frame.h"

#include "common/Format.h"
#include "common/MsgPack.h"

namespace qn {

bool AppendFrame(std::string& buffer, const Value& body) {
  const std::size_t header_at = buffer.size();
  buffer.append(kFrameHeaderBytes, '\0');
  AppendMsgPack(buffer, body);
  const std::size_t length = buffer.size() - header_at - kFrameHeaderBytes;
  if (length > protocol::kMaxBodyBytes) {
    buffer.resize(header_at);
    return false;
  }
  for (std::size_t i = 0; i < kFrameHeaderBytes; ++i) {
    buffer[header_at + i] = static_cast<char>((length >> (8 * (kFrameHeaderBytes - 1 - i))) & 0xff);
  }
  return true;
}

void FrameDecoder::DropConsumed() {
  if (consumed_ == 0) return;
  buffer_.erase(0, consumed_);
  consumed_ = 0;
}

void FrameDecoder::Feed(std::string_view bytes) {
  if (error_) return;
  DropConsumed();
  buffer_.append(bytes);
}

namespace {
// The body length in the 4-byte header at `at`.
std::uint32_t BodyLength(const char* at) {
  const auto* header = reinterpret_cast<const unsigned char*>(at);
  return (std::uint32_t{header[0]} << 24) | (std::uint32_t{header[1]} << 16) |
         (std::uint32_t{header[2]} << 8) | std::uint32_t{header[3]};
}
}  // namespace

std::size_t FrameDecoder::Missing() const {
  if (error_ || buffered() < kFrameHeaderBytes) return 0;
  const std::uint32_t length = BodyLength(buffer_.data() + consumed_);
  if (length == 0 || length > protocol::kMaxBodyBytes) return 0;
  const std::size_t whole = kFrameHeaderBytes + length;
  return whole > buffered() ? whole - buffered() : 0;
}

std::optional<std::string_view> FrameDecoder::Next() {
  if (error_) return std::nullopt;
  if (consumed_ == buffer_.size()) {
    // Everything returned: release the storage of large frames, keep small buffers (an
    // idle connection holds at most this much).
    buffer_.clear();
    consumed_ = 0;
    if (buffer_.capacity() > 16 * 1024) std::string().swap(buffer_);
    return std::nullopt;
  }
  if (buffered() < kFrameHeaderBytes) return std::nullopt;
  const std::uint32_t length = BodyLength(buffer_.data() + consumed_);
  if (length == 0 || length > protocol::kMaxBodyBytes) {
    error_ =
        protocol::RequestProblem{protocol::ConnectionError::kBadLength,
                                 StringWithFormat("bad frame length %u (must be 1 to %zu bytes)",
                                                  length, protocol::kMaxBodyBytes)};
    buffer_.clear();
    buffer_.shrink_to_fit();
    consumed_ = 0;
    return std::nullopt;
  }
  if (buffered() - kFrameHeaderBytes < length) return std::nullopt;
  std::string_view body(buffer_.data() + consumed_ + kFrameHeaderBytes, length);
  consumed_ += kFrameHeaderBytes + length;
  return body;
}

}  // namespace qn
