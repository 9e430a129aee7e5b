#include "platform/linux/store_sinks.h"

#include <atomic>
#include <string>
#include <utility>

namespace qn {
namespace {

Error NotTaken() {
  return Error{kReportingStoreErrorDomain, 1,
               "the reporting store did not take the message (queue full or store closed)"};
}

bool Taken(bool taken, std::optional<Error>* error) {
  if (!taken && error) *error = NotTaken();
  return taken;
}

class StoreLivoReportingSession final : public LivoReportingSession {
 public:
  StoreLivoReportingSession(std::shared_ptr<ReportingStore> store, std::int64_t id,
                            std::optional<Array> backends)
      : store_(std::move(store)), id_(id), backends_(std::move(backends)) {}

  // An open store is its own backend: the answer comes at once, however far behind its
  // writer is. A closed one answers from another thread, as the framework may.
  void StartConfiguration(BackendsHandler handler) override {
    if (!handler) return;
    if (store_->IsOpen()) {
      handler(backends_);
      return;
    }
    store_->AfterWrite([handler = std::move(handler), backends = backends_] { handler(backends); });
  }

  bool SendMessage(std::uint16_t category, std::uint16_t type, const Value& payload,
                   std::optional<Error>* error) override {
    return Taken(store_->AddSessionMessage(id_, category, type, payload), error);
  }

  void FlushMessages(FlushHandler handler) override {
    store_->MarkSessionFlushed(id_, std::move(handler));
  }

  std::string Description() const override {
    return "<LivoReportingSession " + std::to_string(id_) + ">";
  }

 private:
  const std::shared_ptr<ReportingStore> store_;
  const std::int64_t id_;  // the livo_sessions row id
  const std::optional<Array> backends_;
};

class StoreLivoReporting final : public LivoReporting {
 public:
  StoreLivoReporting(std::shared_ptr<ReportingStore> store, StoreLivoReportingOptions options)
      : store_(std::move(store)), options_(std::move(options)) {}

  std::shared_ptr<const LivoSecureHierarchyToken> NewSecureHierarchyTokenFromParentToken(
      const LivoSecureHierarchyToken* /*parent*/) override {
    auto token = std::make_shared<LivoSecureHierarchyToken>();
    token->id = next_token_id_.fetch_add(1, std::memory_order_relaxed);
    return token;
  }

  std::shared_ptr<LivoReportingSession> CreateSession(Dictionary session_info, Dictionary user_info,
                                                      Array /*frameworks_to_check*/) override {
    const std::int64_t id =
        store_->AddNewSession(Value(std::move(session_info)), Value(std::move(user_info)));
    return std::make_shared<StoreLivoReportingSession>(store_, id, options_.backends);
  }

  bool SendOneMessage(const Dictionary& session_info, const Dictionary& user_info,
                      std::uint16_t category, std::uint16_t type, const Value& payload,
                      std::optional<Error>* error) override {
    return Taken(
        store_->AddSingleMessage(Value(session_info), Value(user_info), category, type, payload),
        error);
  }

 private:
  const std::shared_ptr<ReportingStore> store_;
  const StoreLivoReportingOptions options_;
  std::atomic<std::uint64_t> next_token_id_{1};
};

class StoreAnalytics final : public Analytics {
 public:
  explicit StoreAnalytics(std::shared_ptr<ReportingStore> store) : store_(std::move(store)) {}

  void SendEventLazy(const std::string& name, PayloadProvider provider,
                     std::size_t held_bytes) override {
    store_->AddAnalyticsEvent(name, std::move(provider), held_bytes);
  }

 private:
  const std::shared_ptr<ReportingStore> store_;
};

class StoreEnerdex final : public Enerdex {
 public:
  explicit StoreEnerdex(std::shared_ptr<ReportingStore> store) : store_(std::move(store)) {}

  void LogRegisteredEvent(std::int32_t subsystem, const std::string& event_name, Value payload,
                          Value /*options*/) override {
    store_->AddPowerLogEvent(subsystem, event_name, std::move(payload));
  }

 private:
  const std::shared_ptr<ReportingStore> store_;
};

}  // namespace

std::shared_ptr<LivoReporting> NewStoreLivoReporting(std::shared_ptr<ReportingStore> store,
                                                     StoreLivoReportingOptions options) {
  return std::make_shared<StoreLivoReporting>(std::move(store), std::move(options));
}

std::shared_ptr<Analytics> NewStoreAnalytics(std::shared_ptr<ReportingStore> store) {
  return std::make_shared<StoreAnalytics>(std::move(store));
}

std::shared_ptr<Enerdex> NewStoreEnerdex(std::shared_ptr<ReportingStore> store) {
  return std::make_shared<StoreEnerdex>(std::move(store));
}

}  // namespace qn
