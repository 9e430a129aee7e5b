#pragma once

#include <memory>
#include <string>

#include "platform/ostrel.h"

namespace qn {

// I/O statistics over a counter tree: <root>/<group>/<subgroup>/<channel> is a file that
// holds one integer (blanks and a trailing newline allowed; values above INT64_MAX wrap, as
// unsigned kernel counters do). The daemon's --driver-stats names the root.
//
// Channel descriptions and samples are dictionaries keyed by the channel path
// "group/subgroup/channel", in path order. A description entry is {"group", "subgroup",
// "name"}; a sample entry is {"name": channel, "value": integer}. A delta entry is the
// later value minus the earlier one (wrapping, as counters do).
//
// Lookups: an absent group or subgroup matches every folder at that level; entries whose
// names start with "." are skipped. The result is nullopt when no matching subgroup folder
// exists (a missing root has no channels), else a dictionary, possibly empty.
//
// Error codes (errno values):
//   listing a folder failed: that errno (the channels found elsewhere are still returned)
//   more than 4096 channels in one lookup: E2BIG (the first 4096 are returned)
//   sampling with a null subscription: EBADF
//   a description or sample that this library did not make: EINVAL
//   a counter file that cannot be read: that errno (ENOENT when it went away)
//   a counter file that does not hold one integer: EBADMSG
//   a delta whose earlier sample is absent or lacks a channel of the later one: ENODATA
// Safe to call from any thread; nothing is cached between calls.
std::shared_ptr<Ostrel> NewLinuxOstrel(std::string root);

}  // namespace qn
