#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "common/Error.h"
#include "common/Value.h"

namespace qn {

// Keys of a framework session's session info and user info.
inline constexpr const char* kLivoReportingSessionInfoClientType = "ClientType";
inline constexpr const char* kLivoReportingSessionInfoClientVersion = "ClientVersion";
inline constexpr const char* kLivoReportingSessionInfoSessionID = "SessionID";
inline constexpr const char* kLivoReportingSessionInfoBatchEvent = "BatchEvent";
inline constexpr const char* kLivoReportingSessionInfoHierarchyToken = "HierarchyToken";
inline constexpr const char* kLivoReportingSessionInfoContainsRealtimeEvents =
    "ContainsRealtimeEvents";
inline constexpr const char* kLivoReportingUserInfoClientName = "ClientName";
inline constexpr const char* kLivoReportingUserInfoServiceName = "ServiceName";

// A hierarchy token (LivoSecureHierarchyToken). It goes into session info as its `id`.
struct LivoSecureHierarchyToken {
  std::uint64_t id = 0;
  std::string Description() const { return "<LivoSecureHierarchyToken " + std::to_string(id) + ">"; }
};

// One session of the real-time reporting framework. Safe to call from any thread.
class LivoReportingSession {
 public:
  using BackendsHandler = std::function<void(std::optional<Array> backends)>;
  using FlushHandler = std::function<void(std::optional<Error> error)>;
  virtual ~LivoReportingSession() = default;

  // Starts backend discovery (startConfigurationWithCompletionHandler:). `handler` is
  // called at most once, on a thread of the framework's choosing, with the list of
  // backends found, or nullopt when none was found. It may never be called.
  virtual void StartConfiguration(BackendsHandler handler) = 0;

  // Sends one message of the session (sendMessageWithCategory:type:payload:error:).
  // Returns true when the framework took it; on false, *error may hold why.
  virtual bool SendMessage(std::uint16_t category, std::uint16_t type, const Value& payload,
                           std::optional<Error>* error) = 0;

  // Flushes what the session holds (flushMessagesWithCompletion:); `handler` runs later on
  // a framework thread with the error, if any.
  virtual void FlushMessages(FlushHandler handler) = 0;

  virtual std::string Description() const = 0;
};

// The framework's class operations. Safe to call from any thread.
class LivoReporting {
 public:
  virtual ~LivoReporting() = default;

  // A new hierarchy token (newSecureHierarchyTokenFromParentToken:); `parent` may be null.
  virtual std::shared_ptr<const LivoSecureHierarchyToken> NewSecureHierarchyTokenFromParentToken(
      const LivoSecureHierarchyToken* parent) = 0;

  // A new framework session (initWithSessionInfo:userInfo:frameworksToCheck:). Never null.
  virtual std::shared_ptr<LivoReportingSession> CreateSession(Dictionary session_info,
                                                              Dictionary user_info,
                                                              Array frameworks_to_check) = 0;

  // Sends a standalone message
  // (sendOneMessageWithSessionInfo:userInfo:category:type:payload:error:).
  // Returns true when the framework took it; on false, *error may hold why.
  virtual bool SendOneMessage(const Dictionary& session_info, const Dictionary& user_info,
                              std::uint16_t category, std::uint16_t type, const Value& payload,
                              std::optional<Error>* error) = 0;
};

}  // namespace qn
