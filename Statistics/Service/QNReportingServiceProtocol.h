#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <vector>

#include "common/Error.h"
#include "common/Value.h"
#include "platform/dispatch.h"
#include "platform/ipc.h"

namespace qn {

using BoolReply = std::function<void(bool)>;
using ServiceTypeReply = std::function<void(std::uint16_t)>;
using ErrorReply = std::function<void(std::optional<Error>)>;
using DictionaryReply = std::function<void(Dictionary)>;
using ReporterIDsReply = std::function<void(std::vector<std::int64_t>)>;
using MessagePayload = std::shared_ptr<const Dictionary>;  // never null when handed over

// The client protocol: eleven asynchronous operations, each answered through its reply.
// Declared in the protocol's order; protocol::Op numbers them. A reply may be invoked
// later, from another thread; getServiceNameForReporterID replies twice for ID 0,
// startReportingSessionForID may hold its reply back, killService never replies.
class QNReportingServiceProtocol {
 public:
  virtual ~QNReportingServiceProtocol() = default;

  virtual void createReportingSession(std::int64_t reporterID, BoolReply reply) = 0;
  virtual void setServiceType(std::uint16_t serviceType, std::int64_t reporterID,
                              BoolReply reply) = 0;
  virtual void getServiceNameForReporterID(std::int64_t reporterID, ServiceTypeReply reply) = 0;
  virtual void setConfiguration(MessagePayload configuration, std::int64_t reporterID,
                                BoolReply reply) = 0;
  virtual void startReportingSessionForID(std::int64_t reporterID, BoolReply reply) = 0;
  // reporterIDs absent = every started session of every client.
  virtual void sendMessage(MessagePayload message, std::uint32_t category, std::uint16_t type,
                           std::optional<std::vector<std::int64_t>> reporterIDs,
                           ErrorReply reply) = 0;
  virtual void stopReportingSessionForID(std::int64_t reporterID, BoolReply reply) = 0;
  virtual void destroyReportingSession(std::int64_t reporterID, BoolReply reply) = 0;
  virtual void reporterIDValid(std::int64_t reporterID, DictionaryReply reply) = 0;
  virtual void getAllReporters(ReporterIDsReply reply) = 0;
  virtual void killService(BoolReply reply) = 0;
};

// The exported object for a connection: decodes each checked request into a call of
// `service` and encodes its replies ([request_id, result] is added by the IPC layer).
// Holds `service` strongly, as a connection holds its exported object.
//
// `service` queues every request on `serverQueue`, so a request is taken in once the
// server queue has run past it; a stop's reply comes back to the server queue through
// `summaryQueue` (may be null), so after a stop AfterRequests follows that path too.
std::shared_ptr<IpcExportedObject> MakeExportedObject(
    std::shared_ptr<QNReportingServiceProtocol> service, std::shared_ptr<SerialQueue> serverQueue,
    std::shared_ptr<SerialQueue> summaryQueue);

// The wire form of an error reply of sendMessage: {"domain", "code", "userInfo": nil}.
Value ErrorToWire(const std::optional<Error>& error);

}  // namespace qn
