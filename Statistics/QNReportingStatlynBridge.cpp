#include "Statistics/QNReportingStatlynBridge.h"

#include <memory>
#include <string>
#include <utility>

#include "Statistics/QNReportingUtility.h"
#include "Statistics/Service/QNReportingSession.h"
#include "common/Format.h"

namespace qn {

void QNReportingStatlynBridge::handleEvent(const Platform& platform,
                                           std::shared_ptr<const Dictionary> message,
                                           std::uint32_t category, std::uint16_t type,
                                           const QNReportingSession* session) {
  if (!platform.analytics) return;
  std::shared_ptr<const Dictionary> userInfo = session ? session->userInfo() : nullptr;
  // "com.norvel.quenta.%@.%@" of the two names, once per message: plain concatenation.
  std::string name = "com.norvel.quenta.";
  name += QNReportingCategoryName(category);
  name += '.';
  name += QNReportingTypeName(type);
  platform.analytics->SendEventLazy(
      name, [message = std::move(message),
             host = QNReportingHostApplicationName(userInfo.get())]() mutable {
        // Room for the host entry first: the copy assigned into it keeps that capacity, so
        // adding the entry does not move every other one.
        Dictionary payload;
        payload.Reserve((message ? message->size() : 0) + 1);
        if (message) payload = *message;
        payload.Set("HostApplicationDisplayID", std::move(host));
        return Value(std::make_shared<const Dictionary>(std::move(payload)));
      });
}

}  // namespace qn
