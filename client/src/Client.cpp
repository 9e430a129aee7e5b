#include "qnreporting/Client.h"

#include <asio.hpp>
#include <atomic>
#include <condition_variable>
#include <mutex>
#include <thread>
#include <unordered_map>
#include <utility>

#include "common/Format.h"
#include "common/Frame.h"
#include "common/MsgPack.h"
#include "common/Paths.h"

namespace qn::client {

std::string DefaultSocketPath() { return ResolvePaths(PathOptions{}).socket_path; }

namespace {

using Protocol = asio::local::stream_protocol;
using protocol::Op;

constexpr std::size_t kReadChunkBytes = 64 * 1024;
constexpr std::size_t kKeptBufferCapacity = 64 * 1024;
// How long destroying a client waits for its queued requests to be written.
constexpr Timeout kShutdownFlushTimeout = std::chrono::seconds(1);

// A reply adapter: checks the result's type and calls the typed callback; false when the
// result is not what the request's operation replies with.
using Adapter = std::function<bool(const Value&)>;

Adapter AdaptBool(BoolCallback reply) {
  return [reply = std::move(reply)](const Value& result) {
    const bool* b = result.as_bool();
    if (!b) return false;
    if (reply) reply(*b);
    return true;
  };
}

Adapter AdaptServiceType(ServiceTypeCallback reply) {
  return [reply = std::move(reply)](const Value& result) {
    auto n = result.as_uint64();
    if (!n || *n > UINT16_MAX) return false;
    if (reply) reply(static_cast<std::uint16_t>(*n));
    return true;
  };
}

Adapter AdaptDictionary(DictionaryCallback reply) {
  return [reply = std::move(reply)](const Value& result) {
    const Dictionary* d = result.as_dictionary();
    if (!d) return false;
    if (reply) reply(*d);
    return true;
  };
}

Adapter AdaptReporterIDs(ReporterIDsCallback reply) {
  return [reply = std::move(reply)](const Value& result) {
    const Array* items = result.as_array();
    if (!items) return false;
    std::vector<std::int64_t> ids;
    ids.reserve(items->size());
    for (const Value& item : *items) {
      auto id = item.as_int64();
      if (!id) return false;
      ids.push_back(*id);
    }
    if (reply) reply(ids);
    return true;
  };
}

Adapter AdaptError(ErrorCallback reply) {
  return [reply = std::move(reply)](const Value& result) {
    if (result.is_null()) {
      if (reply) reply(std::nullopt);
      return true;
    }
    const Dictionary* d = result.as_dictionary();
    if (!d) return false;
    const Value* domain = d->Find("domain");
    const Value* code = d->Find("code");
    const Value* user_info = d->Find("userInfo");
    if (!domain || !domain->as_string() || !code || !code->as_int64()) return false;
    ReplyError error{*domain->as_string(), *code->as_int64(), user_info ? *user_info : Value()};
    if (reply) reply(error);
    return true;
  };
}

Value IDList(const std::optional<std::vector<std::int64_t>>& ids) {
  if (!ids) return Value();
  Array items;
  items.reserve(ids->size());
  for (std::int64_t id : *ids) items.emplace_back(id);
  return Value(std::move(items));
}

}  // namespace

// Everything runs on one io_context served by the client's own thread. State shared with
// callers' threads is under mu_.
class Client::Impl : public std::enable_shared_from_this<Impl> {
 public:
  Impl() : socket_(io_) {}

  std::string Connect(const std::string& path) {
    // DefaultSocketPath() is empty for a user other than root without XDG_RUNTIME_DIR: no
    // socket in a shared folder that another user could have made.
    if (path.empty()) return "no socket path (XDG_RUNTIME_DIR is not set; name the socket)";
    asio::error_code error;
    socket_.connect(Protocol::endpoint(path), error);
    if (error) return "cannot connect to " + path + ": " + error.message();
    read_buffer_ = std::make_unique<char[]>(kReadChunkBytes);
    StartRead();
    thread_ = std::thread([self = shared_from_this()] {
      self->io_thread_id_ = std::this_thread::get_id();
      self->io_.run();
    });
    return {};
  }

  // Called by ~Client.
  void Shutdown() {
    Flush(kShutdownFlushTimeout);
    Close();
    if (!thread_.joinable()) return;
    if (OnIoThread()) {
      thread_.detach();  // the thread holds this Impl until its run ends
    } else {
      thread_.join();
    }
  }

  bool OnIoThread() const { return std::this_thread::get_id() == io_thread_id_.load(); }

  void Close() {
    // Posting under the lock while not ended guarantees the io thread is still running
    // (Finish, which ends it, needs the lock), so the posted Finish does run.
    std::lock_guard lock(mu_);
    if (ended_) return;
    asio::post(io_, [self = shared_from_this()] { self->Finish(); });
  }

  std::uint32_t Send(Op op, const Array& args, Adapter adapter, int expected_replies) {
    // The arguments are encoded outside the lock; only the header, which holds the request
    // id, is written under it.
    std::string tail;
    for (const Value& arg : args) AppendMsgPack(tail, arg);
    std::unique_lock lock(mu_);
    if (ended_) return 0;
    std::uint32_t id = next_id_;
    while (id == 0 || pending_.contains(id)) ++id;
    next_id_ = id + 1;
    std::string head;
    head.push_back(static_cast<char>(0x90 | (args.size() + 2)));  // fixarray: at most 6
    AppendMsgPack(head, Value(static_cast<std::uint32_t>(op)));
    AppendMsgPack(head, Value(id));
    const std::size_t body = head.size() + tail.size();
    if (body > protocol::kMaxBodyBytes) return 0;
    const std::uint32_t n = static_cast<std::uint32_t>(body);
    const char length[4] = {static_cast<char>(n >> 24), static_cast<char>(n >> 16),
                            static_cast<char>(n >> 8), static_cast<char>(n)};
    outgoing_.append(length, 4);
    outgoing_ += head;
    outgoing_ += tail;
    pending_.emplace(id, Pending{std::move(adapter), expected_replies});
    if (expected_replies > 0) ++outstanding_;
    KickLocked();
    return id;
  }

  void SendRaw(std::string bytes) {
    std::lock_guard lock(mu_);
    if (ended_) return;
    outgoing_ += bytes;
    KickLocked();
  }

  template <typename T>
  struct SyncState {
    std::optional<T> value;
    int replies = 0;
  };

  // Sends with `start` (given a function taking the typed result) and waits for `needed`
  // replies.
  template <typename T, typename Start>
  std::optional<T> Sync(int needed, Timeout timeout, Start start) {
    if (OnIoThread()) return std::nullopt;
    auto state = std::make_shared<SyncState<T>>();
    auto deliver = [this, state](T value) {
      std::lock_guard lock(mu_);
      state->value = std::move(value);
      ++state->replies;
      cv_.notify_all();
    };
    if (start(std::move(deliver)) == 0) return std::nullopt;
    std::unique_lock lock(mu_);
    cv_.wait_for(lock, timeout, [&] { return state->replies >= needed || invalidated_; });
    if (state->replies >= needed) return state->value;
    return std::nullopt;
  }

  bool WaitForReplies(Timeout timeout) {
    if (OnIoThread()) return false;
    std::unique_lock lock(mu_);
    cv_.wait_for(lock, timeout,
                 [&] { return (outstanding_ == 0 && delivering_ == 0) || invalidated_; });
    return outstanding_ == 0 && delivering_ == 0;
  }

  bool Flush(Timeout timeout) {
    if (OnIoThread()) return false;
    std::unique_lock lock(mu_);
    cv_.wait_for(lock, timeout,
                 [&] { return (outgoing_.empty() && !write_active_) || invalidated_; });
    return outgoing_.empty() && !write_active_ && !ended_;
  }

  bool WaitUntilEnded(Timeout timeout) {
    if (OnIoThread()) return false;
    std::unique_lock lock(mu_);
    return cv_.wait_for(lock, timeout, [&] { return invalidated_; });
  }

  bool connected() const {
    std::lock_guard lock(mu_);
    return !ended_;
  }

  std::size_t outstanding() const {
    std::lock_guard lock(mu_);
    return ended_ ? 0 : outstanding_;
  }

  mutable std::mutex mu_;  // guards the members marked so below (public for the handler setters)
  std::function<void()> invalidation_;                            // guarded by mu_
  std::function<void()> interruption_;                            // guarded by mu_
  std::function<void(const ConnectionError&)> connection_error_;  // guarded by mu_
  std::function<void(std::uint32_t, const Value&)> unexpected_;   // guarded by mu_

 private:
  struct Pending {
    Adapter adapter;
    int expected;  // replies still expected; 0: none (kept, called for any that come)
  };

  void KickLocked() {
    if (write_active_) return;
    write_active_ = true;
    asio::post(io_, [self = shared_from_this()] { self->StartWrite(); });
  }

  // io thread
  void StartWrite() {
    {
      std::lock_guard lock(mu_);
      if (ended_ || outgoing_.empty()) {
        write_active_ = false;
        cv_.notify_all();  // Flush
        return;
      }
      writing_.swap(outgoing_);
      outgoing_.clear();
      if (outgoing_.capacity() > kKeptBufferCapacity) std::string().swap(outgoing_);
    }
    asio::async_write(socket_, asio::buffer(writing_),
                      [self = shared_from_this()](const asio::error_code& error, std::size_t) {
                        self->writing_.clear();
                        if (self->writing_.capacity() > kKeptBufferCapacity) {
                          std::string().swap(self->writing_);
                        }
                        if (error) {
                          self->Finish();
                          return;
                        }
                        self->StartWrite();
                      });
  }

  void StartRead() {
    socket_.async_read_some(
        asio::buffer(read_buffer_.get(), kReadChunkBytes),
        [self = shared_from_this()](const asio::error_code& error, std::size_t bytes) {
          self->OnRead(error, bytes);
        });
  }

  void OnRead(const asio::error_code& error, std::size_t bytes) {
    if (Ended()) return;
    if (error) {
      Finish();
      return;
    }
    decoder_.Feed(std::string_view(read_buffer_.get(), bytes));
    while (auto body = decoder_.Next()) {
      auto decoded = DecodeMsgPack(*body);
      if (auto* problem = std::get_if<protocol::RequestProblem>(&decoded)) {
        Fail(ClientErrorCode::kBadFrame, "bad frame from the service: " + problem->message);
        return;
      }
      if (!HandleReply(std::get<Value>(decoded))) return;
    }
    if (auto& problem = decoder_.error()) {
      Fail(ClientErrorCode::kBadFrame, "bad frame from the service: " + problem->message);
      return;
    }
    StartRead();
  }

  // Returns false once the connection failed.
  bool HandleReply(const Value& reply) {
    const Array* items = reply.as_array();
    auto id = items && items->size() == 2 ? (*items)[0].as_uint64() : std::nullopt;
    if (!id || *id > UINT32_MAX) {
      Fail(ClientErrorCode::kBadReply, "reply is not [request_id, result]");
      return false;
    }
    const Value& result = (*items)[1];
    if (*id == protocol::kConnectionErrorRequestId) {
      ReportConnectionError(result);
      return true;  // the service closes the connection next
    }
    const auto request_id = static_cast<std::uint32_t>(*id);
    Adapter adapter;
    std::function<void(std::uint32_t, const Value&)> unexpected;
    bool completes = false;  // the request's last expected reply
    {
      std::lock_guard lock(mu_);
      auto it = pending_.find(request_id);
      if (it == pending_.end()) {
        unexpected = unexpected_;
      } else if (it->second.expected == 0) {
        adapter = it->second.adapter;
      } else if (--it->second.expected == 0) {
        adapter = std::move(it->second.adapter);
        pending_.erase(it);
        --outstanding_;
        ++delivering_;
        completes = true;
      } else {
        adapter = it->second.adapter;
      }
    }
    if (!adapter) {
      if (unexpected) unexpected(request_id, result);
      return true;
    }
    const bool ok = adapter(result);
    if (completes) {
      // WaitForReplies returns only after the last callback ran, so the caller sees its
      // effects.
      std::lock_guard lock(mu_);
      if (--delivering_ == 0 && outstanding_ == 0) cv_.notify_all();
    }
    if (!ok) {
      Fail(ClientErrorCode::kBadReply,
           StringWithFormat("reply to request %u has a result of the wrong type", request_id));
      return false;
    }
    return true;
  }

  void ReportConnectionError(const Value& result) {
    ConnectionError error;
    if (const Dictionary* d = result.as_dictionary()) {
      if (const Value* v = d->Find("domain"); v && v->as_string()) error.domain = *v->as_string();
      if (const Value* v = d->Find("code"); v && v->as_int64()) error.code = *v->as_int64();
      if (const Value* v = d->Find("message"); v && v->as_string()) error.message = *v->as_string();
    }
    std::function<void(const ConnectionError&)> handler;
    {
      std::lock_guard lock(mu_);
      handler = connection_error_;
    }
    if (handler) handler(error);
  }

  void Fail(ClientErrorCode code, std::string message) {
    std::function<void(const ConnectionError&)> handler;
    {
      std::lock_guard lock(mu_);
      handler = connection_error_;
    }
    if (handler) {
      handler(
          ConnectionError{kClientErrorDomain, static_cast<std::int64_t>(code), std::move(message)});
    }
    Finish();
  }

  bool Ended() {
    std::lock_guard lock(mu_);
    return ended_;
  }

  // io thread: ends the connection once.
  void Finish() {
    std::unordered_map<std::uint32_t, Pending> dropped;
    std::function<void()> invalidation;
    {
      std::lock_guard lock(mu_);
      if (ended_) return;
      ended_ = true;
      dropped.swap(pending_);
      outgoing_.clear();
      invalidation = std::move(invalidation_);
      invalidation_ = nullptr;
      interruption_ = nullptr;
      cv_.notify_all();
    }
    asio::error_code ignored;
    socket_.shutdown(Protocol::socket::shutdown_both, ignored);
    socket_.close(ignored);
    dropped.clear();
    if (invalidation) invalidation();
    std::lock_guard lock(mu_);
    invalidated_ = true;
    connection_error_ = nullptr;
    unexpected_ = nullptr;
    cv_.notify_all();
  }

  asio::io_context io_{1};
  Protocol::socket socket_;
  std::thread thread_;
  std::atomic<std::thread::id> io_thread_id_{};
  std::condition_variable cv_;

  bool ended_ = false;         // guarded by mu_
  bool invalidated_ = false;   // guarded by mu_: the invalidation handler has run
  std::uint32_t next_id_ = 1;  // guarded by mu_
  std::unordered_map<std::uint32_t, Pending> pending_;  // guarded by mu_
  std::size_t outstanding_ = 0;  // guarded by mu_: pending requests still expecting replies
  std::size_t delivering_ = 0;   // guarded by mu_: last replies whose callback is running
  std::string outgoing_;         // guarded by mu_
  bool write_active_ = false;    // guarded by mu_

  // io thread only
  std::string writing_;
  FrameDecoder decoder_;
  std::unique_ptr<char[]> read_buffer_;
};

std::unique_ptr<Client> Client::Connect(const std::string& socket_path, std::string* error) {
  auto impl = std::make_shared<Impl>();
  std::string problem = impl->Connect(socket_path);
  if (!problem.empty()) {
    if (error) *error = std::move(problem);
    return nullptr;
  }
  return std::unique_ptr<Client>(new Client(std::move(impl)));
}

Client::Client(std::shared_ptr<Impl> impl) : impl_(std::move(impl)) {}

Client::~Client() { impl_->Shutdown(); }

void Client::SetInvalidationHandler(std::function<void()> handler) {
  std::lock_guard lock(impl_->mu_);
  impl_->invalidation_ = std::move(handler);
}
void Client::SetInterruptionHandler(std::function<void()> handler) {
  std::lock_guard lock(impl_->mu_);
  impl_->interruption_ = std::move(handler);
}
void Client::SetConnectionErrorHandler(std::function<void(const ConnectionError&)> handler) {
  std::lock_guard lock(impl_->mu_);
  impl_->connection_error_ = std::move(handler);
}
void Client::SetUnexpectedReplyHandler(std::function<void(std::uint32_t, const Value&)> handler) {
  std::lock_guard lock(impl_->mu_);
  impl_->unexpected_ = std::move(handler);
}

std::uint32_t Client::createReportingSession(std::int64_t reporterID, BoolCallback reply) {
  return impl_->Send(Op::kCreateReportingSession, {Value(reporterID)}, AdaptBool(std::move(reply)),
                     1);
}
std::uint32_t Client::setServiceType(std::uint16_t serviceType, std::int64_t reporterID,
                                     BoolCallback reply) {
  return impl_->Send(Op::kSetServiceType, {Value(serviceType), Value(reporterID)},
                     AdaptBool(std::move(reply)), 1);
}
std::uint32_t Client::getServiceNameForReporterID(std::int64_t reporterID,
                                                  ServiceTypeCallback reply) {
  return impl_->Send(Op::kGetServiceNameForReporterID, {Value(reporterID)},
                     AdaptServiceType(std::move(reply)), reporterID == 0 ? 2 : 1);
}
std::uint32_t Client::setConfiguration(Value configuration, std::int64_t reporterID,
                                       BoolCallback reply) {
  return impl_->Send(Op::kSetConfiguration, {std::move(configuration), Value(reporterID)},
                     AdaptBool(std::move(reply)), 1);
}
std::uint32_t Client::startReportingSessionForID(std::int64_t reporterID, BoolCallback reply) {
  return impl_->Send(Op::kStartReportingSession, {Value(reporterID)}, AdaptBool(std::move(reply)),
                     1);
}
std::uint32_t Client::sendMessage(Value message, std::uint32_t category, std::uint16_t type,
                                  std::optional<std::vector<std::int64_t>> reporterIDs,
                                  ErrorCallback reply) {
  return impl_->Send(Op::kSendMessage,
                     {std::move(message), Value(category), Value(type), IDList(reporterIDs)},
                     AdaptError(std::move(reply)), 1);
}
std::uint32_t Client::stopReportingSessionForID(std::int64_t reporterID, BoolCallback reply) {
  return impl_->Send(Op::kStopReportingSession, {Value(reporterID)}, AdaptBool(std::move(reply)),
                     1);
}
std::uint32_t Client::destroyReportingSession(std::int64_t reporterID, BoolCallback reply) {
  return impl_->Send(Op::kDestroyReportingSession, {Value(reporterID)}, AdaptBool(std::move(reply)),
                     1);
}
std::uint32_t Client::reporterIDValid(std::int64_t reporterID, DictionaryCallback reply) {
  return impl_->Send(Op::kReporterIDValid, {Value(reporterID)}, AdaptDictionary(std::move(reply)),
                     1);
}
std::uint32_t Client::getAllReporters(ReporterIDsCallback reply) {
  return impl_->Send(Op::kGetAllReporters, {}, AdaptReporterIDs(std::move(reply)), 1);
}
std::uint32_t Client::killService(BoolCallback reply) {
  return impl_->Send(Op::kKillService, {}, AdaptBool(std::move(reply)), 0);
}

std::uint32_t Client::SendRequest(protocol::Op op, Array args, ValueCallback reply,
                                  int expected_replies) {
  Adapter adapter = [reply = std::move(reply)](const Value& result) {
    if (reply) reply(result);
    return true;
  };
  return impl_->Send(op, args, std::move(adapter), expected_replies < 0 ? 0 : expected_replies);
}

void Client::SendRawBytes(std::string bytes) { impl_->SendRaw(std::move(bytes)); }

std::optional<bool> Client::createReportingSessionSync(std::int64_t reporterID, Timeout timeout) {
  return impl_->Sync<bool>(1, timeout, [&](auto deliver) {
    return createReportingSession(reporterID, std::move(deliver));
  });
}
std::optional<bool> Client::setServiceTypeSync(std::uint16_t serviceType, std::int64_t reporterID,
                                               Timeout timeout) {
  return impl_->Sync<bool>(1, timeout, [&](auto deliver) {
    return setServiceType(serviceType, reporterID, std::move(deliver));
  });
}
std::optional<std::uint16_t> Client::getServiceNameForReporterIDSync(std::int64_t reporterID,
                                                                     Timeout timeout) {
  return impl_->Sync<std::uint16_t>(reporterID == 0 ? 2 : 1, timeout, [&](auto deliver) {
    return getServiceNameForReporterID(reporterID, std::move(deliver));
  });
}
std::optional<bool> Client::setConfigurationSync(Value configuration, std::int64_t reporterID,
                                                 Timeout timeout) {
  return impl_->Sync<bool>(1, timeout, [&](auto deliver) {
    return setConfiguration(std::move(configuration), reporterID, std::move(deliver));
  });
}
std::optional<bool> Client::startReportingSessionForIDSync(std::int64_t reporterID,
                                                           Timeout timeout) {
  return impl_->Sync<bool>(1, timeout, [&](auto deliver) {
    return startReportingSessionForID(reporterID, std::move(deliver));
  });
}
std::optional<std::optional<ReplyError>> Client::sendMessageSync(
    Value message, std::uint32_t category, std::uint16_t type,
    std::optional<std::vector<std::int64_t>> reporterIDs, Timeout timeout) {
  return impl_->Sync<std::optional<ReplyError>>(1, timeout, [&](auto deliver) {
    return sendMessage(
        std::move(message), category, type, std::move(reporterIDs),
        [deliver = std::move(deliver)](const std::optional<ReplyError>& error) { deliver(error); });
  });
}
std::optional<bool> Client::stopReportingSessionForIDSync(std::int64_t reporterID,
                                                          Timeout timeout) {
  return impl_->Sync<bool>(1, timeout, [&](auto deliver) {
    return stopReportingSessionForID(reporterID, std::move(deliver));
  });
}
std::optional<bool> Client::destroyReportingSessionSync(std::int64_t reporterID, Timeout timeout) {
  return impl_->Sync<bool>(1, timeout, [&](auto deliver) {
    return destroyReportingSession(reporterID, std::move(deliver));
  });
}
std::optional<Dictionary> Client::reporterIDValidSync(std::int64_t reporterID, Timeout timeout) {
  return impl_->Sync<Dictionary>(1, timeout, [&](auto deliver) {
    return reporterIDValid(reporterID,
                           [deliver = std::move(deliver)](const Dictionary& d) { deliver(d); });
  });
}
std::optional<std::vector<std::int64_t>> Client::getAllReportersSync(Timeout timeout) {
  return impl_->Sync<std::vector<std::int64_t>>(1, timeout, [&](auto deliver) {
    return getAllReporters(
        [deliver = std::move(deliver)](const std::vector<std::int64_t>& ids) { deliver(ids); });
  });
}

bool Client::WaitForReplies(Timeout timeout) { return impl_->WaitForReplies(timeout); }
bool Client::WaitUntilEnded(Timeout timeout) { return impl_->WaitUntilEnded(timeout); }
bool Client::Flush(Timeout timeout) { return impl_->Flush(timeout); }
void Client::Close() { impl_->Close(); }
bool Client::connected() const { return impl_->connected(); }
std::size_t Client::outstanding() const { return impl_->outstanding(); }

}  // namespace qn::client
