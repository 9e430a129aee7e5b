#include "Statistics/QNReportingStatlynBridge.h"

#include <memory>
#include <string>
#include <utility>

#include "Statistics/QNReportingUtility.h"
#include "Statistics/Service/QNReportingSession.h"
#include "common/Format.h"

namespace qn {

void QNReportingStatlynBridge::handleEvent(const Platform& platform, const Dictionary* message,
                                           std::uint32_t category, std::uint16_t type,
                                           const QNReportingSession* session,
                                           SharedPayload* shared) {
  if (!platform.analytics) return;
  std::shared_ptr<const Dictionary> userInfo = session ? session->userInfo() : nullptr;
  std::string host = QNReportingHostApplicationName(userInfo.get());
  std::shared_ptr<const Dictionary> payload;
  std::size_t bytes = 0;  // counted by the event that made the copy, once
  if (shared && shared->payload && shared->host == host) {
    payload = shared->payload;
  } else {
    // Room for the host entry first: the copy assigned into it keeps that capacity, so
    // adding the entry does not move every other one.
    Dictionary copy;
    copy.Reserve((message ? message->size() : 0) + 1);
    if (message) copy = *message;
    copy.Set("HostApplicationDisplayID", host);
    payload = std::make_shared<const Dictionary>(std::move(copy));
    bytes = Value(payload).ApproximateBytes();
    if (shared) *shared = SharedPayload{std::move(host), payload};
  }
  // "com.norvel.quenta.%@.%@" of the two names, once per message: plain concatenation.
  std::string name = "com.norvel.quenta.";
  name += QNReportingCategoryName(category);
  name += '.';
  name += QNReportingTypeName(type);
  platform.analytics->SendEventLazy(
      name, [payload] { return Value(payload); }, bytes);
}

}  // namespace qn
