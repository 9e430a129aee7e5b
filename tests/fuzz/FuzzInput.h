#pragma once

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <string_view>

namespace qn::fuzz {

// Ends the run with a crash report when an expectation does not hold.
inline void Check(bool ok) {
  if (!ok) std::abort();
}

// A folder of this process's own for input files, made on first use and removed at exit.
inline const std::string& Folder() {
  static const struct Temporary {
    std::string path = "/tmp/qn-fuzz-XXXXXX";
    Temporary() { Check(::mkdtemp(path.data()) != nullptr); }
    ~Temporary() { std::filesystem::remove_all(path); }
  } folder;
  return folder.path;
}

// Writes `input` to `path` whole.
inline void WriteInput(const std::string& path, std::string_view input) {
  std::ofstream(path, std::ios::binary | std::ios::trunc).write(input.data(), input.size());
}

}  // namespace qn::fuzz
