#include "Statistics/QNReportingStatlynBridge.h"

#include <memory>
#include <string>
#include <utility>

#include "Statistics/QNReportingUtility.h"
#include "Statistics/Service/QNReportingSession.h"
#include "common/Format.h"

namespace qn {

void QNReportingStatlynBridge::handleEvent(const Platform& platform,
                                           const std::shared_ptr<const Dictionary>& message,
                                           std::uint32_t category, std::uint16_t type,
                                           const QNReportingSession* session) {
  if (!platform.analytics) return;
  std::shared_ptr<const Dictionary> userInfo = session ? session->userInfo() : nullptr;
  std::string host = QNReportingHostApplicationName(userInfo.get());
  // "com.norvel.quenta.%@.%@" of the two names, once per message: plain concatenation.
  std::string name = "com.norvel.quenta.";
  name += QNReportingCategoryName(category);
  name += '.';
  name += QNReportingTypeName(type);
  platform.analytics->SendEventLazy(name, [message, host = std::move(host)] {
    Dictionary payload = message ? *message : Dictionary();
    payload.Set("HostApplicationDisplayID", host);
    return Value(std::move(payload));
  });
}

}  // namespace qn
