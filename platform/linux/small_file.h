#pragma once

#include <cstddef>
#include <optional>
#include <string>

#include "common/Error.h"

namespace qn {

// Reads the regular file at `path` whole into `out`. Never blocks on a FIFO or device
// (it is opened non-blocking and refused unless it is a regular file). Returns nullopt on
// success; on failure an ErrnoError ("posix" domain) whose code is the errno value:
// ENOENT for a missing file, EFBIG for one longer than `max_bytes`, EINVAL for a file
// that is not a regular file. Safe from any thread.
std::optional<Error> ReadSmallFile(const std::string& path, std::size_t max_bytes,
                                   std::string& out);

}  // namespace qn
