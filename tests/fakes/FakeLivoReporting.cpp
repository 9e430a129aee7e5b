#include "tests/fakes/FakeLivoReporting.h"

#include <utility>

namespace qn::testing {

struct FakeLivoReporting::State {
  std::shared_ptr<Dispatcher> dispatcher;
  mutable std::mutex mu;
  Discovery discovery = Discovery::kAtOnce;
  Duration late_delay = Duration::zero();
  Array backends{Value("fake-backend")};
  bool fail_single_sends = false;
  std::optional<Error> single_send_error;
  std::optional<Error> flush_error;
  std::uint64_t next_token = 1;
  std::vector<SessionRecord> sessions;
  std::vector<SingleMessage> singles;
  std::vector<Message> session_messages;  // of every session, in arrival order
  std::vector<LivoReportingSession::BackendsHandler> pending;
};

namespace {

class FakeSession final : public LivoReportingSession {
 public:
  FakeSession(std::shared_ptr<FakeLivoReporting::State> state, std::size_t index)
      : state_(std::move(state)), index_(index) {}

  void StartConfiguration(BackendsHandler handler) override {
    FakeLivoReporting::Discovery mode;
    Array backends;
    Duration delay;
    std::shared_ptr<Dispatcher> dispatcher;
    {
      std::lock_guard lock(state_->mu);
      mode = state_->discovery;
      backends = state_->backends;
      delay = state_->late_delay;
      dispatcher = state_->dispatcher;
      if (mode == FakeLivoReporting::Discovery::kNever) {
        state_->pending.push_back(std::move(handler));
        return;
      }
    }
    switch (mode) {
      case FakeLivoReporting::Discovery::kAtOnce:
        handler(std::move(backends));
        break;
      case FakeLivoReporting::Discovery::kNoBackends:
        handler(std::nullopt);
        break;
      case FakeLivoReporting::Discovery::kLate:
        dispatcher->AsyncGlobal(
            QualityOfService::kUtility, delay,
            [handler = std::move(handler), backends = std::move(backends)] { handler(backends); });
        break;
      case FakeLivoReporting::Discovery::kNever:
        break;
    }
  }

  bool SendMessage(std::uint16_t category, std::uint16_t type, const Value& payload,
                   std::optional<Error>*) override {
    std::lock_guard lock(state_->mu);
    FakeLivoReporting::Message m{category, type, payload};
    state_->sessions[index_].messages.push_back(m);
    state_->session_messages.push_back(std::move(m));
    return true;
  }

  void FlushMessages(FlushHandler handler) override {
    std::optional<Error> error;
    {
      std::lock_guard lock(state_->mu);
      state_->sessions[index_].flushes++;
      error = state_->flush_error;
    }
    if (handler) handler(error);
  }

  std::string Description() const override {
    return "<FakeLivoReportingSession " + std::to_string(index_) + ">";
  }

 private:
  std::shared_ptr<FakeLivoReporting::State> state_;
  std::size_t index_;
};

}  // namespace

FakeLivoReporting::FakeLivoReporting(std::shared_ptr<Dispatcher> dispatcher)
    : state_(std::make_shared<State>()) {
  state_->dispatcher = std::move(dispatcher);
}

FakeLivoReporting::~FakeLivoReporting() = default;

std::shared_ptr<const LivoSecureHierarchyToken>
FakeLivoReporting::NewSecureHierarchyTokenFromParentToken(const LivoSecureHierarchyToken*) {
  std::lock_guard lock(state_->mu);
  auto token = std::make_shared<LivoSecureHierarchyToken>();
  token->id = state_->next_token++;
  return token;
}

std::shared_ptr<LivoReportingSession> FakeLivoReporting::CreateSession(Dictionary session_info,
                                                                       Dictionary user_info,
                                                                       Array) {
  std::lock_guard lock(state_->mu);
  SessionRecord record;
  record.session_info = std::move(session_info);
  record.user_info = std::move(user_info);
  state_->sessions.push_back(std::move(record));
  return std::make_shared<FakeSession>(state_, state_->sessions.size() - 1);
}

bool FakeLivoReporting::SendOneMessage(const Dictionary& session_info, const Dictionary& user_info,
                                       std::uint16_t category, std::uint16_t type,
                                       const Value& payload, std::optional<Error>* error) {
  std::lock_guard lock(state_->mu);
  if (state_->fail_single_sends) {
    if (error) *error = state_->single_send_error;
    return false;
  }
  state_->singles.push_back(SingleMessage{session_info, user_info, category, type, payload});
  return true;
}

void FakeLivoReporting::SetDiscovery(Discovery mode, Duration late_delay) {
  std::lock_guard lock(state_->mu);
  state_->discovery = mode;
  state_->late_delay = late_delay;
}

void FakeLivoReporting::FailSingleSends(bool fail, std::optional<Error> error) {
  std::lock_guard lock(state_->mu);
  state_->fail_single_sends = fail;
  state_->single_send_error = std::move(error);
}

void FakeLivoReporting::FailFlushes(std::optional<Error> error) {
  std::lock_guard lock(state_->mu);
  state_->flush_error = std::move(error);
}

int FakeLivoReporting::AnswerPending(std::optional<Array> backends) {
  std::vector<LivoReportingSession::BackendsHandler> pending;
  {
    std::lock_guard lock(state_->mu);
    pending.swap(state_->pending);
  }
  for (auto& handler : pending) handler(backends);
  return static_cast<int>(pending.size());
}

std::vector<FakeLivoReporting::SessionRecord> FakeLivoReporting::Sessions() const {
  std::lock_guard lock(state_->mu);
  return state_->sessions;
}

std::vector<FakeLivoReporting::SingleMessage> FakeLivoReporting::SingleMessages() const {
  std::lock_guard lock(state_->mu);
  return state_->singles;
}

int FakeLivoReporting::TokensMade() const {
  std::lock_guard lock(state_->mu);
  return static_cast<int>(state_->next_token - 1);
}

std::vector<FakeLivoReporting::Message> FakeLivoReporting::AllSessionMessages() const {
  std::lock_guard lock(state_->mu);
  return state_->session_messages;
}

}  // namespace qn::testing
