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
  // Room for the host entry first: the copy assigned into it keeps that capacity, so adding
  // the entry does not move every other one.
  Dictionary payload;
  payload.Reserve((message ? message->size() : 0) + 1);
  if (message) payload = *message;
  std::shared_ptr<const Dictionary> userInfo = session ? session->userInfo() : nullptr;
  payload.Set("HostApplicationDisplayID", QNReportingHostApplicationName(userInfo.get()));
  // "com.norvel.quenta.%@.%@" of the two names, once per message: plain concatenation.
  std::string name = "com.norvel.quenta.";
  name += QNReportingCategoryName(category);
  name += '.';
  name += QNReportingTypeName(type);
  auto shared = std::make_shared<const Dictionary>(std::move(payload));
  platform.analytics->SendEventLazy(name, [shared] { return Value(shared); });
}

}  // namespace qn
