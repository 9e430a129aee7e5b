#pragma once

#include <cstdint>

#include "common/Value.h"
#include "platform/platform.h"

namespace qn {

class QNReportingSession;

// Forwards haptic-engine usage found in reporting messages to the power log. Stateless;
// safe to call from any thread.
class QNReportingEnerdexUtility {
 public:
  // The power-log subsystem both events are written under.
  static constexpr std::int32_t kSubsystem = 28;
  // The message type that carries haptic-engine usage.
  static constexpr std::uint16_t kHapticsMessageType = 6;

  // Looks only at messages of type 6 (any category):
  // - with "EngineOnTime": writes "Vistrel_Haptics" with "EngineOnDuration" (that value),
  //   "ApplicationName" (the host application name of `session`, "Unknown" without one) and
  //   "TimestampEnd" (the message's "qnreporting_timestamp", left out with an error line
  //   when missing);
  // - else with "Haptic_Active_Hardware_Time_Seconds": writes "LeakedHapticsSessionInfo"
  //   with that value and "Active_Clients" when present.
  // Anything else (null message included) writes nothing. Values are passed through as
  // they are. `session` may be null. Does nothing when the platform has no power log.
  static void handleEvent(const Platform& platform, const Dictionary* message,
                          std::uint32_t category, std::uint16_t type,
                          const QNReportingSession* session);

  QNReportingEnerdexUtility() = delete;
};

}  // namespace qn
