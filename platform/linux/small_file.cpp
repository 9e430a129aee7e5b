#include "platform/linux/small_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

namespace qn {

std::optional<Error> ReadSmallFile(const std::string& path, std::size_t max_bytes,
                                   std::string& out) {
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
  if (fd < 0) return ErrnoError("open " + path, errno);
  struct stat st;
  if (::fstat(fd, &st) != 0) {
    const int saved = errno;
    ::close(fd);
    return ErrnoError("stat " + path, saved);
  }
  if (!S_ISREG(st.st_mode)) {
    ::close(fd);
    return ErrnoError("read " + path, S_ISDIR(st.st_mode) ? EISDIR : EINVAL);
  }
  // Files under /proc and /sys report size 0, so read until end of file, with a cap.
  std::string text;
  char buf[4096];
  for (;;) {
    const ssize_t n = ::read(fd, buf, sizeof buf);
    if (n < 0) {
      if (errno == EINTR) continue;
      const int saved = errno;
      ::close(fd);
      return ErrnoError("read " + path, saved);
    }
    if (n == 0) break;
    if (text.size() + static_cast<std::size_t>(n) > max_bytes) {
      ::close(fd);
      return ErrnoError("read " + path, EFBIG);
    }
    text.append(buf, static_cast<std::size_t>(n));
  }
  ::close(fd);
  out = std::move(text);
  return std::nullopt;
}

}  // namespace qn
