#pragma once

#include <sys/types.h>

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "common/Error.h"
#include "common/Value.h"

namespace qn {

// File-system helpers. Errors come back as values (ErrnoError, "posix" domain). Safe from
// any thread; nothing is cached.

// Creates the directory `path` with any missing parent directories. Each directory created
// gets exactly `mode` (set with chmod afterwards, so the umask does not narrow it);
// directories that exist already are left as they are. Succeeds when `path` already is a
// directory. Fails when a component exists and is not a directory, or mkdir fails.
std::optional<Error> CreateDirectories(const std::string& path, mode_t mode);

// Replaces the file at `path` with `contents` atomically: readers see the old file or the
// whole new one, never a part. Writes a temporary file in the same directory, fsyncs it,
// renames it over `path` and fsyncs the directory. A new file gets mode 0666 less the
// umask. On failure no temporary file is left behind and the old file is untouched
// (unless the failure is the final directory fsync, after the rename).
std::optional<Error> WriteFileAtomically(const std::string& path, std::string_view contents);

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
