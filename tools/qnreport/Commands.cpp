#include "tools/qnreport/Commands.h"

#include <charconv>
#include <cmath>
#include <limits>

#include "common/Json.h"

namespace qn::qnreport {

namespace {

using Kind = Command::Kind;

struct Word {
  const char* word;
  Kind kind;
};

constexpr Word kWords[] = {
    {"create", Kind::kCreate},       {"type", Kind::kType},       {"name", Kind::kName},
    {"config", Kind::kConfig},       {"start", Kind::kStart},     {"send", Kind::kSend},
    {"stop", Kind::kStop},           {"destroy", Kind::kDestroy}, {"valid", Kind::kValid},
    {"reporters", Kind::kReporters}, {"kill", Kind::kKill},       {"sleep", Kind::kSleep},
    {"wait", Kind::kWait},
};

bool IsBlank(char c) { return c == ' ' || c == '\t' || c == '\r' || c == '\n'; }

// Splits a line into the words left to read, one at a time.
class Reader {
 public:
  explicit Reader(std::string_view text) : text_(text) {}

  void SkipBlanks() {
    while (pos_ < text_.size() && IsBlank(text_[pos_])) ++pos_;
  }
  bool AtEnd() {
    SkipBlanks();
    return pos_ >= text_.size();
  }
  char Peek() {
    SkipBlanks();
    return pos_ < text_.size() ? text_[pos_] : '\0';
  }
  std::string_view NextWord() {
    SkipBlanks();
    const std::size_t start = pos_;
    while (pos_ < text_.size() && !IsBlank(text_[pos_])) ++pos_;
    return text_.substr(start, pos_ - start);
  }
  // A JSON object or array starting here, to its matching bracket (strings and escapes
  // respected); empty when the text here does not start one or never closes it.
  std::string_view NextJson() {
    SkipBlanks();
    if (pos_ >= text_.size() || (text_[pos_] != '{' && text_[pos_] != '[')) return {};
    const std::size_t start = pos_;
    int depth = 0;
    bool in_string = false;
    for (std::size_t i = pos_; i < text_.size(); ++i) {
      const char c = text_[i];
      if (in_string) {
        if (c == '\\') {
          ++i;
        } else if (c == '"') {
          in_string = false;
        }
        continue;
      }
      if (c == '"') {
        in_string = true;
      } else if (c == '{' || c == '[') {
        ++depth;
      } else if (c == '}' || c == ']') {
        if (--depth == 0) {
          pos_ = i + 1;
          return text_.substr(start, pos_ - start);
        }
      }
    }
    return {};
  }

 private:
  std::string_view text_;
  std::size_t pos_ = 0;
};

// Decimal or 0x-hexadecimal, with an optional minus sign for signed types.
template <typename T>
std::optional<T> ParseInteger(std::string_view text) {
  bool negative = false;
  if (!text.empty() && (text[0] == '-' || text[0] == '+')) {
    negative = text[0] == '-';
    text.remove_prefix(1);
  }
  int base = 10;
  if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
    base = 16;
    text.remove_prefix(2);
  }
  if (text.empty()) return std::nullopt;
  std::uint64_t magnitude = 0;
  auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), magnitude, base);
  if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  if (negative) {
    if constexpr (std::is_signed_v<T>) {
      const auto limit = static_cast<std::uint64_t>(std::numeric_limits<T>::max()) + 1;  // |min|
      if (magnitude > limit) return std::nullopt;
      return static_cast<T>(0 - magnitude);
    } else {
      if (magnitude != 0) return std::nullopt;
      return T{0};
    }
  }
  if (magnitude > static_cast<std::uint64_t>(std::numeric_limits<T>::max())) return std::nullopt;
  return static_cast<T>(magnitude);
}

std::string Quoted(std::string_view text) { return "\"" + std::string(text) + "\""; }

// The reporter ID list of `send`: "42", "1,2,3", "[1,2,3]", "[]" (no session), or "all" /
// nothing (every started session).
std::variant<std::optional<std::vector<std::int64_t>>, std::string> ParseIDList(
    std::string_view text) {
  if (text.empty() || text == "all" || text == "nil") {
    return std::optional<std::vector<std::int64_t>>();
  }
  if (text.front() == '[') {
    if (text.back() != ']') return "reporter ID list " + Quoted(text) + " is missing its ]";
    text = text.substr(1, text.size() - 2);
  }
  std::vector<std::int64_t> ids;
  while (!text.empty()) {
    const std::size_t comma = text.find(',');
    std::string_view item = text.substr(0, comma);
    while (!item.empty() && IsBlank(item.front())) item.remove_prefix(1);
    while (!item.empty() && IsBlank(item.back())) item.remove_suffix(1);
    auto id = ParseInteger<std::int64_t>(item);
    if (!id) return "bad reporter ID " + Quoted(item) + " in the list";
    ids.push_back(*id);
    if (comma == std::string_view::npos) break;
    text.remove_prefix(comma + 1);
  }
  return std::optional<std::vector<std::int64_t>>(std::move(ids));
}

std::variant<Value, std::string> ParseObject(Reader& reader, const char* what) {
  std::string_view json = reader.NextJson();
  if (json.empty()) return std::string(what) + " must be a JSON object such as {\"key\":1}";
  Value value;
  if (auto error = ParseJson(json, value)) {
    return std::string(what) + " is not valid JSON: " + error->Description();
  }
  if (!value.is_dictionary()) return std::string(what) + " must be a JSON object, not an array";
  return value;
}

}  // namespace

bool IsOperationWord(std::string_view word) {
  for (const Word& w : kWords) {
    if (word == w.word) return true;
  }
  return false;
}

std::variant<Command, std::string> ParseCommand(std::string_view line) {
  Reader reader(line);
  Command command;
  if (reader.AtEnd()) return command;
  std::string_view word = reader.NextWord();
  if (word.front() == '#') return command;
  command.name = std::string(word);
  const Word* found = nullptr;
  for (const Word& w : kWords) {
    if (word == w.word) found = &w;
  }
  if (!found) return "unknown command " + Quoted(word) + " (see qnreport shell --help)";
  command.kind = found->kind;

  auto reporter_id = [&]() -> std::optional<std::string> {
    std::string_view text = reader.NextWord();
    if (text.empty()) return command.name + ": missing reporter ID";
    auto id = ParseInteger<std::int64_t>(text);
    if (!id) return command.name + ": reporter ID " + Quoted(text) + " is not a 64-bit integer";
    command.reporterID = *id;
    return std::nullopt;
  };

  std::optional<std::string> problem;
  switch (command.kind) {
    case Kind::kCreate:
    case Kind::kName:
    case Kind::kStart:
    case Kind::kStop:
    case Kind::kDestroy:
    case Kind::kValid:
      problem = reporter_id();
      break;
    case Kind::kType: {
      problem = reporter_id();
      if (problem) break;
      std::string_view text = reader.NextWord();
      auto type = ParseInteger<std::uint16_t>(text);
      if (text.empty()) {
        problem = "type: missing service type";
      } else if (!type) {
        problem = "type: service type " + Quoted(text) + " is not a 16-bit unsigned integer";
      } else {
        command.serviceType = *type;
      }
      break;
    }
    case Kind::kConfig: {
      problem = reporter_id();
      if (problem) break;
      auto parsed = ParseObject(reader, "config: the configuration");
      if (auto* error = std::get_if<std::string>(&parsed)) {
        problem = *error;
      } else {
        command.payload = std::get<Value>(parsed);
      }
      break;
    }
    case Kind::kSend: {
      auto parsed = ParseObject(reader, "send: the message");
      if (auto* error = std::get_if<std::string>(&parsed)) {
        problem = *error;
        break;
      }
      command.payload = std::get<Value>(parsed);
      std::string_view category_text = reader.NextWord();
      std::string_view type_text = reader.NextWord();
      auto category = ParseInteger<std::uint32_t>(category_text);
      auto type = ParseInteger<std::uint16_t>(type_text);
      if (category_text.empty() || type_text.empty()) {
        problem = "send: usage: send {json} CATEGORY TYPE [ID,ID...]";
      } else if (!category) {
        problem = "send: category " + Quoted(category_text) + " is not a 32-bit unsigned integer";
      } else if (!type) {
        problem = "send: type " + Quoted(type_text) + " is not a 16-bit unsigned integer";
      } else {
        command.category = *category;
        command.type = *type;
        // "[1, 2]" may hold blanks; a bare list may not.
        std::string_view list = reader.Peek() == '[' ? reader.NextJson() : reader.NextWord();
        if (list.empty() && !reader.AtEnd()) list = reader.NextWord();  // unclosed [
        auto ids = ParseIDList(list);
        if (auto* error = std::get_if<std::string>(&ids)) {
          problem = "send: " + *error;
        } else {
          command.reporterIDs = std::get<0>(std::move(ids));
        }
      }
      break;
    }
    case Kind::kSleep: {
      std::string text(reader.NextWord());
      char* end = nullptr;
      const double seconds = std::strtod(text.c_str(), &end);
      if (text.empty() || end != text.c_str() + text.size() || !std::isfinite(seconds) ||
          seconds < 0) {
        problem = "sleep: " + Quoted(text) + " is not a number of seconds";
      } else {
        command.seconds = seconds;
      }
      break;
    }
    case Kind::kReporters:
    case Kind::kKill:
    case Kind::kWait:
    case Kind::kNothing:
      break;
  }
  if (problem) return *problem;
  if (!reader.AtEnd()) {
    return command.name + ": unexpected " + Quoted(reader.NextWord()) + " at the end";
  }
  return command;
}

}  // namespace qn::qnreport
