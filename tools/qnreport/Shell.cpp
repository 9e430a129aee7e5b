#include "tools/qnreport/Shell.h"

#include <chrono>
#include <thread>

#include "common/Json.h"

namespace qn::qnreport {

namespace {

Value IDs(const std::vector<std::int64_t>& ids) {
  Array items;
  items.reserve(ids.size());
  for (std::int64_t id : ids) items.emplace_back(id);
  return Value(std::move(items));
}

Value ErrorValue(const std::optional<client::ReplyError>& error) {
  if (!error) return Value();
  return Value(
      Dictionary{{"domain", error->domain}, {"code", error->code}, {"userInfo", error->userInfo}});
}

}  // namespace

Shell::Shell(client::Client& client, std::ostream& out, client::Timeout timeout)
    : client_(client), out_(out), timeout_(timeout) {
  client_.SetConnectionErrorHandler([this](const client::ConnectionError& error) {
    Print(Dictionary{{"event", "connection-error"},
                     {"domain", error.domain},
                     {"code", error.code},
                     {"message", error.message}});
  });
  client_.SetUnexpectedReplyHandler([this](std::uint32_t request, const Value& reply) {
    Print(Dictionary{{"event", "unexpected-reply"}, {"request", request}, {"reply", reply}});
  });
  client_.SetInvalidationHandler([this] {
    if (!closing_) Print(Dictionary{{"event", "closed"}});
  });
}

Shell::~Shell() {
  closing_ = true;
  client_.Close();
  client_.WaitUntilEnded(std::chrono::seconds(5));
}

void Shell::Print(const Dictionary& line) {
  std::string text = ToJsonLenient(Value(line));
  std::lock_guard lock(out_mu_);
  out_ << text << '\n';
  out_.flush();
}

void Shell::PrintReply(const Command& command, bool with_id, Value reply) {
  Dictionary line{{"op", command.name}};
  if (with_id) line.Set("id", command.reporterID);
  line.Set("reply", std::move(reply));
  Print(line);
}

void Shell::PrintError(const std::string& message, int number) {
  Print(Dictionary{{"error", message}, {"line", number}});
}

void Shell::RunLine(std::string_view line, int number) {
  auto parsed = ParseCommand(line);
  if (auto* problem = std::get_if<std::string>(&parsed)) {
    PrintError(*problem, number);
    return;
  }
  Run(std::get<Command>(parsed), number);
}

void Shell::Run(const Command& command, int number) {
  using Kind = Command::Kind;
  // Each reply callback holds a copy of the command for its line.
  auto boolean = [this, command](bool ok) { PrintReply(command, true, Value(ok)); };
  std::uint32_t sent = 1;  // 0 = not sent: the connection has ended
  switch (command.kind) {
    case Kind::kNothing:
      return;
    case Kind::kCreate:
      sent = client_.createReportingSession(command.reporterID, boolean);
      break;
    case Kind::kType:
      sent = client_.setServiceType(command.serviceType, command.reporterID, boolean);
      break;
    case Kind::kName:
      sent = client_.getServiceNameForReporterID(
          command.reporterID,
          [this, command](std::uint16_t type) { PrintReply(command, true, Value(type)); });
      break;
    case Kind::kConfig:
      sent = client_.setConfiguration(command.payload, command.reporterID, boolean);
      break;
    case Kind::kStart:
      sent = client_.startReportingSessionForID(command.reporterID, boolean);
      break;
    case Kind::kSend:
      sent =
          client_.sendMessage(command.payload, command.category, command.type, command.reporterIDs,
                              [this, command](const std::optional<client::ReplyError>& error) {
                                PrintReply(command, false, ErrorValue(error));
                              });
      break;
    case Kind::kStop:
      sent = client_.stopReportingSessionForID(command.reporterID, boolean);
      break;
    case Kind::kDestroy:
      sent = client_.destroyReportingSession(command.reporterID, boolean);
      break;
    case Kind::kValid:
      sent = client_.reporterIDValid(command.reporterID, [this, command](const Dictionary& d) {
        PrintReply(command, true, Value(d));
      });
      break;
    case Kind::kReporters:
      sent = client_.getAllReporters([this, command](const std::vector<std::int64_t>& ids) {
        PrintReply(command, false, IDs(ids));
      });
      break;
    case Kind::kKill:
      sent =
          client_.killService([this, command](bool ok) { PrintReply(command, false, Value(ok)); });
      killed_ = killed_ || sent != 0;
      break;
    case Kind::kSleep:
      std::this_thread::sleep_for(std::chrono::duration<double>(command.seconds));
      return;
    case Kind::kWait:
      if (!client_.WaitForReplies(timeout_)) {
        failed_ = true;
        PrintError(client_.connected() ? "timed out waiting for replies"
                                       : "the connection ended before every reply came",
                   number);
      }
      return;
  }
  if (sent == 0) {
    failed_ = true;
    PrintError(command.name + ": not sent, the connection has ended", number);
  }
}

int Shell::Finish() {
  bool ok = client_.Flush(timeout_) || !client_.connected();
  if (!client_.WaitForReplies(timeout_)) {
    ok = false;
    Print(Dictionary{
        {"error", client_.connected() ? "timed out waiting for replies at the end of input"
                                      : "the connection ended before every reply came"},
        {"outstanding", client_.outstanding()}});
  }
  if (killed_) client_.WaitUntilEnded(timeout_);
  return ok && !failed_ ? 0 : 1;
}

int RunShell(client::Client& client, std::istream& in, std::ostream& out, client::Timeout timeout) {
  Shell shell(client, out, timeout);
  std::string line;
  int number = 0;
  while (std::getline(in, line)) shell.RunLine(line, ++number);
  return shell.Finish();
}

}  // namespace qn::qnreport
