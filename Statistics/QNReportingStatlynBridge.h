#pragma once

#include <cstdint>
#include <memory>
#include <string>

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
  // application name of `session` (null session, or none in its user info: "Unknown").
  // Every category and type is forwarded; nothing is logged. The copy is made before the
  // call returns, so later changes to `message` do not reach the event. Does nothing when
  // the platform has no analytics sink.
  // `shared` (may be null) is what the events of one message share: when it holds the
  // payload made for the same host application name, the event gets that payload instead
  // of a new copy, so a message sent to many sessions is copied once per host, not once per
  // session; otherwise the new payload is kept there.
  struct SharedPayload {
    std::string host;
    std::shared_ptr<const Dictionary> payload;
  };
  static void handleEvent(const Platform& platform, const Dictionary* message,
                          std::uint32_t category, std::uint16_t type,
                          const QNReportingSession* session, SharedPayload* shared = nullptr);

  QNReportingStatlynBridge() = delete;
};

}  // namespace qn
