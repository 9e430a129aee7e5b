#include "common/Files.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <ctime>
#include <utility>
#include <vector>

namespace qn {

namespace {

bool IsDirectory(const std::string& path) {
  struct stat st;
  return ::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// Makes one directory with exactly `mode`, or accepts an existing directory.
std::optional<Error> MakeOneDirectory(const std::string& path, mode_t mode) {
  if (::mkdir(path.c_str(), mode) == 0) {
    if (::chmod(path.c_str(), mode) != 0) return ErrnoError("chmod " + path, errno);
    return std::nullopt;
  }
  const int mkdir_errno = errno;
  if (mkdir_errno == EEXIST) {
    if (IsDirectory(path)) return std::nullopt;
    return ErrnoError("create directory " + path, ENOTDIR);
  }
  return ErrnoError("create directory " + path, mkdir_errno);
}

// Writes all of `contents` to fd, retrying short writes and interruptions.
bool WriteAll(int fd, std::string_view contents) {
  while (!contents.empty()) {
    ssize_t n = ::write(fd, contents.data(), contents.size());
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    contents.remove_prefix(static_cast<std::size_t>(n));
  }
  return true;
}

// A temporary name beside `base` that is unlikely to be taken; the caller creates it with
// O_EXCL and tries another on EEXIST.
std::string TemporaryName(const std::string& base) {
  static std::atomic<unsigned> counter{0};
  const auto ticks = std::chrono::steady_clock::now().time_since_epoch().count();
  char suffix[64];
  std::snprintf(suffix, sizeof suffix, ".tmp-%d-%u-%llx", static_cast<int>(::getpid()),
                counter.fetch_add(1, std::memory_order_relaxed),
                static_cast<unsigned long long>(ticks) & 0xffffffULL);
  return "." + base + suffix;
}

// Opens (making it with exactly `mode` when missing) the folder `name` inside `parent`,
// refusing a symbolic link and a folder of another user. `shown` names it in errors.
std::optional<Error> OpenOwnFolderAt(int parent, const std::string& name, const std::string& shown,
                                     mode_t mode, FileDescriptor& folder) {
  const bool made = ::mkdirat(parent, name.c_str(), mode) == 0;
  if (!made && errno != EEXIST) return ErrnoError("create directory " + shown, errno);
  FileDescriptor fd(
      ::openat(parent, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (fd.get() < 0) {
    const int e = errno;
    if (e == ELOOP) return ErrnoError("refusing " + shown + ", a symbolic link", e);
    return ErrnoError("open directory " + shown, e);
  }
  struct stat st;
  if (::fstat(fd.get(), &st) != 0) return ErrnoError("stat " + shown, errno);
  if (st.st_uid != ::geteuid()) {
    return ErrnoError("refusing " + shown + ", owned by uid " + std::to_string(st.st_uid), EPERM);
  }
  // A folder made here gets exactly `mode` (the umask may have narrowed it); one that was
  // there loses the bits beyond `mode`, so no one else can write into it.
  const mode_t wanted = made ? mode : (st.st_mode & 07777 & mode);
  if ((st.st_mode & 07777) != wanted && ::fchmod(fd.get(), wanted) != 0) {
    return ErrnoError("chmod " + shown, errno);
  }
  folder = std::move(fd);
  return std::nullopt;
}

}  // namespace

FileDescriptor::FileDescriptor(FileDescriptor&& other) noexcept
    : fd_(std::exchange(other.fd_, -1)) {}

FileDescriptor& FileDescriptor::operator=(FileDescriptor&& other) noexcept {
  if (this != &other) {
    Reset();
    fd_ = std::exchange(other.fd_, -1);
  }
  return *this;
}

int FileDescriptor::release() { return std::exchange(fd_, -1); }

void FileDescriptor::Reset() {
  if (fd_ >= 0) ::close(fd_);
  fd_ = -1;
}

std::optional<Error> OpenOwnFolder(const std::string& base, const std::string& path, mode_t mode,
                                   FileDescriptor& folder) {
  std::string top = base;
  while (top.size() > 1 && top.back() == '/') top.pop_back();
  std::string below;
  if (!top.empty() && path.size() > top.size() + 1 && path.starts_with(top) &&
      (top == "/" || path[top.size()] == '/')) {
    below = path.substr(top == "/" ? 1 : top.size() + 1);
  } else {
    const std::size_t slash = path.find_last_of('/', path.find_last_not_of('/'));
    top = slash == std::string::npos ? "." : slash == 0 ? "/" : path.substr(0, slash);
    below = slash == std::string::npos ? path : path.substr(slash + 1);
  }
  if (auto error = CreateDirectories(top, mode)) return error;
  FileDescriptor current(::open(top.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (current.get() < 0) return ErrnoError("open directory " + top, errno);
  std::string shown = top == "/" ? "" : top;
  for (std::size_t start = 0; start < below.size();) {
    std::size_t end = below.find('/', start);
    if (end == std::string::npos) end = below.size();
    const std::string name = below.substr(start, end - start);
    start = end + 1;
    if (name.empty() || name == ".") continue;
    shown += "/" + name;
    if (name == "..") return ErrnoError("refusing " + shown, EINVAL);
    FileDescriptor next;
    if (auto error = OpenOwnFolderAt(current.get(), name, shown, mode, next)) return error;
    current = std::move(next);
  }
  folder = std::move(current);
  return std::nullopt;
}

std::optional<Error> CheckPrivateFolder(const std::string& path) {
  struct stat seen;
  if (::lstat(path.c_str(), &seen) != 0) return ErrnoError("stat " + path, errno);
  if (S_ISLNK(seen.st_mode)) return ErrnoError(path + " is a symbolic link", ELOOP);
  if (!S_ISDIR(seen.st_mode)) return ErrnoError(path + " is not a folder", ENOTDIR);
  FileDescriptor folder(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  struct stat st;
  if (folder.get() < 0) return ErrnoError("open " + path, errno);
  if (::fstat(folder.get(), &st) != 0) return ErrnoError("stat " + path, errno);
  if (st.st_dev != seen.st_dev || st.st_ino != seen.st_ino) {
    return ErrnoError(path + " changed while it was checked", EAGAIN);
  }
  if (st.st_uid != ::geteuid()) {
    return ErrnoError(path + " belongs to uid " + std::to_string(st.st_uid) + ", not to uid " +
                          std::to_string(::geteuid()) + " that runs this process",
                      EPERM);
  }
  if (st.st_mode & (S_IWGRP | S_IWOTH)) {
    char mode[8];
    std::snprintf(mode, sizeof mode, "%04o", static_cast<unsigned>(st.st_mode & 07777));
    return ErrnoError(path + " has mode " + mode + ": others may write to it", EPERM);
  }
  return std::nullopt;
}

RemovedFiles RemoveOldestFiles(int dir_fd, std::string_view suffix, std::size_t max_files,
                               std::uint64_t max_bytes, std::string_view keep) {
  struct Entry {
    timespec modified;
    std::string name;
    std::uint64_t bytes;
  };
  std::vector<Entry> entries;
  std::uint64_t total = 0;
  // fdopendir takes the descriptor it is given; the caller's stays open.
  const int own = ::openat(dir_fd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  DIR* stream = own < 0 ? nullptr : ::fdopendir(own);
  if (!stream) {
    if (own >= 0) ::close(own);
    return {};
  }
  while (const dirent* entry = ::readdir(stream)) {
    const std::string_view name = entry->d_name;
    if (name.starts_with('.') || !name.ends_with(suffix)) continue;
    struct stat st;
    if (::fstatat(dir_fd, entry->d_name, &st, AT_SYMLINK_NOFOLLOW) != 0 || !S_ISREG(st.st_mode)) {
      continue;
    }
    entries.push_back({st.st_mtim, std::string(name), static_cast<std::uint64_t>(st.st_size)});
    total += static_cast<std::uint64_t>(st.st_size);
  }
  ::closedir(stream);
  RemovedFiles removed;
  if (entries.size() <= max_files && total <= max_bytes) return removed;
  std::sort(entries.begin(), entries.end(), [](const Entry& a, const Entry& b) {
    if (a.modified.tv_sec != b.modified.tv_sec) return a.modified.tv_sec < b.modified.tv_sec;
    if (a.modified.tv_nsec != b.modified.tv_nsec) return a.modified.tv_nsec < b.modified.tv_nsec;
    return a.name < b.name;
  });
  std::size_t count = entries.size();
  for (const Entry& entry : entries) {
    if (count <= max_files && total <= max_bytes) break;
    if (entry.name == keep) continue;
    if (::unlinkat(dir_fd, entry.name.c_str(), 0) != 0) continue;
    --count;
    total -= entry.bytes;
    ++removed.files;
    removed.bytes += entry.bytes;
  }
  return removed;
}

std::size_t RemoveTemporaryFiles(const std::string& dir) {
  DIR* stream = ::opendir(dir.c_str());
  if (!stream) return 0;
  std::size_t removed = 0;
  while (const dirent* entry = ::readdir(stream)) {
    const std::string_view name = entry->d_name;
    if (!name.starts_with('.') || name.find(".tmp-") == std::string_view::npos) continue;
    if (::unlinkat(::dirfd(stream), entry->d_name, 0) == 0) ++removed;
  }
  ::closedir(stream);
  return removed;
}

std::optional<Error> CreateDirectories(const std::string& path, mode_t mode) {
  if (path.empty()) return ErrnoError("create directory ''", ENOENT);
  if (IsDirectory(path)) return std::nullopt;
  // Each prefix that ends a component, then the whole path. "//" and a trailing "/" make
  // empty components, which are skipped.
  for (std::size_t slash = path.find('/', 1); slash != std::string::npos;
       slash = path.find('/', slash + 1)) {
    if (path[slash - 1] == '/') continue;
    if (auto error = MakeOneDirectory(path.substr(0, slash), mode)) return error;
  }
  if (path.back() == '/') return std::nullopt;
  return MakeOneDirectory(path, mode);
}

std::optional<Error> WriteFileAtomicallyAt(int dir_fd, const std::string& dir_path,
                                           const std::string& name, std::string_view contents,
                                           std::optional<mode_t> mode) {
  const std::string shown_dir = dir_path == "/" ? "" : dir_path;
  std::string temp;
  int fd = -1;
  for (int attempt = 0; attempt < 100 && fd < 0; ++attempt) {
    temp = TemporaryName(name);
    fd = ::openat(dir_fd, temp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC,
                  mode.value_or(0666));
    if (fd < 0 && errno != EEXIST) return ErrnoError("create " + shown_dir + "/" + temp, errno);
  }
  if (fd < 0) return ErrnoError("create " + shown_dir + "/" + temp, EEXIST);

  auto fail = [&](const std::string& what) {
    const int saved = errno;
    if (fd >= 0) ::close(fd);
    ::unlinkat(dir_fd, temp.c_str(), 0);
    return ErrnoError(what, saved);
  };
  const std::string shown = shown_dir + "/" + temp;
  if (mode && ::fchmod(fd, *mode) != 0) return fail("chmod " + shown);  // past the umask
  if (!WriteAll(fd, contents)) return fail("write " + shown);
  if (::fsync(fd) != 0) return fail("fsync " + shown);
  const int to_close = fd;
  fd = -1;
  if (::close(to_close) != 0) return fail("close " + shown);
  if (::renameat(dir_fd, temp.c_str(), dir_fd, name.c_str()) != 0) {
    return fail("rename " + shown + " to " + shown_dir + "/" + name);
  }
  // Make the rename itself durable. Some file systems cannot fsync a directory (EINVAL).
  if (::fsync(dir_fd) != 0 && errno != EINVAL) return ErrnoError("fsync " + dir_path, errno);
  return std::nullopt;
}

std::optional<Error> WriteFileAtomically(const std::string& path, std::string_view contents,
                                         std::optional<mode_t> mode) {
  const std::size_t slash = path.rfind('/');
  const std::string dir = slash == std::string::npos ? "."
                          : slash == 0               ? "/"
                                                     : path.substr(0, slash);
  const std::string base = slash == std::string::npos ? path : path.substr(slash + 1);
  if (base.empty()) return ErrnoError("write " + path, EISDIR);
  FileDescriptor dir_fd(::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (dir_fd.get() < 0) return ErrnoError("open " + dir, errno);
  return WriteFileAtomicallyAt(dir_fd.get(), dir, base, contents, mode);
}

std::string FormatLocalTime(Date date, std::string_view pattern) {
  double seconds = date.seconds_since_1970;
  if (!std::isfinite(seconds) || std::fabs(seconds) > 1e14) seconds = 0;
  // Whole milliseconds first, as a date formatter counts time, then split.
  const auto total_millis = static_cast<long long>(std::floor(seconds * 1000));
  long long whole = total_millis / 1000;
  int millis = static_cast<int>(total_millis % 1000);
  if (millis < 0) {
    millis += 1000;
    whole -= 1;
  }
  const std::time_t t = static_cast<std::time_t>(whole);
  std::tm tm{};
  ::tzset();  // pick up the current TZ
  if (!localtime_r(&t, &tm)) gmtime_r(&t, &tm);

  std::string out;
  auto number = [&out](long value, std::size_t digits) {
    char buf[32];
    std::snprintf(buf, sizeof buf, "%0*ld", static_cast<int>(digits), value);
    out += buf;
  };
  for (std::size_t i = 0; i < pattern.size();) {
    const char c = pattern[i];
    if (c == '\'') {
      // Quoted text up to the next quote; "''" is a quote, inside quotes too.
      if (i + 1 < pattern.size() && pattern[i + 1] == '\'') {
        out += '\'';
        i += 2;
        continue;
      }
      ++i;
      while (i < pattern.size()) {
        if (pattern[i] == '\'') {
          if (i + 1 < pattern.size() && pattern[i + 1] == '\'') {
            out += '\'';
            i += 2;
            continue;
          }
          ++i;
          break;
        }
        out += pattern[i++];
      }
      continue;
    }
    std::size_t run = 1;
    while (i + run < pattern.size() && pattern[i + run] == c) ++run;
    switch (c) {
      case 'y':
        if (run == 2) {
          number((tm.tm_year + 1900) % 100, 2);
        } else {
          number(tm.tm_year + 1900L, run);
        }
        break;
      case 'M':
        number(tm.tm_mon + 1L, run);
        break;
      case 'd':
        number(tm.tm_mday, run);
        break;
      case 'H':
        number(tm.tm_hour, run);
        break;
      case 'm':
        number(tm.tm_min, run);
        break;
      case 's':
        number(tm.tm_sec, run);
        break;
      case 'S': {
        // Fraction of the second, truncated to `run` digits.
        char buf[8];
        std::snprintf(buf, sizeof buf, "%03d", millis);
        std::string digits(buf);
        digits.resize(run, '0');
        out += digits;
        break;
      }
      case 'Z': {
        const long offset = tm.tm_gmtoff;
        const long magnitude = offset < 0 ? -offset : offset;
        out += offset < 0 ? '-' : '+';
        number(magnitude / 3600, 2);
        number(magnitude % 3600 / 60, 2);
        break;
      }
      default:
        out.append(run, c);
    }
    i += run;
  }
  return out;
}

}  // namespace qn
