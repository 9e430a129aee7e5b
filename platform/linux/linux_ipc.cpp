#include "platform/linux/linux_ipc.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>
#include <asio.hpp>
#include <atomic>
#include <cerrno>
#include <cstring>
#include <mutex>
#include <unordered_map>
#include <utility>

#include "common/Files.h"
#include "common/Frame.h"
#include "common/MsgPack.h"
#include "common/Paths.h"
#include "common/Protocol.h"

namespace qn {

namespace {

using Protocol = asio::local::stream_protocol;
using Socket = Protocol::socket;

constexpr std::size_t kReadChunkBytes = 16 * 1024;
// After a write the outgoing buffer keeps at most this much capacity, so one burst of
// replies does not pin its memory for the life of the connection.
constexpr std::size_t kKeptBufferCapacity = 64 * 1024;
// How long accepting pauses after a failed accept (typically fd exhaustion) before retrying.
constexpr auto kAcceptBackoff = std::chrono::milliseconds(100);
// Requests one connection hands over before the others get their turn on the IPC thread.
constexpr int kFramesPerTurn = 32;
// How often a connection held back because the store is behind looks again.
constexpr auto kStoreRecheck = std::chrono::milliseconds(20);

std::string ErrnoText(const std::string& what, int error) {
  return what + ": " + std::strerror(error);
}

using Fd = FileDescriptor;

bool FillAddress(const std::string& path, sockaddr_un& address) {
  std::memset(&address, 0, sizeof address);
  address.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof address.sun_path) return false;
  std::memcpy(address.sun_path, path.data(), path.size());
  return true;
}

// The listening socket and what is needed to clean up after it.
struct ListeningSocket {
  Fd fd;
  Fd lock;                 // flock'ed <path>.lock, held while this process owns the path
  std::string bound_path;  // empty when the socket came from systemd
  ino_t bound_inode = 0;
  std::string error;
};

// Whether something accepts connections on the socket file at `path`. A non-blocking
// connect that succeeds or finds the backlog full means a live listener; ECONNREFUSED means
// a file left behind by a process that is gone.
enum class Probe { kLive, kStale, kError };
Probe ProbeSocket(const sockaddr_un& address, std::string& error) {
  Fd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  if (fd.get() < 0) {
    error = ErrnoText("socket", errno);
    return Probe::kError;
  }
  if (::connect(fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0) {
    return Probe::kLive;
  }
  const int e = errno;
  if (e == EAGAIN || e == EINPROGRESS) return Probe::kLive;
  if (e == ECONNREFUSED) return Probe::kStale;
  error = ErrnoText(std::string("connect ") + address.sun_path, e);
  return Probe::kError;
}

ListeningSocket BindPath(const std::string& path) {
  ListeningSocket result;
  sockaddr_un address;
  if (!FillAddress(path, address)) {
    result.error = "socket path \"" + path + "\" is empty or too long";
    return result;
  }
  const auto slash = path.rfind('/');
  if (slash != std::string::npos && slash > 0) {
    if (auto problem = CreateDirectories(path.substr(0, slash), 0755)) {
      result.error = problem->Description();
      return result;
    }
  }

  // Two daemons starting at once must not both decide the socket is stale and unlink each
  // other's: the lock file serialises the check-unlink-bind sequence (and is held for life).
  const std::string lock_path = path + ".lock";
  result.lock = Fd(::open(lock_path.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (result.lock.get() < 0) {
    result.error = ErrnoText("open " + lock_path, errno);
    return result;
  }
  if (::flock(result.lock.get(), LOCK_EX | LOCK_NB) != 0) {
    const int e = errno;
    result.error = e == EWOULDBLOCK ? "another daemon is already serving " + path + " (" +
                                          lock_path + " is locked)"
                                    : ErrnoText("lock " + lock_path, e);
    return result;
  }

  struct stat info;
  if (::lstat(path.c_str(), &info) == 0) {
    if (!S_ISSOCK(info.st_mode)) {
      result.error = path + " exists and is not a socket; refusing to replace it";
      return result;
    }
    std::string problem;
    switch (ProbeSocket(address, problem)) {
      case Probe::kLive:
        result.error = "another daemon is already listening on " + path;
        return result;
      case Probe::kError:
        result.error = "cannot check the existing socket " + path + ": " + problem;
        return result;
      case Probe::kStale:
        if (::unlink(path.c_str()) != 0 && errno != ENOENT) {
          result.error = ErrnoText("remove stale socket " + path, errno);
          return result;
        }
        break;
    }
  } else if (errno != ENOENT) {
    result.error = ErrnoText("stat " + path, errno);
    return result;
  }

  result.fd = Fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (result.fd.get() < 0) {
    result.error = ErrnoText("socket", errno);
    return result;
  }
  // The socket file gets mode 0660 as bind makes it, from the umask (bind takes the
  // socket's mode less the umask), so its mode is never set by path afterwards. The umask
  // is the process's: files other threads make during this one call get at most 0660.
  const mode_t umask_before = ::umask(0117);
  const int bound =
      ::bind(result.fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address);
  const int bind_errno = errno;
  ::umask(umask_before);
  if (bound != 0) {
    result.error = ErrnoText("bind " + path, bind_errno);
    return result;
  }
  if (::lstat(path.c_str(), &info) == 0) result.bound_inode = info.st_ino;
  if (::listen(result.fd.get(), SOMAXCONN) != 0) {
    result.error = ErrnoText("listen " + path, errno);
  }
  if (!result.error.empty()) {
    ::unlink(path.c_str());
    return result;
  }
  result.bound_path = path;
  return result;
}

// The first listening AF_UNIX stream socket systemd passed, if it passed any.
std::optional<ListeningSocket> ActivatedSocket() {
  const int count = sd_listen_fds(1);
  if (count <= 0) return std::nullopt;
  ListeningSocket result;
  for (int fd = SD_LISTEN_FDS_START; fd < SD_LISTEN_FDS_START + count; ++fd) {
    if (sd_is_socket_unix(fd, SOCK_STREAM, 1, nullptr, 0) > 0) {
      result.fd = Fd(fd);
      return result;
    }
  }
  result.error =
      "systemd passed " + std::to_string(count) + " socket(s), none a listening Unix stream socket";
  return result;
}

class LinuxIpcListener;

// What the connections of one uid (or of all uids) hold now. Shared with the connections,
// which may outlive the listener; the byte counts change on any thread.
struct IpcUse {
  std::size_t connections = 0;  // io_context thread only
  std::array<std::atomic<std::size_t>, kIpcBudgetCount> bytes{};
  std::shared_ptr<HeldBytes> held;  // a uid's: what the service holds for it; set at accept
};

// One accepted connection. Lives as long as its pending asio operations, the listener's
// registry, or a reply in progress hold it. Everything except QueueReply and the getters runs
// on the listener's io_context thread.
//
// Flow control: requests are handed to the exported object while fewer than
// `max_pending_requests` (and `max_pending_request_bytes`) of them wait to be taken in;
// beyond that, and while the peer leaves too many reply bytes unread, or while the store is
// behind and this connection sends messages, the connection is not read. Frames already
// read stay in the decoder until the connection may go on.
class LinuxConnection final : public IpcConnection,
                              public std::enable_shared_from_this<LinuxConnection> {
 public:
  LinuxConnection(LinuxIpcListener& listener, Socket socket, pid_t pid, uid_t uid,
                  std::shared_ptr<IpcUse> uid_use);

  pid_t PeerPid() const override { return pid_; }
  uid_t PeerUid() const override { return uid_; }
  std::shared_ptr<HeldBytes> PeerHeldBytes() const override { return uid_use_->held; }
  std::string Description() const override { return description_; }

  void SetExportedObject(std::shared_ptr<IpcExportedObject> object) override {
    object_ = std::move(object);
  }
  void SetInterruptionHandler(std::function<void()> handler) override {
    interruption_ = std::move(handler);
  }
  void SetInvalidationHandler(std::function<void()> handler) override {
    invalidation_ = std::move(handler);
  }
  void Resume() override;

  // Frames [request_id, result] and queues it. Any thread; dropped once the error frame
  // is queued or the connection ended.
  // `room` is what was kept for this reply (protocol::ReplyRoomOf) and is given back.
  void QueueReply(std::uint32_t request_id, Value result, std::size_t room);

  // Sends the error frame at once and closes the connection once it is written (or after
  // the flush time-out): a connection refused at accept. io_context thread.
  void Refuse(protocol::ConnectionError code, const std::string& message);

  // Ends the connection: closes the socket, calls the invalidation handler (once) and lets
  // go of the exported object and handlers. io_context thread.
  void Finish();

  // Looks again at a connection held back because the store was behind, or for a budget.
  // io_context thread.
  void WakeIfHeldByStore() {
    if (hold_ == Hold::kStore) Pump();
  }
  void WakeIfHeldByBudget() {
    if (hold_ == Hold::kBudget) Pump();
  }

  // Marks the connection ended without running anything; for a listener that is destroyed
  // without having been stopped. Any thread, while the io_context is not running.
  void Abandon();

 private:
  enum class State {
    kOpen,      // reading and handing requests over
    kDraining,  // a bad frame came: no more reading; replies of earlier requests still go out
    kClosing,   // the error frame is queued: later replies are dropped
    kEnded,
  };
  // Why the connection is not read for now.
  enum class Hold { kNone, kRequests, kReplies, kBudget, kStore };

  // Hands over the frames already read and reads more, as far as flow control allows.
  void Pump();
  void StartRead();
  void OnRead(const asio::error_code& error, std::size_t bytes);
  // Hands complete frames to the exported object until one is bad or the connection must
  // wait; returns false once the connection failed.
  bool HandleFrames();
  // Asks the exported object to say when the requests handed since the last call are taken.
  void CloseBatch();
  void OnBatchTaken(std::size_t requests, std::size_t bytes);
  // `reading`: whether to read more (the frame budget holds reading only, as handing the
  // frames over is what frees it).
  Hold WhyHeld(bool reading);
  // Sets what this connection holds of `budget` to `bytes`, in its uid's and the total
  // use; returns whether that went down. The reply budget's under mu_, the others on the
  // io_context thread.
  bool Count(IpcBudget budget, std::size_t bytes);
  void CountRepliesLocked();  // REQUIRES: mu_ held
  // Lets the connections held for a budget look again, after this one freed some.
  void Released();
  // Counts the frame budget: the bytes read and not yet handed over, with the rest of an
  // admitted frame in progress; a frame in progress not yet admitted counts nothing (it
  // holds one read at most, as its connection is not read until then). A frame is admitted
  // when its whole length fits its uid's and the total budget (or nothing else is counted
  // there), so an admitted frame can always be read to its end and no set of half-read
  // frames can hold a budget for ever.
  void CountFrameBytes();
  bool FrameAdmitted() const { return admitted_frame_ == frames_read_ + 1; }
  // Closes the connection when its read bytes hold no whole frame for too long.
  void WatchPartialFrame();
  void OnPartialFrameTimer();
  void SetHold(Hold hold);
  // Bad input: log and count it, stop reading, and queue the error frame once every request
  // read before it has been taken in (so that their replies go out first).
  void Fail(protocol::ConnectionError code, const std::string& message);
  // Queues the error frame behind the replies and closes once it is written.
  void SendErrorFrame();
  // Ends a connection whose peer has sent all it will, once what it sent is answered.
  void FinishIfAnswered();
  void StartWriteLocked();  // REQUIRES: mu_ held
  void OnWrite(const asio::error_code& error);
  void OnOverflow();
  void OnReplyTooLarge(std::uint32_t request_id);

  // The listener is only reached while the connection is not ended (Finish, Forget); replies
  // may still arrive after it is gone, so they use the shared pieces below instead.
  LinuxIpcListener& listener_;
  const std::shared_ptr<asio::io_context> io_;
  const std::shared_ptr<Log> log_;
  const std::shared_ptr<const LogScope> scope_;
  const std::shared_ptr<Counters> counters_;
  const LinuxIpcOptions& options_;  // the listener's; read on the io thread only
  const std::size_t max_outgoing_bytes_;
  const std::size_t pause_reply_bytes_;  // an eighth of max_outgoing_bytes_
  const int error_flush_timeout_ms_;
  Socket socket_;
  const pid_t pid_;
  const uid_t uid_;
  const std::string description_;
  asio::steady_timer close_timer_;
  asio::steady_timer store_timer_;  // re-checks the store while it holds this connection
  asio::steady_timer frame_timer_;  // runs while read bytes hold a partial frame
  const std::shared_ptr<IpcUse> uid_use_;
  const std::shared_ptr<IpcUse> total_use_;
  // What this connection adds to those uses (the reply entry guarded by mu_).
  std::array<std::size_t, kIpcBudgetCount> counted_{};

  // io_context thread only.
  std::shared_ptr<IpcExportedObject> object_;
  std::function<void()> interruption_;
  std::function<void()> invalidation_;
  FrameDecoder decoder_;
  std::unique_ptr<char[]> read_buffer_;
  bool resumed_ = false;
  bool read_in_flight_ = false;
  Hold hold_ = Hold::kNone;
  IpcBudget held_budget_ = kIpcRequestBytes;  // which budget, while hold_ is kBudget
  // While hold_ is kStore: the uid's bytes of this kind passed their limit (kKindCount:
  // the store, or everyone's parked messages, is behind).
  HeldBytes::Kind held_kind_ = HeldBytes::kKindCount;
  std::uint64_t frames_read_ = 0;
  std::uint64_t admitted_frame_ = 0;   // the number (frames_read_ + 1) of the frame admitted
  std::uint64_t frames_at_watch_ = 0;  // frames_read_ when the partial frame timer started
  std::uint64_t frame_watch_ = 0;      // the partial frame timer's current run
  bool frame_watched_ = false;
  bool finished_ = false;  // Finish ran: the request and frame budgets hold nothing of it
  bool sends_messages_ = false;
  bool peer_done_ = false;            // end of stream: nothing more to read
  bool yielded_ = false;              // HandleFrames stopped at kFramesPerTurn with frames left
  std::size_t untaken_requests_ = 0;  // handed over, not yet known to be taken in
  std::size_t untaken_bytes_ = 0;
  std::size_t batch_requests_ = 0;  // of those, handed since the last CloseBatch
  std::size_t batch_bytes_ = 0;
  std::string error_frame_;  // waiting for the requests before it to be taken in

  std::mutex mu_;
  State state_ = State::kOpen;     // guarded by mu_ (written on the io thread)
  std::string pending_;            // guarded by mu_: framed replies not yet handed to a write
  std::string writing_;            // the bytes of the write in flight (io thread while writing)
  std::size_t writing_bytes_ = 0;  // guarded by mu_: writing_.size() while a write is in flight
  std::size_t reply_room_ = 0;     // guarded by mu_: kept for replies not yet made
  bool write_active_ = false;      // guarded by mu_: a write is in flight or posted
};

class LinuxIpcListener final : public IpcListener {
 public:
  LinuxIpcListener(const LinuxIpcOptions& options, std::shared_ptr<Log> log,
                   std::shared_ptr<const LogScope> scope, ListeningSocket socket)
      : options_(options),
        log_(std::move(log)),
        counters_(options.counters ? options.counters : std::make_shared<Counters>()),
        scope_(std::move(scope)),
        acceptor_(*io_),
        backoff_(*io_),
        lock_(std::move(socket.lock)),
        bound_path_(std::move(socket.bound_path)),
        bound_inode_(socket.bound_inode) {
    asio::error_code ignored;
    acceptor_.assign(Protocol(), socket.fd.release(), ignored);
  }

  ~LinuxIpcListener() override {
    // Normally Stop has ended every connection already. Otherwise end the rest without
    // their handlers, then let every aborted operation complete, so that no handler left in
    // the io_context keeps a connection (and with it the io_context) alive.
    for (auto& [raw, connection] : connections_) connection->Abandon();
    connections_.clear();
    asio::error_code ignored;
    acceptor_.close(ignored);
    backoff_.cancel();
    io_->restart();
    io_->run();
    RemoveSocketFile();
  }

  void SetDelegate(std::shared_ptr<IpcListenerDelegate> delegate) override {
    delegate_ = std::move(delegate);
  }

  void Resume() override {
    asio::post(*io_, [this] {
      if (stopped_) return;
      StartAccept();
      if (options_.notify_ready) sd_notify(0, "READY=1");
    });
    io_->run();
  }

  void Stop() override {
    asio::post(*io_, [this] { DoStop(); });
  }

  const std::shared_ptr<asio::io_context>& io() const { return io_; }
  const std::shared_ptr<Log>& log() const { return log_; }
  const std::shared_ptr<const LogScope>& scope() const { return scope_; }
  const LinuxIpcOptions& options() const { return options_; }
  const std::shared_ptr<Counters>& counters() const { return counters_; }

  // How many connections are held back because the store is behind.
  void CountStoreHold(int change) { store_holds_.fetch_add(change, std::memory_order_relaxed); }
  const std::shared_ptr<IpcUse>& total_use() const { return total_use_; }
  // io_context thread: the connections held for a budget look again (once per turn).
  void CountBudgetHold(int change) { budget_holds_ += change; }
  void WakeBudgetHeld() {
    if (budget_holds_ == 0 || budget_wake_posted_) return;
    budget_wake_posted_ = true;
    asio::post(*io_, [this] {
      budget_wake_posted_ = false;
      std::vector<std::shared_ptr<LinuxConnection>> open;
      for (auto& [raw, connection] : connections_) open.push_back(connection);
      for (auto& connection : open) connection->WakeIfHeldByBudget();
    });
  }

  // Any thread: looks again at every connection held back because the store was behind.
  void WakeStoreHeld() {
    if (store_holds_.load(std::memory_order_relaxed) == 0) return;
    asio::post(*io_, [this] {
      std::vector<std::shared_ptr<LinuxConnection>> open;
      for (auto& [raw, connection] : connections_) open.push_back(connection);
      for (auto& connection : open) connection->WakeIfHeldByStore();
    });
  }

  // io_context thread.
  std::shared_ptr<HeldBytes> HeldBytesOf(uid_t uid) {
    std::weak_ptr<HeldBytes>& entry = held_[uid];
    std::shared_ptr<HeldBytes> held = entry.lock();
    if (!held) {
      held = std::make_shared<HeldBytes>();
      entry = held;
    }
    if (held_.size() > 2 * uses_.size() + 64) {
      std::erase_if(held_, [](const auto& e) { return e.second.expired(); });
    }
    return held;
  }

  // io_context thread.
  void Forget(LinuxConnection* connection) {
    if (!connections_.erase(connection)) return;
    Counters::Add(counters_->connectionsOpen, -1);
    auto use = uses_.find(connection->PeerUid());
    if (use != uses_.end() && --use->second->connections == 0) uses_.erase(use);
  }

 private:
  void StartAccept() {
    acceptor_.async_accept([this](const asio::error_code& error, Socket socket) {
      OnAccept(error, std::move(socket));
    });
  }

  void OnAccept(const asio::error_code& error, Socket socket) {
    if (stopped_) return;
    if (error) {
      if (error == asio::error::operation_aborted) return;
      // Typically EMFILE/ENFILE: the connection stays in the backlog, so retrying at once
      // would spin. Pause, then try again; log once per run of failures.
      if (!accept_failing_) {
        QN_LOG(*log_, scope_.get(), LogLevel::kError, "%s:%d:%s: accept failed: %s; retrying",
               error.message());
      }
      accept_failing_ = true;
      backoff_.expires_after(kAcceptBackoff);
      backoff_.async_wait([this](const asio::error_code& e) {
        if (!e && !stopped_) StartAccept();
      });
      return;
    }
    accept_failing_ = false;

    ucred credentials{};
    socklen_t length = sizeof credentials;
    if (::getsockopt(socket.native_handle(), SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) {
      credentials.pid = 0;
      credentials.uid = static_cast<uid_t>(-1);
    }
    std::shared_ptr<IpcUse>& use = uses_[credentials.uid];
    if (!use) {
      use = std::make_shared<IpcUse>();
      use->held = HeldBytesOf(credentials.uid);
    }
    auto connection = std::make_shared<LinuxConnection>(*this, std::move(socket), credentials.pid,
                                                        credentials.uid, use);
    const bool over_limit = connections_.size() >= options_.max_connections;
    const bool over_uid_limit = use->connections >= options_.max_connections_per_uid;
    connections_.emplace(connection.get(), connection);
    ++use->connections;
    Counters::Add(counters_->connectionsOpen, 1);
    if (over_limit || over_uid_limit) {
      Counters::Add(counters_->connectionsRefused);
      if (over_limit) {
        QN_LOG(*log_, scope_.get(), LogLevel::kError,
               "%s:%d:%s: %s refused: %zu connections are open, the most allowed",
               connection->Description(), options_.max_connections);
      } else {
        QN_LOG(*log_, scope_.get(), LogLevel::kError,
               "%s:%d:%s: %s refused: uid %u has %zu connections open, the most one user may",
               connection->Description(), credentials.uid, options_.max_connections_per_uid);
      }
      connection->Refuse(protocol::ConnectionError::kTooManyConnections,
                         StringWithFormat("the daemon serves %zu connections, the most it allows; "
                                          "try again later",
                                          options_.max_connections));
      StartAccept();
      return;
    }
    const bool accepted = delegate_ && delegate_->ShouldAcceptNewConnection(*this, connection);
    if (!accepted) connection->Finish();
    StartAccept();
  }

  void DoStop() {
    if (stopped_) return;
    stopped_ = true;
    asio::error_code ignored;
    acceptor_.close(ignored);
    backoff_.cancel();
    RemoveSocketFile();
    // Finish removes each connection from the registry; walk a copy.
    std::vector<std::shared_ptr<LinuxConnection>> open;
    open.reserve(connections_.size());
    for (auto& [raw, connection] : connections_) open.push_back(connection);
    for (auto& connection : open) connection->Finish();
    if (options_.notify_ready) sd_notify(0, "STOPPING=1");
  }

  void RemoveSocketFile() {
    if (bound_path_.empty()) return;
    struct stat info;
    // Only our own socket file: another daemon may have replaced it since.
    if (::lstat(bound_path_.c_str(), &info) == 0 && S_ISSOCK(info.st_mode) &&
        info.st_ino == bound_inode_) {
      ::unlink(bound_path_.c_str());
    }
    bound_path_.clear();
  }

  const LinuxIpcOptions options_;
  const std::shared_ptr<Log> log_;
  const std::shared_ptr<Counters> counters_;
  const std::shared_ptr<const LogScope> scope_;
  // Shared with the connections: a connection that outlives the listener (a reply in
  // progress on another thread holds it) still destroys its socket against a live context.
  const std::shared_ptr<asio::io_context> io_ = std::make_shared<asio::io_context>(1);
  Protocol::acceptor acceptor_;
  asio::steady_timer backoff_;
  Fd lock_;
  std::string bound_path_;
  ino_t bound_inode_;

  // io_context thread only (set before Resume for the delegate).
  std::shared_ptr<IpcListenerDelegate> delegate_;
  std::unordered_map<LinuxConnection*, std::shared_ptr<LinuxConnection>> connections_;
  std::unordered_map<uid_t, std::shared_ptr<IpcUse>> uses_;  // uids with a connection open
  // Every uid's HeldBytes while anything holds it, so a uid that reconnects finds the bytes
  // the service still holds for it.
  std::unordered_map<uid_t, std::weak_ptr<HeldBytes>> held_;
  const std::shared_ptr<IpcUse> total_use_ = std::make_shared<IpcUse>();
  int budget_holds_ = 0;
  bool budget_wake_posted_ = false;
  bool stopped_ = false;
  bool accept_failing_ = false;
  std::atomic<int> store_holds_{0};
};

LinuxConnection::LinuxConnection(LinuxIpcListener& listener, Socket socket, pid_t pid, uid_t uid,
                                 std::shared_ptr<IpcUse> uid_use)
    : listener_(listener),
      io_(listener.io()),
      log_(listener.log()),
      scope_(listener.scope()),
      counters_(listener.counters()),
      options_(listener.options()),
      max_outgoing_bytes_(listener.options().max_outgoing_bytes),
      pause_reply_bytes_(std::max<std::size_t>(1, max_outgoing_bytes_ / 8)),
      error_flush_timeout_ms_(listener.options().error_flush_timeout_ms),
      socket_(std::move(socket)),
      pid_(pid),
      uid_(uid),
      description_(
          StringWithFormat("<connection pid=%d uid=%u fd=%d>", pid, uid, socket_.native_handle())),
      close_timer_(*listener.io()),
      store_timer_(*listener.io()),
      frame_timer_(*listener.io()),
      uid_use_(std::move(uid_use)),
      total_use_(listener.total_use()) {}

void LinuxConnection::Resume() {
  asio::dispatch(*io_, [self = shared_from_this()] {
    if (self->resumed_) return;
    {
      std::lock_guard lock(self->mu_);
      if (self->state_ != State::kOpen) return;
    }
    self->resumed_ = true;
    self->read_buffer_ = std::make_unique<char[]>(kReadChunkBytes);
    self->Pump();
  });
}

LinuxConnection::Hold LinuxConnection::WhyHeld(bool reading) {
  if (untaken_requests_ >= options_.max_pending_requests ||
      untaken_bytes_ >= options_.max_pending_request_bytes) {
    return Hold::kRequests;
  }
  {
    std::lock_guard lock(mu_);
    if (pending_.size() + writing_bytes_ >= pause_reply_bytes_) return Hold::kReplies;
  }
  for (std::size_t b = 0; b < kIpcBudgetCount; ++b) {
    if (b == kIpcFrameBytes && (!reading || decoder_.Missing() > 0)) {
      // A frame in progress reads on to its end once admitted (its whole length is counted
      // already) and waits until then.
      if (!reading || FrameAdmitted()) continue;
      held_budget_ = kIpcFrameBytes;
      return Hold::kBudget;
    }
    const IpcByteBudget& budget = options_.budgets[b];
    if (uid_use_->bytes[b].load(std::memory_order_relaxed) >= budget.per_uid ||
        total_use_->bytes[b].load(std::memory_order_relaxed) >= budget.total) {
      held_budget_ = static_cast<IpcBudget>(b);
      return Hold::kBudget;
    }
  }
  if (!sends_messages_) return Hold::kNone;
  const HeldBytes& held = *uid_use_->held;
  held_kind_ =
      held.Get(HeldBytes::kStore) >= static_cast<std::int64_t>(options_.max_store_bytes_per_uid)
          ? HeldBytes::kStore
      : held.Get(HeldBytes::kParked) >= static_cast<std::int64_t>(options_.max_parked_bytes_per_uid)
          ? HeldBytes::kParked
          : HeldBytes::kKindCount;
  if (held_kind_ != HeldBytes::kKindCount ||
      (options_.message_intake_blocked && options_.message_intake_blocked())) {
    return Hold::kStore;
  }
  return Hold::kNone;
}

void LinuxConnection::Pump() {
  {
    std::lock_guard lock(mu_);
    if (state_ != State::kOpen) return;
  }
  if (!resumed_) return;
  yielded_ = false;
  const bool ok = HandleFrames();
  CloseBatch();
  if (!ok) return;
  CountFrameBytes();
  WatchPartialFrame();
  if (yielded_) {
    asio::post(*io_, [self = shared_from_this()] { self->Pump(); });
    return;
  }
  const Hold hold = WhyHeld(true);
  SetHold(hold);
  if (hold == Hold::kStore) {
    // The store's writer wakes held connections after each batch (WakeStoreHeld); this
    // look covers the messages still on their way to it.
    store_timer_.expires_after(kStoreRecheck);
    store_timer_.async_wait([self = shared_from_this()](const asio::error_code& error) {
      if (!error) self->Pump();
    });
  }
  if (hold == Hold::kNone && !read_in_flight_ && !peer_done_) StartRead();
}

void LinuxConnection::SetHold(Hold hold) {
  if (hold == hold_) return;
  if (hold != Hold::kNone) {
    Counters::Add(hold == Hold::kRequests               ? counters_->pausedForRequests
                  : hold == Hold::kReplies              ? counters_->pausedForReplies
                  : hold == Hold::kBudget               ? counters_->pausedForBudget[held_budget_]
                  : held_kind_ != HeldBytes::kKindCount ? counters_->pausedForHeld[held_kind_]
                                                        : counters_->pausedForStore);
  }
  if (hold_ == Hold::kStore) listener_.CountStoreHold(-1);
  if (hold == Hold::kStore) listener_.CountStoreHold(1);
  if (hold_ == Hold::kBudget) listener_.CountBudgetHold(-1);
  if (hold == Hold::kBudget) listener_.CountBudgetHold(1);
  hold_ = hold;
}

bool LinuxConnection::Count(IpcBudget budget, std::size_t bytes) {
  if (budget != kIpcReplyBytes && finished_) bytes = 0;
  const std::size_t before = std::exchange(counted_[budget], bytes);
  if (bytes >= before) {
    uid_use_->bytes[budget].fetch_add(bytes - before, std::memory_order_relaxed);
    total_use_->bytes[budget].fetch_add(bytes - before, std::memory_order_relaxed);
    return false;
  }
  uid_use_->bytes[budget].fetch_sub(before - bytes, std::memory_order_relaxed);
  total_use_->bytes[budget].fetch_sub(before - bytes, std::memory_order_relaxed);
  return true;
}

void LinuxConnection::CountRepliesLocked() {
  Count(kIpcReplyBytes,
        state_ == State::kEnded ? 0 : pending_.size() + writing_bytes_ + reply_room_);
}

void LinuxConnection::Released() {
  {
    std::lock_guard lock(mu_);
    if (state_ == State::kEnded) return;  // the listener may be gone
  }
  listener_.WakeBudgetHeld();
}

void LinuxConnection::CountFrameBytes() {
  const std::size_t missing = decoder_.Missing();
  if (missing > 0 && !FrameAdmitted()) {
    // Everything buffered belongs to the frame in progress.
    const std::size_t whole = decoder_.buffered() + missing;
    const std::size_t mine = counted_[kIpcFrameBytes];
    const IpcByteBudget& budget = options_.budgets[kIpcFrameBytes];
    const auto fits = [&](const IpcUse& use, std::size_t limit) {
      const std::size_t others = use.bytes[kIpcFrameBytes].load(std::memory_order_relaxed) - mine;
      return others == 0 || others + whole <= limit;
    };
    if (fits(*uid_use_, budget.per_uid) && fits(*total_use_, budget.total)) {
      admitted_frame_ = frames_read_ + 1;
      // The peer's time for the frame starts now: the wait for admission was the daemon's.
      if (frame_watched_) frame_timer_.cancel();
      frame_watched_ = false;
    }
  }
  const std::size_t bytes = missing == 0      ? decoder_.buffered()
                            : FrameAdmitted() ? decoder_.buffered() + missing
                                              : 0;
  if (Count(kIpcFrameBytes, bytes)) Released();
}

void LinuxConnection::WatchPartialFrame() {
  if (decoder_.buffered() == 0) {
    if (frame_watched_) frame_timer_.cancel();
    frame_watched_ = false;
    return;
  }
  if (frame_watched_) return;
  frame_watched_ = true;
  frames_at_watch_ = frames_read_;
  frame_timer_.expires_after(std::chrono::milliseconds(options_.partial_frame_timeout_ms));
  frame_timer_.async_wait(
      [self = shared_from_this(), run = ++frame_watch_](const asio::error_code& error) {
        if (!error && run == self->frame_watch_) self->OnPartialFrameTimer();
      });
}

void LinuxConnection::OnPartialFrameTimer() {
  frame_watched_ = false;
  {
    std::lock_guard lock(mu_);
    if (state_ != State::kOpen) return;
  }
  // Whole frames went through since, or the bytes wait for the service, not for the peer
  // (a frame waiting for admission among them). A peer that leaves its replies unread is
  // not waiting for the service.
  const bool waits_for_service =
      hold_ == Hold::kRequests || hold_ == Hold::kStore || hold_ == Hold::kBudget;
  if (frames_read_ != frames_at_watch_ || waits_for_service) {
    WatchPartialFrame();
    return;
  }
  Counters::Add(counters_->partialFrames);
  Fail(protocol::ConnectionError::kBadMessagePack,
       StringWithFormat("no whole frame within %d ms (%zu bytes of a frame pending)",
                        options_.partial_frame_timeout_ms, decoder_.buffered()));
}

void LinuxConnection::StartRead() {
  read_in_flight_ = true;
  socket_.async_read_some(
      asio::buffer(read_buffer_.get(), kReadChunkBytes),
      [self = shared_from_this()](const asio::error_code& error, std::size_t bytes) {
        self->OnRead(error, bytes);
      });
}

void LinuxConnection::OnRead(const asio::error_code& error, std::size_t bytes) {
  read_in_flight_ = false;
  {
    std::lock_guard lock(mu_);
    if (state_ != State::kOpen) return;
  }
  if (error) {
    if (error == asio::error::eof && decoder_.buffered() > 0) {
      Fail(protocol::ConnectionError::kBadMessagePack,
           StringWithFormat("end of stream inside a frame (%zu bytes pending)",
                            decoder_.buffered()));
      return;
    }
    if (error == asio::error::eof) {
      // The peer has sent all it will; it may still read. What it sent is answered first.
      peer_done_ = true;
      FinishIfAnswered();
      return;
    }
    Finish();
    return;
  }
  decoder_.Feed(std::string_view(read_buffer_.get(), bytes));
  Pump();
}

void LinuxConnection::FinishIfAnswered() {
  if (!peer_done_ || untaken_requests_ > 0) return;
  {
    std::lock_guard lock(mu_);
    if (state_ != State::kOpen || write_active_ || !pending_.empty()) return;
  }
  Finish();
}

bool LinuxConnection::HandleFrames() {
  for (int handed = 0; WhyHeld(false) == Hold::kNone; ++handed) {
    if (handed == kFramesPerTurn) {
      // Let the other connections' requests in before this one goes on.
      yielded_ = true;
      return true;
    }
    auto body = decoder_.Next();
    if (!body) break;
    ++frames_read_;
    const std::size_t bytes = body->size() + kFrameHeaderBytes;
    auto decoded = DecodeMsgPack(*body);
    if (auto* problem = std::get_if<protocol::RequestProblem>(&decoded)) {
      Fail(problem->code, problem->message);
      return false;
    }
    const Value& request = std::get<Value>(decoded);
    auto checked = protocol::ValidateRequest(request);
    if (auto* problem = std::get_if<protocol::RequestProblem>(&checked)) {
      Fail(problem->code, problem->message);
      return false;
    }
    const auto header = std::get<protocol::RequestHeader>(checked);
    if (protocol::IsPrivileged(header.op) && uid_ != 0 && uid_ != options_.privileged_uid) {
      Fail(protocol::ConnectionError::kNotPermitted,
           StringWithFormat("%s is allowed only to root and uid %u, not to uid %u (request %u)",
                            protocol::OpName(header.op), options_.privileged_uid, uid_,
                            header.request_id));
      return false;
    }
    const Array& items = *request.as_array();
    if (const Array* ids = header.op == protocol::Op::kSendMessage ? items[5].as_array() : nullptr;
        ids && ids->size() > options_.max_reporter_ids) {
      Fail(protocol::ConnectionError::kBadArguments,
           StringWithFormat("the reporter ID list of request %u holds %zu IDs, more than the %zu "
                            "allowed",
                            header.request_id, ids->size(), options_.max_reporter_ids));
      return false;
    }
    Array args(items.begin() + 2, items.end());
    if (!object_) {
      QN_LOG(*log_, scope_.get(), LogLevel::kError,
             "%s:%d:%s: %s: request %u (%s) dropped: no exported object", description_,
             header.request_id, protocol::OpName(header.op));
      continue;
    }
    Counters::Add(counters_->requests[static_cast<std::size_t>(header.op)]);
    if (header.op == protocol::Op::kSendMessage) sends_messages_ = true;
    ++batch_requests_;
    batch_bytes_ += bytes;
    ++untaken_requests_;
    untaken_bytes_ += bytes;
    Count(kIpcRequestBytes, untaken_bytes_);
    // The reply's room counts in the reply budget until the reply takes its place.
    const std::size_t room = protocol::ReplyRoomOf(header.op);
    {
      std::lock_guard lock(mu_);
      reply_room_ += room;
      CountRepliesLocked();
    }
    std::weak_ptr<LinuxConnection> weak = shared_from_this();
    const std::uint32_t request_id = header.request_id;
    object_->HandleRequest(header.op, args, [weak, request_id, room](Value result) {
      if (auto connection = weak.lock()) {
        connection->QueueReply(request_id, std::move(result), room);
      }
    });
    std::lock_guard lock(mu_);
    if (state_ != State::kOpen) return false;  // the exported object closed us, or overflow
  }
  if (auto& problem = decoder_.error()) {
    Fail(problem->code, problem->message);
    return false;
  }
  return true;
}

void LinuxConnection::CloseBatch() {
  if (batch_requests_ == 0 || !object_) return;
  const std::size_t requests = std::exchange(batch_requests_, 0);
  const std::size_t bytes = std::exchange(batch_bytes_, 0);
  std::weak_ptr<LinuxConnection> weak = shared_from_this();
  object_->AfterRequests([weak, io = io_, requests, bytes] {
    asio::post(*io, [weak, requests, bytes] {
      if (auto connection = weak.lock()) connection->OnBatchTaken(requests, bytes);
    });
  });
}

void LinuxConnection::OnBatchTaken(std::size_t requests, std::size_t bytes) {
  untaken_requests_ -= requests;
  untaken_bytes_ -= bytes;
  if (Count(kIpcRequestBytes, untaken_bytes_)) Released();
  if (!error_frame_.empty()) {
    if (untaken_requests_ == 0) SendErrorFrame();
    return;
  }
  if (hold_ == Hold::kRequests || hold_ == Hold::kBudget) Pump();
  FinishIfAnswered();
}

void LinuxConnection::Fail(protocol::ConnectionError code, const std::string& message) {
  {
    std::lock_guard lock(mu_);
    if (state_ != State::kOpen) return;
    state_ = State::kDraining;
  }
  QN_LOG(*log_, scope_.get(), LogLevel::kError,
         "%s:%d:%s: %s: bad input (code %lld): %s; closing the connection", description_,
         static_cast<long long>(code), message);
  const auto index = static_cast<std::size_t>(code);
  if (index < counters_->badFrames.size()) Counters::Add(counters_->badFrames[index]);
  AppendFrame(error_frame_, protocol::MakeConnectionError(code, message));
  store_timer_.cancel();
  CloseBatch();
  if (untaken_requests_ == 0) SendErrorFrame();
}

void LinuxConnection::Refuse(protocol::ConnectionError code, const std::string& message) {
  {
    std::lock_guard lock(mu_);
    if (state_ != State::kOpen) return;
    state_ = State::kDraining;
  }
  AppendFrame(error_frame_, protocol::MakeConnectionError(code, message));
  SendErrorFrame();
}

void LinuxConnection::SendErrorFrame() {
  {
    std::lock_guard lock(mu_);
    if (state_ != State::kDraining) return;
    state_ = State::kClosing;
    pending_ += error_frame_;
    if (!write_active_) StartWriteLocked();
  }
  error_frame_.clear();
  close_timer_.expires_after(std::chrono::milliseconds(error_flush_timeout_ms_));
  close_timer_.async_wait([self = shared_from_this()](const asio::error_code& error) {
    if (!error) self->Finish();
  });
}

void LinuxConnection::QueueReply(std::uint32_t request_id, Value result, std::size_t room) {
  std::string frame;
  const bool fits = AppendFrame(frame, Value(Array{Value(request_id), std::move(result)}));
  std::lock_guard lock(mu_);
  // A request answered twice gives its room back twice; the room never goes below zero.
  reply_room_ -= std::min(room, reply_room_);
  if (!fits) {
    CountRepliesLocked();
    asio::post(*io_,
               [self = shared_from_this(), request_id] { self->OnReplyTooLarge(request_id); });
    return;
  }
  if (state_ != State::kOpen && state_ != State::kDraining) {
    CountRepliesLocked();
    return;
  }
  pending_ += frame;
  if (pending_.size() + writing_bytes_ > max_outgoing_bytes_) {
    pending_.clear();
    CountRepliesLocked();
    state_ = State::kClosing;
    asio::post(*io_, [self = shared_from_this()] { self->OnOverflow(); });
    return;
  }
  CountRepliesLocked();
  if (!write_active_) {
    write_active_ = true;
    asio::post(*io_, [self = shared_from_this()] {
      std::lock_guard lock(self->mu_);
      if (self->state_ == State::kEnded) return;
      self->write_active_ = false;
      if (!self->pending_.empty()) self->StartWriteLocked();
    });
  }
}

void LinuxConnection::OnReplyTooLarge(std::uint32_t request_id) {
  Counters::Add(counters_->repliesTooLarge);
  Fail(protocol::ConnectionError::kReplyTooLarge,
       StringWithFormat("the reply to request %u does not fit in a frame (%zu bytes at most)",
                        request_id, protocol::kMaxBodyBytes));
}

void LinuxConnection::OnOverflow() {
  Counters::Add(counters_->repliesUnread);
  QN_LOG(*log_, scope_.get(), LogLevel::kError,
         "%s:%d:%s: %s: peer does not read its replies (more than %zu bytes queued); closing "
         "the connection",
         description_, max_outgoing_bytes_);
  Finish();
}

void LinuxConnection::StartWriteLocked() {
  // Everything queued so far goes out in one write.
  writing_.swap(pending_);
  pending_.clear();
  if (pending_.capacity() > kKeptBufferCapacity) std::string().swap(pending_);
  writing_bytes_ = writing_.size();
  write_active_ = true;
  asio::async_write(socket_, asio::buffer(writing_),
                    [self = shared_from_this()](const asio::error_code& error, std::size_t) {
                      self->OnWrite(error);
                    });
}

void LinuxConnection::OnWrite(const asio::error_code& error) {
  if (error) {
    Finish();
    return;
  }
  std::unique_lock lock(mu_);
  if (state_ == State::kEnded) return;
  writing_.clear();
  if (writing_.capacity() > kKeptBufferCapacity) std::string().swap(writing_);
  writing_bytes_ = 0;
  write_active_ = false;
  CountRepliesLocked();
  if (!pending_.empty()) {
    StartWriteLocked();
    lock.unlock();
    listener_.WakeBudgetHeld();
    return;
  }
  const State state = state_;
  lock.unlock();
  if (state != State::kClosing) listener_.WakeBudgetHeld();
  if (state == State::kClosing) {
    Finish();  // the error frame is out
  } else if (hold_ == Hold::kReplies) {
    Pump();
  } else {
    FinishIfAnswered();
  }
}

void LinuxConnection::Finish() {
  {
    std::lock_guard lock(mu_);
    if (state_ == State::kEnded) return;
    state_ = State::kEnded;
    pending_.clear();
    CountRepliesLocked();
  }
  asio::error_code ignored;
  socket_.shutdown(Socket::shutdown_both, ignored);
  socket_.close(ignored);
  close_timer_.cancel();
  store_timer_.cancel();
  frame_timer_.cancel();
  SetHold(Hold::kNone);
  finished_ = true;
  Count(kIpcRequestBytes, 0);
  Count(kIpcFrameBytes, 0);
  listener_.WakeBudgetHeld();
  auto keep = shared_from_this();
  listener_.Forget(this);
  auto invalidation = std::move(invalidation_);
  auto object = std::move(object_);
  invalidation_ = nullptr;
  interruption_ = nullptr;
  object_ = nullptr;
  if (invalidation) invalidation();
}

void LinuxConnection::Abandon() {
  {
    std::lock_guard lock(mu_);
    state_ = State::kEnded;
    pending_.clear();
  }
  asio::error_code ignored;
  socket_.close(ignored);
  close_timer_.cancel();
  store_timer_.cancel();
  frame_timer_.cancel();
  invalidation_ = nullptr;
  interruption_ = nullptr;
  object_ = nullptr;
}

}  // namespace

LinuxIpcListenerResult NewLinuxIpcListener(const LinuxIpcOptions& options, std::shared_ptr<Log> log,
                                           std::shared_ptr<const LogScope> scope) {
  LinuxIpcListenerResult result;
  std::optional<ListeningSocket> socket;
  if (options.socket_activation) socket = ActivatedSocket();
  if (!socket) socket = BindPath(options.socket_path);
  if (!socket->error.empty()) {
    result.error = std::move(socket->error);
    return result;
  }
  auto listener = std::make_shared<LinuxIpcListener>(options, std::move(log), std::move(scope),
                                                     std::move(*socket));
  result.wake_message_intake = [weak = std::weak_ptr<LinuxIpcListener>(listener)] {
    if (auto held = weak.lock()) held->WakeStoreHeld();
  };
  result.listener = std::move(listener);
  return result;
}

}  // namespace qn
