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

// A LivoReporting that records what the service hands it: framework sessions (session and
// user info), their messages and flushes, and single messages. Backend discovery answers as
// the test chooses; single sends and flushes can be made to fail. Thread-safe; handlers are
// never called with the fake's lock held.
class FakeLivoReporting final : public LivoReporting {
 public:
  enum class Discovery {
    kAtOnce,      // the handler runs inside StartConfiguration with the backends
    kLate,        // the handler runs on the dispatcher after late_delay, with the backends
    kNever,       // the handler is kept; AnswerPending may answer it later
    kNoBackends,  // the handler runs inside StartConfiguration with nullopt
  };
  struct Message {
    std::uint16_t category = 0, type = 0;
    Value payload;
  };
  struct SingleMessage {
    Dictionary session_info, user_info;
    std::uint16_t category = 0, type = 0;
    Value payload;
  };
  struct SessionRecord {
    Dictionary session_info, user_info;
    std::vector<Message> messages;
    int flushes = 0;
  };

  // `dispatcher` is needed only for Discovery::kLate.
  explicit FakeLivoReporting(std::shared_ptr<Dispatcher> dispatcher = nullptr)
      : s_(std::make_shared<State>()) {
    s_->dispatcher = std::move(dispatcher);
  }

  std::shared_ptr<const LivoSecureHierarchyToken> NewSecureHierarchyTokenFromParentToken(
      const LivoSecureHierarchyToken*) override {
    std::lock_guard lock(s_->mu);
    auto token = std::make_shared<LivoSecureHierarchyToken>();
    token->id = ++s_->tokens;
    return token;
  }
  std::shared_ptr<LivoReportingSession> CreateSession(Dictionary session_info, Dictionary user_info,
                                                      Array) override {
    std::lock_guard lock(s_->mu);
    s_->sessions.push_back({std::move(session_info), std::move(user_info), {}, 0});
    return std::make_shared<Session>(s_, s_->sessions.size() - 1);
  }
  bool SendOneMessage(const Dictionary& session_info, const Dictionary& user_info,
                      std::uint16_t category, std::uint16_t type, const Value& payload,
                      std::optional<Error>* error) override {
    std::lock_guard lock(s_->mu);
    if (s_->fail_single_sends && error) *error = s_->single_send_error;
    if (!s_->fail_single_sends)
      s_->singles.push_back({session_info, user_info, category, type, payload});
    return !s_->fail_single_sends;
  }

  // Settings, for later calls.
  void SetDiscovery(Discovery mode, Duration late_delay = Duration::zero()) {
    std::lock_guard lock(s_->mu);
    s_->discovery = mode, s_->late_delay = late_delay;
  }
  // A failing SendOneMessage returns false, with `error` when given.
  void FailSingleSends(bool fail, std::optional<Error> error = std::nullopt) {
    std::lock_guard lock(s_->mu);
    s_->fail_single_sends = fail, s_->single_send_error = std::move(error);
  }
  void FailFlushes(std::optional<Error> error) {
    std::lock_guard lock(s_->mu);
    s_->flush_error = std::move(error);
  }
  // Answers every discovery still waiting (Discovery::kNever); returns how many.
  int AnswerPending(std::optional<Array> backends) {
    std::vector<LivoReportingSession::BackendsHandler> pending;
    {
      std::lock_guard lock(s_->mu);
      pending.swap(s_->pending);
    }
    for (auto& handler : pending) handler(backends);
    return static_cast<int>(pending.size());
  }

  // Records, in creation (arrival) order.
  std::vector<SessionRecord> Sessions() const { return Get(&State::sessions); }
  std::vector<SingleMessage> SingleMessages() const { return Get(&State::singles); }
  // All messages of every framework session.
  std::vector<Message> AllSessionMessages() const { return Get(&State::session_messages); }

 private:
  struct State {
    std::shared_ptr<Dispatcher> dispatcher;
    mutable std::mutex mu;
    Discovery discovery = Discovery::kAtOnce;
    Duration late_delay = Duration::zero();
    bool fail_single_sends = false;
    std::optional<Error> single_send_error, flush_error;
    std::uint64_t tokens = 0;
    std::vector<SessionRecord> sessions;
    std::vector<SingleMessage> singles;
    std::vector<Message> session_messages;
    std::vector<LivoReportingSession::BackendsHandler> pending;
  };
  class Session final : public LivoReportingSession {
   public:
    Session(std::shared_ptr<State> s, std::size_t index) : s_(std::move(s)), index_(index) {}
    void StartConfiguration(BackendsHandler handler) override {
      std::unique_lock lock(s_->mu);
      const Array backends{Value("fake-backend")};
      switch (s_->discovery) {
        case Discovery::kNever:
          return s_->pending.push_back(std::move(handler));
        case Discovery::kLate:
          return s_->dispatcher->AsyncGlobal(QualityOfService::kUtility, s_->late_delay,
                                             [handler, backends] { handler(backends); });
        case Discovery::kAtOnce:
          lock.unlock();
          return handler(backends);
        case Discovery::kNoBackends:
          lock.unlock();
          return handler(std::nullopt);
      }
    }
    bool SendMessage(std::uint16_t category, std::uint16_t type, const Value& payload,
                     std::optional<Error>*) override {
      std::lock_guard lock(s_->mu);
      s_->sessions[index_].messages.push_back({category, type, payload});
      s_->session_messages.push_back(s_->sessions[index_].messages.back());
      return true;
    }
    void FlushMessages(FlushHandler handler) override {
      std::optional<Error> error;
      {
        std::lock_guard lock(s_->mu);
        s_->sessions[index_].flushes++;
        error = s_->flush_error;
      }
      if (handler) handler(error);
    }
    std::string Description() const override {
      return "<FakeLivoReportingSession " + std::to_string(index_) + ">";
    }

   private:
    std::shared_ptr<State> s_;
    std::size_t index_;
  };
  template <typename T>
  T Get(T State::*member) const {
    std::lock_guard lock(s_->mu);
    return (*s_).*member;
  }
  std::shared_ptr<State> s_;
};

}  // namespace qn::testing
