#include "platform/linux/linux_notify.h"

#include <fcntl.h>
#include <limits.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <map>
#include <mutex>
#include <thread>
#include <vector>

#include "common/Files.h"

namespace qn {
namespace {

constexpr mode_t kNotifyDirMode = 0755;
constexpr std::uint32_t kWatchMask = IN_CLOSE_WRITE | IN_MOVED_TO | IN_ONLYDIR;

bool ValidName(const std::string& name) {
  return !name.empty() && name.size() <= NAME_MAX && name != "." && name != ".." &&
         name.find('/') == std::string::npos && name.find('\0') == std::string::npos;
}

std::string NotifyDir(const std::string& runtime_dir) { return runtime_dir + "/notify"; }

// One registration. Its lock is held while its handler runs, so that Cancel can wait for a
// running handler; it is recursive so that a handler may cancel its own registration.
struct Registration {
  Registration(std::string n, std::shared_ptr<SerialQueue> q, std::function<void(int)> h, int t)
      : name(std::move(n)), queue(std::move(q)), handler(std::move(h)), token(t) {}

  void Fire() {
    std::lock_guard lock(mu);
    if (active) handler(token);
  }

  const std::string name;
  const std::shared_ptr<SerialQueue> queue;
  const std::function<void(int)> handler;
  const int token;
  std::recursive_mutex mu;
  bool active = true;  // guarded by mu
};

class LinuxNotify final : public Notify {
 public:
  explicit LinuxNotify(LinuxNotifyOptions options)
      : options_(std::move(options)), dir_(NotifyDir(options_.runtime_dir)) {}

  ~LinuxNotify() override {
    if (watcher_.joinable()) {
      const std::uint64_t one = 1;
      while (::write(wake_fd_, &one, sizeof one) < 0 && errno == EINTR) {
      }
      watcher_.join();
    }
    if (inotify_fd_ >= 0) ::close(inotify_fd_);
    if (wake_fd_ >= 0) ::close(wake_fd_);
  }

  std::uint32_t Register(const std::string& name, std::shared_ptr<SerialQueue> queue,
                         std::function<void(int token)> handler, int* token) override {
    if (!ValidName(name)) return kNotifyStatusInvalidName;
    if (!queue || !handler) return kNotifyStatusInvalidQueue;
    std::lock_guard lock(mu_);
    if (!StartWatchingLocked()) return kNotifyStatusFailed;
    const int t = next_token_++;
    registrations_[t] =
        std::make_shared<Registration>(name, std::move(queue), std::move(handler), t);
    if (token) *token = t;
    return 0;
  }

  std::uint32_t Post(const std::string& name) override {
    return PostNotification(options_.runtime_dir, name);
  }

  void Cancel(int token) override {
    std::shared_ptr<Registration> registration;
    {
      std::lock_guard lock(mu_);
      auto it = registrations_.find(token);
      if (it == registrations_.end()) return;
      registration = std::move(it->second);
      registrations_.erase(it);
    }
    std::lock_guard lock(registration->mu);  // waits for a handler running elsewhere
    registration->active = false;
  }

 private:
  // Creates the folder, the inotify watch and the watch thread, once.
  bool StartWatchingLocked() {
    if (watcher_.joinable()) return true;
    if (auto error = CreateDirectories(dir_, kNotifyDirMode)) {
      Report("cannot create the notification folder: " + error->Description());
      return false;
    }
    if (inotify_fd_ < 0) inotify_fd_ = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
    if (wake_fd_ < 0) wake_fd_ = ::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
    if (inotify_fd_ < 0 || wake_fd_ < 0) {
      Report(std::string("cannot watch notifications: ") + std::strerror(errno));
      return false;
    }
    if (::inotify_add_watch(inotify_fd_, dir_.c_str(), kWatchMask) < 0) {
      Report("cannot watch " + dir_ + ": " + std::strerror(errno));
      return false;
    }
    watcher_ = std::thread([this] { Watch(); });
    return true;
  }

  // The watch thread: reads inotify events until the destructor wakes it.
  void Watch() {
    alignas(inotify_event) char buf[16 * (sizeof(inotify_event) + NAME_MAX + 1)];
    for (;;) {
      pollfd fds[2] = {{inotify_fd_, POLLIN, 0}, {wake_fd_, POLLIN, 0}};
      if (::poll(fds, 2, -1) < 0) {
        if (errno == EINTR) continue;
        Report(std::string("notification watch failed: ") + std::strerror(errno));
        return;
      }
      if (fds[1].revents != 0) return;
      const ssize_t n = ::read(inotify_fd_, buf, sizeof buf);
      if (n <= 0) continue;  // EAGAIN or EINTR
      for (ssize_t off = 0; off < n;) {
        const auto* event = reinterpret_cast<const inotify_event*>(buf + off);
        off += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
        if (event->mask & IN_Q_OVERFLOW) {
          Deliver(nullptr);
        } else if (event->mask & IN_IGNORED) {
          Rewatch();  // the folder went away
        } else if (event->len > 0) {
          const std::string name(event->name);  // NUL-padded by the kernel
          Deliver(&name);
        }
      }
    }
  }

  // Puts the folder and its watch back after the folder was removed.
  void Rewatch() {
    if (auto error = CreateDirectories(dir_, kNotifyDirMode)) {
      Report("lost the notification folder: " + error->Description());
      return;
    }
    if (::inotify_add_watch(inotify_fd_, dir_.c_str(), kWatchMask) < 0) {
      Report("lost the notification watch on " + dir_ + ": " + std::strerror(errno));
    }
  }

  // Queues the handlers registered for `name` (every handler when null).
  void Deliver(const std::string* name) {
    std::vector<std::shared_ptr<Registration>> targets;
    {
      std::lock_guard lock(mu_);
      for (const auto& [token, registration] : registrations_) {
        if (name == nullptr || registration->name == *name) targets.push_back(registration);
      }
    }
    for (auto& registration : targets) {
      registration->queue->Async([registration] { registration->Fire(); });
    }
  }

  void Report(const std::string& what) {
    if (options_.log) QN_LOG(*options_.log, nullptr, LogLevel::kError, "%s:%d:%s: %s", what);
  }

  const LinuxNotifyOptions options_;
  const std::string dir_;

  std::mutex mu_;
  std::map<int, std::shared_ptr<Registration>> registrations_;  // guarded by mu_
  int next_token_ = 1;                                          // guarded by mu_
  // Set up once under mu_ before the watch thread starts; read-only afterwards.
  int inotify_fd_ = -1;
  int wake_fd_ = -1;
  std::thread watcher_;
};

}  // namespace

std::string NotificationFile(const std::string& runtime_dir, const std::string& name) {
  return NotifyDir(runtime_dir) + "/" + name;
}

std::uint32_t PostNotification(const std::string& runtime_dir, const std::string& name) {
  if (!ValidName(name)) return kNotifyStatusInvalidName;
  const std::string path = NotificationFile(runtime_dir, name);
  // Non-blocking, so that a FIFO planted under the name cannot hang the poster.
  const int fd = ::open(path.c_str(),
                        O_WRONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY, 0644);
  if (fd < 0) {
    // No folder: nobody has ever watched, so there is nobody to tell.
    return errno == ENOENT ? 0 : kNotifyStatusFailed;
  }
  ::futimens(fd, nullptr);  // the file's time says when it was last posted
  ::close(fd);              // the close is the event watchers see
  return 0;
}

std::shared_ptr<Notify> NewLinuxNotify(LinuxNotifyOptions options) {
  return std::make_shared<LinuxNotify>(std::move(options));
}

}  // namespace qn
