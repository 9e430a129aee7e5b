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
                                           const QNReportingSession* session) {
  if (!platform.analytics) return;
  Dictionary payload = message ? *message : Dictionary();
  std::shared_ptr<const Dictionary> userInfo = session ? session->userInfo() : nullptr;
  payload.Set("HostApplicationDisplayID", QNReportingHostApplicationName(userInfo));
  const std::string name = StringWithFormat(
      "com.norvel.quenta.%@.%@", QNReportingCategoryName(category), QNReportingTypeName(type));
  auto shared = std::make_shared<const Dictionary>(std::move(payload));
  platform.analytics->SendEventLazy(name, [shared] { return Value(shared); });
}

}  // namespace qn
