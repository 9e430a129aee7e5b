#include "platform/linux/export/device_id.h"

#include <systemd/sd-id128.h>

#include <cstring>

#include "common/Files.h"
#include "platform/linux/small_file.h"

namespace qn {
namespace {

// The application key the machine ID is hashed with: IDs of other programs on the same
// machine cannot be linked to these.
constexpr sd_id128_t kExportAppId =
    SD_ID128_MAKE(6b, 1e, 0c, 5d, 94, 27, 4f, 3a, 8e, 61, d2, 0f, 37, b5, 9c, 48);

constexpr const char* kDeviceIdFile = "export-device-id";

bool IsHex32(std::string_view text) {
  return text.size() == 32 && text.find_first_not_of("0123456789abcdef") == std::string::npos;
}

}  // namespace

bool IsValidDeviceId(std::string_view id) {
  return !id.empty() && id.size() <= 64 &&
         id.find_first_not_of("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789-_") ==
             std::string_view::npos;
}

std::optional<std::string> ExportDeviceId(const std::string& state_dir, Error* error) {
  char text[SD_ID128_STRING_MAX];
  sd_id128_t id;
  if (sd_id128_get_machine_app_specific(kExportAppId, &id) == 0) {
    return std::string(sd_id128_to_string(id, text));
  }
  const std::string path = state_dir + "/" + kDeviceIdFile;
  std::string kept;
  ReadSmallFile(path, 128, kept);  // missing or unreadable: a new one is made
  while (!kept.empty() && kept.back() == '\n') kept.pop_back();
  if (IsHex32(kept)) return kept;
  int rc = sd_id128_randomize(&id);
  if (rc == 0) {
    std::string made = sd_id128_to_string(id, text);
    if (auto failure = WriteFileAtomically(path, made + "\n")) {
      if (error) *error = *failure;
      return std::nullopt;
    }
    return made;
  }
  if (error) *error = Error{"com.norvel.quenta.export", -rc, std::strerror(-rc)};
  return std::nullopt;
}

}  // namespace qn
