#pragma once

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

namespace qn::testing {

// A fresh folder under the system's temporary folder, removed with everything in it. Aborts
// the test program when no folder can be made (nothing hermetic would follow).
class TempDir {
 public:
  TempDir() : path_((std::filesystem::temp_directory_path() / "qn-test-XXXXXX").string()) {
    if (mkdtemp(path_.data()) == nullptr) std::abort();
  }
  ~TempDir() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;
  const std::string& path() const { return path_; }
  std::string File(const std::string& name) const { return path_ + "/" + name; }  // below it

 private:
  std::string path_;
};

// The whole content of a file ("" when it cannot be read).
inline std::string ReadFileText(const std::string& path) {
  std::ostringstream text;
  text << std::ifstream(path, std::ios::binary).rdbuf();
  return text.str();
}

}  // namespace qn::testing
