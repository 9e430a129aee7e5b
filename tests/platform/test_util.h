#pragma once

#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <filesystem>
#include <mutex>
#include <string>
#include <vector>

namespace qn::testing {

// How long a test waits for something that should happen at once. Generous on purpose:
// it only bounds a failing test, it never measures anything.
inline constexpr std::chrono::seconds kPatience{30};

// A counter that threads bump and a test waits on.
class Counter {
 public:
  void Add(int n = 1) {
    std::lock_guard lock(mu_);
    value_ += n;
    cv_.notify_all();
  }
  int value() const {
    std::lock_guard lock(mu_);
    return value_;
  }
  // Waits until the counter reaches `target`; false when patience runs out.
  bool WaitFor(int target, std::chrono::steady_clock::duration patience = kPatience) const {
    std::unique_lock lock(mu_);
    return cv_.wait_for(lock, patience, [&] { return value_ >= target; });
  }

 private:
  mutable std::mutex mu_;
  mutable std::condition_variable cv_;
  int value_ = 0;
};

// A fresh temporary directory, removed with everything in it at the end of the test.
class TempDir {
 public:
  TempDir() {
    std::string tmpl = (std::filesystem::temp_directory_path() / "qn-platform-XXXXXX").string();
    std::vector<char> buf(tmpl.begin(), tmpl.end());
    buf.push_back('\0');
    if (mkdtemp(buf.data()) == nullptr) std::abort();
    path_ = buf.data();
  }
  ~TempDir() {
    std::error_code ec;
    std::filesystem::remove_all(path_, ec);
  }
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  const std::filesystem::path& path() const { return path_; }
  std::string str() const { return path_.string(); }

 private:
  std::filesystem::path path_;
};

}  // namespace qn::testing
