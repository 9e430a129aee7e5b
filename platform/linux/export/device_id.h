#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "common/Error.h"

namespace qn {

// Whether `id` can be a device ID given with --device-id: 1 to 64 letters, digits, '-' or
// '_' (it becomes a subject token and a part of every message ID, which use '.' and ':').
bool IsValidDeviceId(std::string_view id);

// This device's ID for export: /etc/machine-id hashed with an application-specific key
// (32 hex digits; the machine ID itself is never shown), or, where the machine has no
// machine ID (some containers), a random ID made once and kept in
// `<state_dir>/export-device-id`. Returns the error when neither can be had.
std::optional<std::string> ExportDeviceId(const std::string& state_dir, Error* error);

}  // namespace qn
