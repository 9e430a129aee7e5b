#pragma once

#include <cstdint>
#include <memory>

#include "common/Value.h"
#include "platform/platform.h"

namespace qn {

class QNReportingSession;

// Copies reporting messages to the analytics framework as named events. Stateless; safe
// to call from any thread.
class QNReportingStatlynBridge {
 public:
  // Sends the analytics event "com.norvel.quenta.<category name>.<type name>" whose payload
  // is a copy of `message` (null = empty) with "HostApplicationDisplayID" set to the host
  // application name of `session` (null session, or none in its user info: "Unknown"), the
  // name taken when the call is made. Every category and type is forwarded; nothing is
  // logged. The copy is made only when the sink asks for the payload (the message is
  // immutable), so a message sent to many sessions is held once, not once per event.
  // Does nothing when the platform has no analytics sink.
  static void handleEvent(const Platform& platform, std::shared_ptr<const Dictionary> message,
                          std::uint32_t category, std::uint16_t type,
                          const QNReportingSession* session);

  QNReportingStatlynBridge() = delete;
};

}  // namespace qn
