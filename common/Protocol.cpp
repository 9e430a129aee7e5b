#include "common/Protocol.h"

#include <array>

#include "common/Format.h"

namespace qn::protocol {

namespace {

struct OpInfo {
  const char* name;
  std::span<const ArgKind> args;
};

constexpr ArgKind kReporterOnly[] = {ArgKind::kInt64};
constexpr ArgKind kSetServiceTypeArgs[] = {ArgKind::kUInt16, ArgKind::kInt64};
constexpr ArgKind kSetConfigurationArgs[] = {ArgKind::kDictionary, ArgKind::kInt64};
constexpr ArgKind kSendMessageArgs[] = {ArgKind::kDictionary, ArgKind::kUInt32, ArgKind::kUInt16,
                                        ArgKind::kInt64ArrayOrNull};

// Indexed by op - kFirstOp, in the protocol's declared order.
constexpr std::array<OpInfo, kLastOp - kFirstOp + 1> kOps = {{
    {"createReportingSession:reply:", kReporterOnly},
    {"setServiceType:reportingSession:reply:", kSetServiceTypeArgs},
    {"getServiceNameForReporterID:reply:", kReporterOnly},
    {"setConfiguration:forReporterID:reply:", kSetConfigurationArgs},
    {"startReportingSessionForID:reply:", kReporterOnly},
    {"sendMessage:withCategory:andType:forReportingIDs:reply:", kSendMessageArgs},
    {"stopReportingSessionForID:reply:", kReporterOnly},
    {"destroyReportingSession:reply:", kReporterOnly},
    {"reporterID:valid:", kReporterOnly},
    {"getAllReporters:", {}},
    {"killService:", {}},
}};

const OpInfo& InfoOf(Op op) { return kOps[static_cast<std::uint32_t>(op) - kFirstOp]; }

const char* KindName(const Value& v) {
  switch (v.kind()) {
    case Value::Kind::kNull:
      return "nil";
    case Value::Kind::kBool:
      return "a boolean";
    case Value::Kind::kInt:
    case Value::Kind::kUInt:
      return "an integer";
    case Value::Kind::kDouble:
      return "a float";
    case Value::Kind::kString:
      return "a string";
    case Value::Kind::kData:
      return "binary data";
    case Value::Kind::kDate:
      return "a timestamp";
    case Value::Kind::kArray:
      return "an array";
    case Value::Kind::kDictionary:
      return "a map";
  }
  return "a value";
}

const char* Expected(ArgKind kind) {
  switch (kind) {
    case ArgKind::kInt64:
      return "a signed 64-bit integer";
    case ArgKind::kUInt16:
      return "an unsigned 16-bit integer";
    case ArgKind::kUInt32:
      return "an unsigned 32-bit integer";
    case ArgKind::kDictionary:
      return "a map";
    case ArgKind::kInt64ArrayOrNull:
      return "an array of signed 64-bit integers or nil";
  }
  return "?";
}

// What a value that does not fit is, for the message: integers by their value, anything
// else by its kind (a map could be large).
std::string Describe(const Value& v) {
  if (v.is_integer()) return v.Description();
  return KindName(v);
}

bool FitsUnsigned(const Value& v, std::uint64_t max) {
  auto u = v.as_uint64();
  return u && *u <= max;
}

// Whether `arg` fits `kind`; on failure `detail` names the element at fault, if any.
bool Fits(ArgKind kind, const Value& arg, std::string& detail) {
  switch (kind) {
    case ArgKind::kInt64:
      return arg.as_int64().has_value();
    case ArgKind::kUInt16:
      return FitsUnsigned(arg, UINT16_MAX);
    case ArgKind::kUInt32:
      return FitsUnsigned(arg, UINT32_MAX);
    case ArgKind::kDictionary:
      return arg.is_dictionary();
    case ArgKind::kInt64ArrayOrNull: {
      if (arg.is_null()) return true;
      const Array* ids = arg.as_array();
      if (!ids) return false;
      for (std::size_t i = 0; i < ids->size(); ++i) {
        if (!(*ids)[i].as_int64()) {
          detail = StringWithFormat(" (element %zu is %s)", i, Describe((*ids)[i]));
          return false;
        }
      }
      return true;
    }
  }
  return false;
}

RequestProblem Problem(ConnectionError code, std::string message) {
  return RequestProblem{code, std::move(message)};
}

}  // namespace

std::span<const ArgKind> ArgumentsOf(Op op) { return InfoOf(op).args; }

const char* OpName(Op op) {
  const auto n = static_cast<std::uint32_t>(op);
  if (n < kFirstOp || n > kLastOp) return "unknown operation";
  return InfoOf(op).name;
}

std::variant<RequestHeader, RequestProblem> ValidateRequest(const Value& request) {
  const Array* items = request.as_array();
  if (!items) {
    return Problem(ConnectionError::kBadRequest,
                   StringWithFormat("request must be an array, got %s", KindName(request)));
  }
  if (items->size() < 2) {
    return Problem(ConnectionError::kBadRequest,
                   StringWithFormat("request must be [op, request_id, args...], got %zu elements",
                                    items->size()));
  }
  const Value& op_value = (*items)[0];
  const Value& id_value = (*items)[1];
  if (!op_value.is_integer()) {
    return Problem(ConnectionError::kBadRequest,
                   StringWithFormat("op must be an integer, got %s", KindName(op_value)));
  }
  auto request_id = id_value.as_uint64();
  if (!id_value.is_integer() || !request_id || *request_id < 1 || *request_id > UINT32_MAX) {
    return Problem(ConnectionError::kBadRequest,
                   StringWithFormat("request_id must be an integer from 1 to %u, got %s",
                                    UINT32_MAX, Describe(id_value)));
  }
  auto op_number = op_value.as_uint64();
  if (!op_number || *op_number < kFirstOp || *op_number > kLastOp) {
    return Problem(ConnectionError::kUnknownOp,
                   StringWithFormat("unknown op %@ (request %u)", op_value,
                                    static_cast<std::uint32_t>(*request_id)));
  }
  const Op op = static_cast<Op>(*op_number);
  const RequestHeader header{op, static_cast<std::uint32_t>(*request_id)};

  const std::span<const ArgKind> kinds = ArgumentsOf(op);
  const std::size_t given = items->size() - 2;
  if (given != kinds.size()) {
    return Problem(ConnectionError::kBadArguments,
                   StringWithFormat("%s takes %zu arguments, got %zu (request %u)", OpName(op),
                                    kinds.size(), given, header.request_id));
  }
  for (std::size_t i = 0; i < kinds.size(); ++i) {
    const Value& arg = (*items)[i + 2];
    std::string detail;
    if (!Fits(kinds[i], arg, detail)) {
      return Problem(ConnectionError::kBadArguments,
                     StringWithFormat("argument %zu of %s must be %s, got %s%s (request %u)", i + 1,
                                      OpName(op), Expected(kinds[i]), Describe(arg), detail,
                                      header.request_id));
    }
  }
  return header;
}

Value MakeConnectionError(ConnectionError code, const std::string& message) {
  Dictionary error{
      {"domain", kIpcErrorDomain},
      {"code", static_cast<std::int64_t>(code)},
      {"message", message},
  };
  return Value(Array{Value(kConnectionErrorRequestId), Value(std::move(error))});
}

}  // namespace qn::protocol
