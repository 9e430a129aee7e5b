#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/dispatch.h"
#include "platform/livo_reporting.h"

namespace qn::testing {

// A LivoReporting that records what the service hands it: framework sessions (session
// info, user info), their messages and flushes, and single messages. Backend discovery
// answers as the test chooses; sends can be made to fail. Thread-safe; handlers are never
// called with the fake's lock held.
class FakeLivoReporting final : public LivoReporting {
 public:
  enum class Discovery {
    kAtOnce,      // the handler runs inside StartConfiguration with the backends
    kLate,        // the handler runs on the dispatcher after late_delay, with the backends
    kNever,       // the handler is kept; AnswerPending may answer it later
    kNoBackends,  // the handler runs inside StartConfiguration with nullopt
  };

  struct Message {
    std::uint16_t category = 0;
    std::uint16_t type = 0;
    Value payload;
  };
  struct SingleMessage {
    Dictionary session_info;
    Dictionary user_info;
    std::uint16_t category = 0;
    std::uint16_t type = 0;
    Value payload;
  };
  struct SessionRecord {
    Dictionary session_info;
    Dictionary user_info;
    std::vector<Message> messages;
    int flushes = 0;
  };

  // `dispatcher` is needed only for Discovery::kLate.
  explicit FakeLivoReporting(std::shared_ptr<Dispatcher> dispatcher = nullptr);
  ~FakeLivoReporting() override;

  std::shared_ptr<const LivoSecureHierarchyToken> NewSecureHierarchyTokenFromParentToken(
      const LivoSecureHierarchyToken* parent) override;
  std::shared_ptr<LivoReportingSession> CreateSession(Dictionary session_info, Dictionary user_info,
                                                      Array frameworks_to_check) override;
  bool SendOneMessage(const Dictionary& session_info, const Dictionary& user_info,
                      std::uint16_t category, std::uint16_t type, const Value& payload,
                      std::optional<Error>* error) override;

  // Settings (take effect for later calls).
  void SetDiscovery(Discovery mode, Duration late_delay = Duration::zero());
  // A failing SendMessage / SendOneMessage returns false, with `error` when given.
  void FailSingleSends(bool fail, std::optional<Error> error = std::nullopt);
  void FailFlushes(std::optional<Error> error);

  // Answers every discovery still waiting (Discovery::kNever) with `backends`.
  // Returns how many were answered.
  int AnswerPending(std::optional<Array> backends);

  // Records, in creation order.
  std::vector<SessionRecord> Sessions() const;
  std::vector<SingleMessage> SingleMessages() const;
  int TokensMade() const;
  // All messages of every framework session, in arrival order.
  std::vector<Message> AllSessionMessages() const;

  struct State;

 private:
  std::shared_ptr<State> state_;
};

}  // namespace qn::testing
