#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <variant>
#include <vector>

#include "common/Value.h"

namespace qn::protocol {

// Wire protocol version 1. A frame is a 4-byte big-endian body length followed by one
// MessagePack value. Requests are [op, request_id, args...]; replies [request_id, result].
inline constexpr std::uint32_t kVersion = 1;
inline constexpr std::size_t kMaxBodyBytes = 1 << 20;  // 1 MiB
inline constexpr int kMaxDepth = 64;                   // nesting of arrays and maps
inline constexpr std::uint32_t kConnectionErrorRequestId = 0;
inline constexpr const char* kIpcErrorDomain = "com.norvel.quenta.ipc";

// The operations, numbered by their position in the client protocol.
enum class Op : std::uint32_t {
  kCreateReportingSession = 1,
  kSetServiceType = 2,
  kGetServiceNameForReporterID = 3,
  kSetConfiguration = 4,
  kStartReportingSession = 5,
  kSendMessage = 6,
  kStopReportingSession = 7,
  kDestroyReportingSession = 8,
  kReporterIDValid = 9,
  kGetAllReporters = 10,
  kKillService = 11,
};
inline constexpr std::uint32_t kFirstOp = 1;
inline constexpr std::uint32_t kLastOp = 11;

// What an argument must be on the wire. Integers may use any MessagePack integer encoding
// whose value fits the type.
enum class ArgKind {
  kInt64,             // reporter ID
  kUInt16,            // service type, message type
  kUInt32,            // category
  kDictionary,        // message, configuration
  kInt64ArrayOrNull,  // reporter ID list, or nil for "all"
};

// The argument kinds of `op`, in order. REQUIRES: kFirstOp <= op <= kLastOp.
std::span<const ArgKind> ArgumentsOf(Op op);

// The operation's name as the protocol declares it, e.g. "createReportingSession:reply:".
const char* OpName(Op op);

// Codes of connection-level errors ([0, {"domain", "code", "message"}]).
enum class ConnectionError : std::int64_t {
  kBadLength = 1,           // a frame length of 0 or over kMaxBodyBytes
  kBadMessagePack = 2,      // the body is not exactly one valid MessagePack value
  kTooDeep = 3,             // nesting over kMaxDepth
  kBadRequest = 4,          // not an array [op, request_id, ...] with integer op and request_id
  kUnknownOp = 5,           // op outside 1..11
  kBadArguments = 6,        // wrong count or kind of arguments
  kTooMuchQueued = 7,       // the peer does not read its replies
  kTooManyConnections = 8,  // the daemon already serves as many connections as it may
  kReplyTooLarge = 9,       // a reply does not fit in a frame
  kNotPermitted = 10,       // the peer's uid may not make this request
};
inline constexpr std::int64_t kLastConnectionError = 10;

// Whether only root and the daemon's own uid may make requests of `op` (killService:).
inline bool IsPrivileged(Op op) { return op == Op::kKillService; }

// Room to keep for the reply to a request of `op` while the service works on it, so that
// requests already handed over cannot make more reply bytes than a budget allows: a whole
// frame for getAllReporters (its ID list grows with the sessions), a short error reply's
// worth for every other operation (their replies are a flag, a name or an error).
inline std::size_t ReplyRoomOf(Op op) { return op == Op::kGetAllReporters ? kMaxBodyBytes : 256; }

// Checks a decoded request against the operation table. On success returns the op and
// request id and leaves the arguments (args[2..]) as they are; on failure returns the
// error code and a message fit for the error frame.
struct RequestHeader {
  Op op;
  std::uint32_t request_id;
};
struct RequestProblem {
  ConnectionError code;
  std::string message;
};
std::variant<RequestHeader, RequestProblem> ValidateRequest(const Value& request);

// The connection error frame body: [0, {"domain": ..., "code": ..., "message": ...}].
Value MakeConnectionError(ConnectionError code, const std::string& message);

}  // namespace qn::protocol
