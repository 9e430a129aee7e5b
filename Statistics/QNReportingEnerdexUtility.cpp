#include "Statistics/QNReportingEnerdexUtility.h"

#include <memory>
#include <utility>

#include "Statistics/QNReportingUtility.h"
#include "Statistics/Service/QNReportingSession.h"
#include "platform/log.h"

namespace qn {

void QNReportingEnerdexUtility::handleEvent(const Platform& platform, const Dictionary* message,
                                            std::uint32_t /*category*/, std::uint16_t type,
                                            const QNReportingSession* session) {
  if (!message || type != kHapticsMessageType || !platform.enerdex) return;

  const Value* engineOnTime = message->Find("EngineOnTime");
  if (!engineOnTime) {
    const Value* hardwareTime = message->Find("Haptic_Active_Hardware_Time_Seconds");
    if (!hardwareTime) return;
    Dictionary event;
    event.Set("Haptic_Active_Hardware_Time_Seconds", *hardwareTime);
    if (const Value* clients = message->Find("Active_Clients")) {
      event.Set("Active_Clients", *clients);
    }
    platform.enerdex->LogRegisteredEvent(kSubsystem, "LeakedHapticsSessionInfo",
                                         Value(std::move(event)), Value());
    return;
  }

  Dictionary event;
  event.Set("EngineOnDuration", *engineOnTime);
  // The name lookup never fails: it answers "Unknown" without a session or display ID.
  std::shared_ptr<const Dictionary> userInfo = session ? session->userInfo() : nullptr;
  event.Set("ApplicationName", QNReportingHostApplicationName(userInfo));
  if (const Value* timestamp = message->Find("qnreporting_timestamp")) {
    event.Set("TimestampEnd", *timestamp);
  } else if (platform.log) {
    QN_LOG(*platform.log, nullptr, LogLevel::kError,
           "%s:%d:%s: failed to get QNReporting timestamp for enerdex");
  }
  platform.enerdex->LogRegisteredEvent(kSubsystem, "Vistrel_Haptics", Value(std::move(event)),
                                       Value());
}

}  // namespace qn
