#pragma once

#include <string>
#include <string_view>
#include <variant>

#include "common/Protocol.h"
#include "common/Value.h"

namespace qn {

// MessagePack encoding of Values, as the wire protocol carries them (msgpack-cxx underneath:
// msgpack::packer writes, msgpack::parse with a visitor reads).
//
// Encoding: null, bool; integers in their smallest encoding (non-negative ones as unsigned
// formats); doubles as float64; strings as str; Data as bin; Dates as the timestamp
// extension (type -1, the 32-, 64- or 96-bit form, whichever is smallest); arrays; maps with
// keys of any kind, in the dictionary's order.
//
// Thread-safe: the functions keep no state.

// Appends the encoding of `value` to `out`.
// REQUIRES: every string, data and collection inside `value` is shorter than 2^32
// (bytes or elements). A date that is not finite is encoded as the epoch.
void AppendMsgPack(std::string& out, const Value& value);

// The encoding of `value` as a new string. Same requirements as AppendMsgPack.
std::string EncodeMsgPack(const Value& value);

// Decodes `body`, which must hold exactly one MessagePack value, into a Value.
//
// Hostile input is expected: nesting of arrays and maps deeper than protocol::kMaxDepth
// fails with ConnectionError::kTooDeep; anything else that is not exactly one valid value
// (truncation, a length or count larger than the bytes that remain, the reserved byte 0xc1,
// an extension other than the timestamp, bytes after the value) fails with
// ConnectionError::kBadMessagePack. The message says what was wrong and at which byte
// offset. Memory use is bounded by a small multiple of body.size(); no exception escapes.
//
// Integers decode as Value integers (unsigned ones up to INT64_MAX become int64); float32
// and float64 as double; str as string (its bytes as they are, UTF-8 is not checked); bin as
// Data; the timestamp extension as Date; maps as Dictionary (a repeated key keeps its first
// position and its last value).
std::variant<Value, protocol::RequestProblem> DecodeMsgPack(std::string_view body);

}  // namespace qn
