// The JSON writer of summary files and store rows, and the JSON reader: whatever parses
// writes back (compact and pretty) to text that parses to an equal value; whatever
// MessagePack a client sends serialises or is refused without harm.
#include <cstddef>
#include <cstdint>
#include <string_view>
#include <variant>

#include "common/Json.h"
#include "common/MsgPack.h"
#include "tests/fuzz/FuzzInput.h"

namespace {

void RoundTrip(const qn::Value& value) {
  for (auto style : {qn::JsonStyle::kCompact, qn::JsonStyle::kPretty}) {
    std::string text;
    if (qn::ToJson(value, style, text)) continue;  // refused: not a JSON value
    qn::Value back;
    qn::fuzz::Check(!qn::ParseJson(text, back) && back == value);
  }
  (void)qn::ToJsonLenient(value, qn::JsonStyle::kPretty);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string_view input(reinterpret_cast<const char*>(data), size);
  qn::Value parsed;
  if (!qn::ParseJson(input, parsed)) RoundTrip(parsed);
  auto decoded = qn::DecodeMsgPack(input);
  if (auto* value = std::get_if<qn::Value>(&decoded)) RoundTrip(*value);
  return 0;
}
