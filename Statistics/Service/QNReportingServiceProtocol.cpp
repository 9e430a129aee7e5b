#include "Statistics/Service/QNReportingServiceProtocol.h"

#include <utility>

namespace qn {

namespace {

// The arguments arrive checked against the operation table (protocol::ValidateRequest), so
// each accessor below finds the kind it expects.
std::int64_t ReporterIDArg(const Value& arg) { return arg.as_int64().value_or(0); }

std::uint16_t UInt16Arg(const Value& arg) {
  return static_cast<std::uint16_t>(arg.as_uint64().value_or(0));
}

std::uint32_t UInt32Arg(const Value& arg) {
  return static_cast<std::uint32_t>(arg.as_uint64().value_or(0));
}

// The payload is handed over as the decoded dictionary itself, shared and immutable.
MessagePayload PayloadArg(const Value& arg) {
  auto shared = arg.shared_dictionary();
  return shared ? shared : std::make_shared<const Dictionary>();
}

std::optional<std::vector<std::int64_t>> ReporterIDsArg(const Value& arg) {
  const Array* items = arg.as_array();
  if (!items) return std::nullopt;
  std::vector<std::int64_t> ids;
  ids.reserve(items->size());
  for (const Value& item : *items) ids.push_back(item.as_int64().value_or(0));
  return ids;
}

BoolReply WireBool(IpcReply reply) {
  return [reply = std::move(reply)](bool result) { reply(Value(result)); };
}

ServiceTypeReply WireServiceType(IpcReply reply) {
  return [reply = std::move(reply)](std::uint16_t serviceType) { reply(Value(serviceType)); };
}

DictionaryReply WireDictionary(IpcReply reply) {
  return [reply = std::move(reply)](Dictionary result) { reply(Value(std::move(result))); };
}

ReporterIDsReply WireReporterIDs(IpcReply reply) {
  return [reply = std::move(reply)](std::vector<std::int64_t> ids) {
    Array items;
    items.reserve(ids.size());
    for (std::int64_t id : ids) items.emplace_back(id);
    reply(Value(std::move(items)));
  };
}

ErrorReply WireError(IpcReply reply) {
  return [reply = std::move(reply)](std::optional<Error> error) { reply(ErrorToWire(error)); };
}

// Turns each checked request into the typed call on the service and each typed reply into
// its wire value. Called on the IPC layer's thread; replies may come from any thread.
class ServiceExportedObject final : public IpcExportedObject {
 public:
  ServiceExportedObject(std::shared_ptr<QNReportingServiceProtocol> service,
                        std::shared_ptr<SerialQueue> serverQueue,
                        std::shared_ptr<SerialQueue> summaryQueue)
      : service_(std::move(service)),
        serverQueue_(std::move(serverQueue)),
        summaryQueue_(std::move(summaryQueue)) {}

  // Called on the IPC layer's thread, like HandleRequest, so stopSince_ needs no lock.
  void AfterRequests(std::function<void()> done) override {
    if (!std::exchange(stopSince_, false) || !summaryQueue_) {
      serverQueue_->AsyncOrRun(std::move(done));
      return;
    }
    // server queue (the stop runs) -> summary queue (its file) -> server queue (its reply).
    serverQueue_->Async(
        [server = serverQueue_, summaries = summaryQueue_, done = std::move(done)]() mutable {
          summaries->Async(
              [server, done = std::move(done)]() mutable { server->Async(std::move(done)); });
        });
  }

  void HandleRequest(protocol::Op op, const Array& args, IpcReply reply) override {
    using protocol::Op;
    QNReportingServiceProtocol& service = *service_;
    if (op == Op::kStopReportingSession) stopSince_ = true;
    switch (op) {
      case Op::kCreateReportingSession:
        service.createReportingSession(ReporterIDArg(args[0]), WireBool(std::move(reply)));
        return;
      case Op::kSetServiceType:
        service.setServiceType(UInt16Arg(args[0]), ReporterIDArg(args[1]),
                               WireBool(std::move(reply)));
        return;
      case Op::kGetServiceNameForReporterID:
        service.getServiceNameForReporterID(ReporterIDArg(args[0]),
                                            WireServiceType(std::move(reply)));
        return;
      case Op::kSetConfiguration:
        service.setConfiguration(PayloadArg(args[0]), ReporterIDArg(args[1]),
                                 WireBool(std::move(reply)));
        return;
      case Op::kStartReportingSession:
        service.startReportingSessionForID(ReporterIDArg(args[0]), WireBool(std::move(reply)));
        return;
      case Op::kSendMessage:
        service.sendMessage(PayloadArg(args[0]), UInt32Arg(args[1]), UInt16Arg(args[2]),
                            ReporterIDsArg(args[3]), WireError(std::move(reply)));
        return;
      case Op::kStopReportingSession:
        service.stopReportingSessionForID(ReporterIDArg(args[0]), WireBool(std::move(reply)));
        return;
      case Op::kDestroyReportingSession:
        service.destroyReportingSession(ReporterIDArg(args[0]), WireBool(std::move(reply)));
        return;
      case Op::kReporterIDValid:
        service.reporterIDValid(ReporterIDArg(args[0]), WireDictionary(std::move(reply)));
        return;
      case Op::kGetAllReporters:
        service.getAllReporters(WireReporterIDs(std::move(reply)));
        return;
      case Op::kKillService:
        // The service exits instead of replying; should it ever reply, the client gets it.
        service.killService(WireBool(std::move(reply)));
        return;
    }
  }

 private:
  const std::shared_ptr<QNReportingServiceProtocol> service_;
  const std::shared_ptr<SerialQueue> serverQueue_;
  const std::shared_ptr<SerialQueue> summaryQueue_;
  bool stopSince_ = false;  // a stop was handed over since the last AfterRequests
};

}  // namespace

std::shared_ptr<IpcExportedObject> MakeExportedObject(
    std::shared_ptr<QNReportingServiceProtocol> service, std::shared_ptr<SerialQueue> serverQueue,
    std::shared_ptr<SerialQueue> summaryQueue) {
  return std::make_shared<ServiceExportedObject>(std::move(service), std::move(serverQueue),
                                                 std::move(summaryQueue));
}

Value ErrorToWire(const std::optional<Error>& error) {
  if (!error) return Value();
  return Value(Dictionary{
      {"domain", error->domain},
      {"code", error->code},
      {"userInfo", Value()},
  });
}

}  // namespace qn
