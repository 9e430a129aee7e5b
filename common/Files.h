#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "common/Error.h"
#include "common/Value.h"

namespace qn {

// File-system helpers. Errors come back as values (ErrnoError, "posix" domain). Safe from
// any thread; nothing is cached.

// An open file descriptor, closed when this goes away. Move-only; -1 when empty.
class FileDescriptor {
 public:
  FileDescriptor() = default;
  explicit FileDescriptor(int fd) : fd_(fd) {}
  FileDescriptor(FileDescriptor&& other) noexcept;
  FileDescriptor& operator=(FileDescriptor&& other) noexcept;
  FileDescriptor(const FileDescriptor&) = delete;
  FileDescriptor& operator=(const FileDescriptor&) = delete;
  ~FileDescriptor() { Reset(); }

  int get() const { return fd_; }
  int release();
  void Reset();

 private:
  int fd_ = -1;
};

// Creates the directory `path` with any missing parent directories. Each directory created
// gets exactly `mode` (set with chmod afterwards, so the umask does not narrow it);
// directories that exist already are left as they are. Succeeds when `path` already is a
// directory. Fails when a component exists and is not a directory, or mkdir fails.
std::optional<Error> CreateDirectories(const std::string& path, mode_t mode);

// Replaces the file at `path` with `contents` atomically: readers see the old file or the
// whole new one, never a part. Writes a temporary file in the same directory, fsyncs it,
// renames it over `path` and fsyncs the directory. A new file gets mode 0666 less the
// umask, or exactly `mode` when one is given. On failure no temporary file is left behind
// and the old file is untouched (unless the failure is the final directory fsync, after the
// rename).
std::optional<Error> WriteFileAtomically(const std::string& path, std::string_view contents,
                                         std::optional<mode_t> mode = std::nullopt);

// The same inside the open folder `dir_fd` (`dir_path` only names it in error texts); a
// new file gets exactly `mode` whatever the umask (without one, 0666 less the umask).
// Nothing is looked up by path: the temporary file is made with O_EXCL | O_NOFOLLOW and
// renamed into place with renameat.
std::optional<Error> WriteFileAtomicallyAt(int dir_fd, const std::string& dir_path,
                                           const std::string& name, std::string_view contents,
                                           std::optional<mode_t> mode);

// Opens the folder `path` for work relative to it, `base` being a folder the caller
// trusts as it is (made by path with `mode` when missing). Each folder of `path` below
// `base` is made with exactly `mode` when missing and opened with O_NOFOLLOW |
// O_DIRECTORY, relative to the one above it: a symbolic link is refused (ELOOP), so is a
// folder that another user owns (EPERM); group or others' write permission on a folder of
// the caller's own is taken away. When `path` does not lie below `base`, its parent is the
// trusted base. Errors name the folder at fault.
std::optional<Error> OpenOwnFolder(const std::string& base, const std::string& path, mode_t mode,
                                   FileDescriptor& folder);

// Whether `path` is a folder fit to hold the calling process's private files: a folder, not
// a symbolic link (lstat), that the process's effective user owns and that neither its
// group nor others may write to (fstat of the folder opened with O_NOFOLLOW, so a folder
// swapped in between is caught). The error says which of these fails.
std::optional<Error> CheckPrivateFolder(const std::string& path);

// What RemoveOldestFiles removed.
struct RemovedFiles {
  std::size_t files = 0;
  std::uint64_t bytes = 0;
};

// Removes the oldest regular files (by modification time, then name) whose names end with
// `suffix` in the open folder `dir_fd`, until at most `max_files` of them holding at most
// `max_bytes` remain. Hidden files (a leading ".") are left alone and not counted; `keep`
// (the file just written) counts but is never removed.
RemovedFiles RemoveOldestFiles(int dir_fd, std::string_view suffix, std::size_t max_files,
                               std::uint64_t max_bytes, std::string_view keep);

// Removes the temporary files that WriteFileAtomically leaves in `dir` when the process
// ends between creating one and renaming it (".<name>.tmp-<...>"). Call it only while no
// write into `dir` can be under way. Returns how many were removed; a missing `dir`
// removes none, and a file that cannot be removed is left.
std::size_t RemoveTemporaryFiles(const std::string& dir);

// Formats `date` in the local time zone with a date-formatter pattern: "yyyy" year, "MM"
// month, "dd" day, "HH" hour (00-23), "mm" minute, "ss" second, "SSS" milliseconds, "Z" the
// zone offset as +hhmm; text in single quotes and any character that is not a letter is
// copied as it is ("''" is a quote). Example: "yyyyMMdd-HHmmssZ" -> "20240115-143005+0100".
// Letters of other fields are copied as they are.
std::string FormatLocalTime(Date date, std::string_view pattern);

}  // namespace qn
