#pragma once

#include <cstdint>
#include <string>

namespace qn {

// An error as the service reports it: a domain, an integer code and a human-readable
// description (what the platform calls the localized description).
struct Error {
  std::string domain;
  std::int64_t code = 0;
  std::string description;

  // "<description>" when there is one, else "<domain> error <code>".
  std::string Description() const {
    if (!description.empty()) return description;
    return domain + " error " + std::to_string(code);
  }
};

// Makes an Error from an errno value, in the "posix" domain, with strerror's text
// prefixed by what was being done: ErrnoError("open /x", ENOENT).
Error ErrnoError(const std::string& what, int errnum);

}  // namespace qn
